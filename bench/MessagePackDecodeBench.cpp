// Our MessagePack decoder against msgpack-cxx, on the same sendMessage (op 6) request bodies, each
// side ending in what the service works with: a Request whose message is a Dictionary.
//
//   BM_Ours_DecodeRequest          protocol::DecodeRequest, as the listener calls it
//   BM_MsgpackCxx_DecodeRequest    msgpack::unpack (strings referenced, not copied, into a fresh
//                                  zone per request), then the same checks and the same Request
//   BM_MsgpackCxx_ReusedZone_...   the same with one zone cleared between requests
//   BM_Ours_DecodeValue            DecodeMessagePack: the whole body as one Value, no Request
//   BM_MsgpackCxx_DecodeValue      unpack and convert the whole body to one Value, no Request
//   BM_Ours_ScanOnly               ScanMessagePack alone (the validation pass, nothing built)
//   BM_MsgpackCxx_UnpackOnly       msgpack::unpack alone (its object tree, no Value)
//
// Each runs on a typical message (5 entries) and a large one (40 entries, a nested array and a
// nested dictionary). Before timing, every msgpack-cxx benchmark decodes its body both ways and
// skips with an error unless the two results are equal down to key order and integer signedness.
//
//   build/<dir>/bench/MessagePackDecodeBench --benchmark_repetitions=7
//       --benchmark_report_aggregates_only=true

#include <benchmark/benchmark.h>

#include <msgpack.hpp>

#include <algorithm>
#include <cstdint>
#include <exception>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

#include "base/Dictionary.h"
#include "protocol/Codec.h"
#include "protocol/MessagePack.h"

namespace tavrin {
namespace {

using protocol::Request;
using protocol::RequestLimits;
using protocol::SendMessage;

constexpr uint32_t kCategory = 0x80000001;
constexpr uint16_t kType = 1;
constexpr int64_t kReporterID = 1000;

// What most clients send: a timestamp, two numbers, two short strings.
Dictionary TypicalPayload() {
  Dictionary payload = Dictionary::object();
  payload["ruvoreporting_timestamp"] = uint64_t{1794806865123};
  payload["underruns"] = 3;
  payload["latency_ms"] = 12.75;
  payload["device"] = "hw:0,0";
  payload["route"] = "Speaker";
  return payload;
}

// A large message: 40 entries of every scalar kind, one of them an array and one a dictionary.
Dictionary LargePayload() {
  Dictionary payload = Dictionary::object();
  payload["ruvoreporting_timestamp"] = uint64_t{1794806865123};
  for (int i = 0; i < 37; ++i) {
    const std::string key = "counter_" + std::to_string(i);
    switch (i % 5) {
      case 0:
        payload[key] = uint64_t{1000} * static_cast<uint64_t>(i);
        break;
      case 1:
        payload[key] = -i;
        break;
      case 2:
        payload[key] = 0.25 * i;
        break;
      case 3:
        payload[key] = i % 2 == 0;
        break;
      default:
        payload[key] = "value " + std::to_string(i);
        break;
    }
  }
  payload["buffer_sizes"] = Value::array({64, 128, 256, 512, 1024, 2048});
  Dictionary route = Dictionary::object();
  route["name"] = "Speaker";
  route["channels"] = 2;
  route["rate"] = 48000;
  route["volumes_db"] = Value::array({-6.5, -6.5});
  payload["route"] = std::move(route);
  return payload;
}

// The op 6 frame body the client library writes for `payload`: no reply wanted, one reporter.
std::vector<uint8_t> RequestBody(const Dictionary& payload) {
  return protocol::EncodeRequest(
      Request{std::nullopt, SendMessage{payload, kCategory, kType, std::vector{kReporterID}}});
}

const std::vector<uint8_t>& Body(int64_t shape) {
  static const std::vector<uint8_t> typical = RequestBody(TypicalPayload());
  static const std::vector<uint8_t> large = RequestBody(LargePayload());
  return shape == 0 ? typical : large;
}

std::optional<Request> OursDecodeRequest(std::span<const uint8_t> body) {
  auto decoded = protocol::DecodeRequest(body);
  if (auto* request = std::get_if<Request>(&decoded)) return std::move(*request);
  return std::nullopt;
}

// ---- msgpack-cxx, brought to the same result -------------------------------------------------

// Strings point into the body instead of being copied into the zone; they are copied once, into
// the Value.
bool ReferenceStrings(msgpack::type::object_type type, std::size_t /*size*/, void* /*data*/) {
  return type == msgpack::type::STR;
}

// The bounds our decoder keeps, as far as msgpack-cxx can express them: nesting depth counted the
// same way, and no array or map declaring more elements than a frame may hold in all. (The total
// over the frame is counted by the converter.)
msgpack::unpack_limit UnpackLimit(const RequestLimits& limits) {
  const auto entries = static_cast<std::size_t>(limits.entriesPerFrame);
  return msgpack::unpack_limit(entries, entries, 0xffffffff, 0xffffffff, 0xffffffff,
                               protocol::kMaxNestingDepth);
}

// msgpack::object -> Value, giving what DecodeMessagePack gives: integers signed or unsigned as
// msgpack-cxx classified them, float32 widened to double, maps in wire order with a repeated key
// keeping its first place and its last value (indexed past the same width as our parser). Fails
// on bin, ext, a map key that is not a string, or more entries than allowed.
class ObjectConverter {
 public:
  explicit ObjectConverter(uint64_t entries) : entriesLeft_(entries) {}

  bool Take(uint64_t entries) {
    if (entries > entriesLeft_) {
      ok_ = false;
    } else {
      entriesLeft_ -= entries;
    }
    return ok_;
  }

  std::optional<Value> Convert(const msgpack::object& object) {
    Value value = Build(object);
    if (!ok_) return std::nullopt;
    return value;
  }

 private:
  static constexpr uint32_t kIndexedMapSize = 16;

  Value Build(const msgpack::object& object) {
    switch (object.type) {
      case msgpack::type::NIL:
        return Value(nullptr);
      case msgpack::type::BOOLEAN:
        return Value(object.via.boolean);
      case msgpack::type::POSITIVE_INTEGER:
        return Value(object.via.u64);
      case msgpack::type::NEGATIVE_INTEGER:
        return Value(object.via.i64);
      case msgpack::type::FLOAT32:
      case msgpack::type::FLOAT64:
        return Value(object.via.f64);
      case msgpack::type::STR:
        return Value(std::string(object.via.str.ptr, object.via.str.size));
      case msgpack::type::ARRAY:
        return BuildArray(object.via.array);
      case msgpack::type::MAP:
        return BuildMap(object.via.map);
      default:  // bin, ext
        ok_ = false;
        return Value();
    }
  }

  Value BuildArray(const msgpack::object_array& array) {
    Value result = Value::array();
    if (!Take(array.size)) return result;
    auto& elements = result.get_ref<Value::array_t&>();
    elements.reserve(array.size);
    for (uint32_t i = 0; i < array.size && ok_; ++i) elements.push_back(Build(array.ptr[i]));
    return result;
  }

  Value BuildMap(const msgpack::object_map& map) {
    Value result = Value::object();
    if (!Take(map.size)) return result;
    auto& pairs = result.get_ref<Value::object_t&>();
    pairs.reserve(map.size);
    const bool indexed = map.size >= kIndexedMapSize;
    std::unordered_map<std::string_view, size_t> index;
    if (indexed) index.reserve(map.size);
    for (uint32_t i = 0; i < map.size && ok_; ++i) {
      const msgpack::object_kv& pair = map.ptr[i];
      if (pair.key.type != msgpack::type::STR) {
        ok_ = false;
        break;
      }
      std::string key(pair.key.via.str.ptr, pair.key.via.str.size);
      Value value = Build(pair.val);
      if (indexed) {
        pairs.emplace_back(std::move(key), std::move(value));
        auto [found, inserted] =
            index.try_emplace(std::string_view(pairs.back().first), pairs.size() - 1);
        if (!inserted) {
          (pairs.begin() + static_cast<std::ptrdiff_t>(found->second))->second =
              std::move(pairs.back().second);
          pairs.pop_back();
        }
      } else {
        auto existing =
            std::find_if(pairs.begin(), pairs.end(), [&](const auto& p) { return p.first == key; });
        if (existing != pairs.end()) {
          existing->second = std::move(value);
        } else {
          pairs.emplace_back(std::move(key), std::move(value));
        }
      }
    }
    return result;
  }

  uint64_t entriesLeft_;
  bool ok_ = true;
};

template <typename T>
std::optional<T> ObjectIntegerAs(const msgpack::object& object) {
  if (object.type == msgpack::type::POSITIVE_INTEGER && std::in_range<T>(object.via.u64)) {
    return static_cast<T>(object.via.u64);
  }
  if (object.type == msgpack::type::NEGATIVE_INTEGER && std::in_range<T>(object.via.i64)) {
    return static_cast<T>(object.via.i64);
  }
  return std::nullopt;
}

// The sendMessage request in `object`, checked as DecodeRequest checks it (shape, call, op,
// argument count and types, the reporter list's bound); nothing for any other op or any fault.
// The bench sends nothing else, so the other ops' arguments are not read here.
std::optional<Request> SendMessageFromObject(const msgpack::object& object,
                                             const RequestLimits& limits) {
  if (object.type != msgpack::type::ARRAY || object.via.array.size < 2) return std::nullopt;
  const msgpack::object_array& items = object.via.array;
  ObjectConverter converter(limits.entriesPerFrame);
  if (!converter.Take(items.size)) return std::nullopt;

  Request request{std::nullopt, SendMessage{}};
  if (items.ptr[0].type == msgpack::type::POSITIVE_INTEGER) {
    request.call = items.ptr[0].via.u64;
  } else if (items.ptr[0].type != msgpack::type::NIL) {
    return std::nullopt;
  }
  const auto op = ObjectIntegerAs<uint8_t>(items.ptr[1]);
  if (op != static_cast<uint8_t>(protocol::Op::kSendMessage) || items.size != 6) {
    return std::nullopt;
  }
  SendMessage& send = std::get<SendMessage>(request.arguments);
  if (items.ptr[2].type != msgpack::type::MAP) return std::nullopt;
  auto message = converter.Convert(items.ptr[2]);
  if (!message) return std::nullopt;
  send.message = std::move(*message);
  const auto category = ObjectIntegerAs<uint32_t>(items.ptr[3]);
  const auto type = ObjectIntegerAs<uint16_t>(items.ptr[4]);
  if (!category || !type) return std::nullopt;
  send.category = *category;
  send.type = *type;
  const msgpack::object& list = items.ptr[5];
  if (list.type == msgpack::type::ARRAY) {
    const msgpack::object_array& ids = list.via.array;
    if (ids.size > limits.reporterIDsPerMessage || !converter.Take(ids.size)) return std::nullopt;
    std::vector<int64_t> reporterIDs;
    reporterIDs.reserve(ids.size);
    for (uint32_t i = 0; i < ids.size; ++i) {
      const auto id = ObjectIntegerAs<int64_t>(ids.ptr[i]);
      if (!id) return std::nullopt;
      reporterIDs.push_back(*id);
    }
    send.reporterIDs = std::move(reporterIDs);
  } else if (list.type != msgpack::type::NIL) {
    return std::nullopt;
  }
  return request;
}

const char* Chars(std::span<const uint8_t> body) {
  return reinterpret_cast<const char*>(body.data());
}

// One fresh zone per request, held by the object_handle, as msgpack-cxx's documentation shows.
std::optional<Request> MsgpackDecodeRequest(std::span<const uint8_t> body,
                                            const RequestLimits& limits = {}) {
  try {
    std::size_t offset = 0;
    const msgpack::object_handle handle = msgpack::unpack(
        Chars(body), body.size(), offset, ReferenceStrings, nullptr, UnpackLimit(limits));
    if (offset != body.size()) return std::nullopt;  // bytes after the value
    return SendMessageFromObject(handle.get(), limits);
  } catch (const std::exception&) {  // malformed, truncated, over a limit
    return std::nullopt;
  }
}

// The same into a zone that outlives the request and is cleared before each one.
std::optional<Request> MsgpackDecodeRequestInZone(msgpack::zone& zone,
                                                  std::span<const uint8_t> body,
                                                  const RequestLimits& limits = {}) {
  try {
    zone.clear();
    std::size_t offset = 0;
    const msgpack::object object = msgpack::unpack(zone, Chars(body), body.size(), offset,
                                                   ReferenceStrings, nullptr, UnpackLimit(limits));
    if (offset != body.size()) return std::nullopt;
    return SendMessageFromObject(object, limits);
  } catch (const std::exception&) {
    return std::nullopt;
  }
}

std::optional<Value> MsgpackDecodeValue(std::span<const uint8_t> body,
                                        const RequestLimits& limits = {}) {
  try {
    std::size_t offset = 0;
    const msgpack::object_handle handle = msgpack::unpack(
        Chars(body), body.size(), offset, ReferenceStrings, nullptr, UnpackLimit(limits));
    if (offset != body.size()) return std::nullopt;
    return ObjectConverter(limits.entriesPerFrame).Convert(handle.get());
  } catch (const std::exception&) {
    return std::nullopt;
  }
}

// ---- equality down to what == lets through --------------------------------------------------

// Equal values of the same kinds: nlohmann's == calls 3 (signed) and 3u equal and would let a
// converter that loses signedness through.
bool SameValue(const Value& a, const Value& b) {
  if (a.type() != b.type()) return false;
  if (a.is_object()) {
    if (a.size() != b.size()) return false;
    auto left = a.items().begin();
    auto right = b.items().begin();
    for (; left != a.items().end(); ++left, ++right) {
      if (left.key() != right.key() || !SameValue(left.value(), right.value())) return false;
    }
    return true;
  }
  if (a.is_array()) {
    if (a.size() != b.size()) return false;
    for (size_t i = 0; i < a.size(); ++i) {
      if (!SameValue(a[i], b[i])) return false;
    }
    return true;
  }
  return a == b;
}

bool SameRequest(const std::optional<Request>& a, const std::optional<Request>& b) {
  if (!a || !b) return false;
  const auto* left = std::get_if<SendMessage>(&a->arguments);
  const auto* right = std::get_if<SendMessage>(&b->arguments);
  return left && right && a->call == b->call && SameValue(left->message, right->message) &&
         left->category == right->category && left->type == right->type &&
         left->reporterIDs == right->reporterIDs;
}

// A request body nested `depth` levels deep: the request array, the message map, then arrays.
std::vector<uint8_t> NestedBody(int depth) {
  Value nested = Value::array();  // level 3
  for (int level = 4; level <= depth; ++level) nested = Value::array({std::move(nested)});
  Dictionary payload = Dictionary::object();
  payload["nested"] = std::move(nested);
  return RequestBody(payload);
}

// Empty when both sides decode `body` to the same request and agree on the edges that matter
// (the nesting bound, bytes after the value); otherwise what differed.
std::string Disagreement(std::span<const uint8_t> body,
                         const std::optional<Request>& msgpackResult) {
  const auto ours = OursDecodeRequest(body);
  if (!ours) return "our decoder rejected the body";
  if (!msgpackResult) return "msgpack-cxx rejected the body";
  if (!SameRequest(ours, msgpackResult)) return "the two decoded requests differ";
  for (int depth : {protocol::kMaxNestingDepth, protocol::kMaxNestingDepth + 1}) {
    const auto nested = NestedBody(depth);
    if (OursDecodeRequest(nested).has_value() != MsgpackDecodeRequest(nested).has_value()) {
      return "the two disagree at nesting depth " + std::to_string(depth);
    }
  }
  if (!OursDecodeRequest(NestedBody(protocol::kMaxNestingDepth)) ||
      OursDecodeRequest(NestedBody(protocol::kMaxNestingDepth + 1))) {
    return "the nesting bound is not where it is documented";
  }
  std::vector<uint8_t> trailing(body.begin(), body.end());
  trailing.push_back(0xc0);
  if (OursDecodeRequest(trailing) || MsgpackDecodeRequest(trailing)) {
    return "a byte after the value was accepted";
  }
  return {};
}

void SetLabel(benchmark::State& state, std::span<const uint8_t> body) {
  state.SetLabel((state.range(0) == 0 ? "typical 5 entries, " : "large 40 entries, ") +
                 std::to_string(body.size()) + " bytes");
}

// ---- benchmarks ----------------------------------------------------------------------------

void BM_Ours_DecodeRequest(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  if (!OursDecodeRequest(body)) state.SkipWithError("our decoder rejected the body");
  for (auto _ : state) {
    auto decoded = protocol::DecodeRequest(body);
    benchmark::DoNotOptimize(decoded);
  }
  SetLabel(state, body);
}

void BM_MsgpackCxx_DecodeRequest(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  if (auto error = Disagreement(body, MsgpackDecodeRequest(body)); !error.empty()) {
    state.SkipWithError(error.c_str());
  }
  for (auto _ : state) {
    auto decoded = MsgpackDecodeRequest(body);
    benchmark::DoNotOptimize(decoded);
  }
  SetLabel(state, body);
}

void BM_MsgpackCxx_ReusedZone_DecodeRequest(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  msgpack::zone zone;
  if (auto error = Disagreement(body, MsgpackDecodeRequestInZone(zone, body)); !error.empty()) {
    state.SkipWithError(error.c_str());
  }
  for (auto _ : state) {
    auto decoded = MsgpackDecodeRequestInZone(zone, body);
    benchmark::DoNotOptimize(decoded);
  }
  SetLabel(state, body);
}

void BM_Ours_DecodeValue(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  if (!protocol::DecodeMessagePack(body).value) state.SkipWithError("our decoder failed");
  for (auto _ : state) {
    auto decoded = protocol::DecodeMessagePack(body, RequestLimits::kDefaultEntriesPerFrame);
    benchmark::DoNotOptimize(decoded);
  }
  SetLabel(state, body);
}

void BM_MsgpackCxx_DecodeValue(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  const auto ours = protocol::DecodeMessagePack(body).value;
  const auto theirs = MsgpackDecodeValue(body);
  if (!ours || !theirs || !SameValue(*ours, *theirs)) {
    state.SkipWithError("the two decoded values differ");
  }
  for (auto _ : state) {
    auto decoded = MsgpackDecodeValue(body);
    benchmark::DoNotOptimize(decoded);
  }
  SetLabel(state, body);
}

void BM_Ours_ScanOnly(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  if (!protocol::ScanMessagePack(body).Parsable()) state.SkipWithError("scan refused the body");
  for (auto _ : state) {
    auto scan = protocol::ScanMessagePack(body);
    benchmark::DoNotOptimize(scan);
  }
  SetLabel(state, body);
}

void BM_MsgpackCxx_UnpackOnly(benchmark::State& state) {
  const auto& body = Body(state.range(0));
  const RequestLimits limits;
  if (!MsgpackDecodeValue(body)) state.SkipWithError("msgpack-cxx refused the body");
  for (auto _ : state) {
    std::size_t offset = 0;
    msgpack::object_handle handle = msgpack::unpack(Chars(body), body.size(), offset,
                                                    ReferenceStrings, nullptr, UnpackLimit(limits));
    benchmark::DoNotOptimize(handle);
  }
  SetLabel(state, body);
}

// Argument 0: the typical message; 1: the large one.
BENCHMARK(BM_Ours_DecodeRequest)->Arg(0)->Arg(1);
BENCHMARK(BM_MsgpackCxx_DecodeRequest)->Arg(0)->Arg(1);
BENCHMARK(BM_MsgpackCxx_ReusedZone_DecodeRequest)->Arg(0)->Arg(1);
BENCHMARK(BM_Ours_DecodeValue)->Arg(0)->Arg(1);
BENCHMARK(BM_MsgpackCxx_DecodeValue)->Arg(0)->Arg(1);
BENCHMARK(BM_Ours_ScanOnly)->Arg(0)->Arg(1);
BENCHMARK(BM_MsgpackCxx_UnpackOnly)->Arg(0)->Arg(1);

}  // namespace
}  // namespace tavrin

BENCHMARK_MAIN();
