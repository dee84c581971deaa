// Feeds arbitrary bytes to the wire codec three ways (as one request body, as one reply body, and
// as a stream of frames) and aborts on any broken invariant:
//  - nothing throws;
//  - the byte scan agrees with nlohmann's parser on what is well-formed;
//  - an accepted request re-encodes to bytes that decode to the same request and re-encode
//    identically; a rejected one is answered under the call the scan found;
//  - splitting a stream into other chunks changes none of the frames it yields.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <span>
#include <variant>
#include <vector>

#include "protocol/Codec.h"
#include "protocol/Frame.h"
#include "protocol/MessagePack.h"

namespace {

using namespace tavrin::protocol;
using Bytes = std::vector<uint8_t>;

// Small enough that inputs reach the "length over the limit" path.
constexpr uint32_t kFuzzFrameLimit = 512;
// Largest malformed input handed to nlohmann for comparison: its parser recurses, and a malformed
// input is not depth-checked beyond the point where it broke.
constexpr size_t kMaxCompareSize = 1024;

#define FUZZ_CHECK(condition)                                                            \
  do {                                                                                   \
    if (!(condition)) {                                                                  \
      std::fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, __LINE__, #condition); \
      std::abort();                                                                      \
    }                                                                                    \
  } while (0)

void CheckScanAgainstParser(std::span<const uint8_t> input) {
  // The scan alone decides; the parser must then succeed exactly on what it let through.
  const ScanResult scan = ScanMessagePack(input);
  const DecodedValue decoded = DecodeMessagePack(input);
  FUZZ_CHECK(decoded.value.has_value() == scan.Parsable());
  FUZZ_CHECK(scan.depth <= kMaxNestingDepth + 1);
  FUZZ_CHECK(scan.tooDeep == (scan.depth > kMaxNestingDepth));
  if (scan.WellFormed()) FUZZ_CHECK(scan.offset == input.size());
  if (!scan.WellFormed() && !scan.tooDeep && scan.unsupportedType.empty() && !scan.nonStringKey &&
      input.size() <= kMaxCompareSize) {
    const tavrin::Value parsed =
        tavrin::Value::from_msgpack(input.data(), input.data() + input.size(), true, false);
    FUZZ_CHECK(parsed.is_discarded());
  }
  if (decoded.value) {
    // Encoding a decoded value and decoding it again gives the same bytes again.
    const Bytes once = EncodeMessagePack(*decoded.value);
    const DecodedValue again = DecodeMessagePack(once);
    FUZZ_CHECK(again.value.has_value());
    FUZZ_CHECK(EncodeMessagePack(*again.value) == once);
  }
}

void CheckRequest(std::span<const uint8_t> body) {
  const ScanResult scan = ScanMessagePack(body);
  auto decoded = DecodeRequest(body);
  if (auto* request = std::get_if<Request>(&decoded)) {
    FUZZ_CHECK(scan.Parsable());
    const Bytes encoded = EncodeRequest(*request);
    auto again = DecodeRequest(encoded);
    auto* same = std::get_if<Request>(&again);
    FUZZ_CHECK(same != nullptr);
    FUZZ_CHECK(same->call == request->call);
    FUZZ_CHECK(same->op() == request->op());
    FUZZ_CHECK(EncodeRequest(*same) == encoded);
    return;
  }
  const RequestError& error = std::get<RequestError>(decoded);
  FUZZ_CHECK(!error.reason.empty());
  if (error.kind == RequestError::Kind::kCloseConnection) {
    const bool callUsable =
        scan.first == ScanResult::First::kNil || scan.first == ScanResult::First::kUnsigned;
    FUZZ_CHECK(!scan.WellFormed() || !scan.topLevelArraySize || *scan.topLevelArraySize < 2 ||
               !callUsable);
    FUZZ_CHECK(!EncodeRejectReply(error).has_value());
    return;
  }
  FUZZ_CHECK(scan.WellFormed());
  const auto code = static_cast<int64_t>(error.code);
  FUZZ_CHECK(code >= 1 && code <= 6);
  if (scan.first == ScanResult::First::kNil) {
    FUZZ_CHECK(!error.call.has_value());
    FUZZ_CHECK(!EncodeRejectReply(error).has_value());
    return;
  }
  FUZZ_CHECK(scan.first == ScanResult::First::kUnsigned);
  FUZZ_CHECK(error.call == scan.firstValue);
  const auto reply = EncodeRejectReply(error);
  FUZZ_CHECK(reply.has_value());
  auto decodedReply = DecodeReply(*reply);
  auto* r = std::get_if<Reply>(&decodedReply);
  FUZZ_CHECK(r != nullptr);
  FUZZ_CHECK(r->call == scan.firstValue);
  FUZZ_CHECK(r->status == Status::kRejected);
  const tavrin::OptionalError replyError = ReplyError(*r);
  FUZZ_CHECK(replyError && replyError->code == code && replyError->domain == kProtocolErrorDomain);
}

void CheckReply(std::span<const uint8_t> body) {
  auto decoded = DecodeReply(body);
  auto* reply = std::get_if<Reply>(&decoded);
  if (reply == nullptr) return;
  // The accessors take any value without throwing.
  (void)BoolReplyValue(reply->value);
  (void)ServiceTypeReplyValue(reply->value);
  (void)ValidityReplyValue(reply->value);
  (void)ReportersReplyValue(reply->value);
  const tavrin::OptionalError error = ReplyError(*reply);
  FUZZ_CHECK(error.has_value() == (reply->status != Status::kOk));
}

struct StreamOutcome {
  std::vector<Bytes> frames;
  FrameReader::Status last = FrameReader::Status::kNeedMore;
  bool insideFrame = false;
  bool operator==(const StreamOutcome&) const = default;
};

// Reads `input` as a stream delivered in chunks whose sizes come from `chunkSizes` in turn.
StreamOutcome ReadStream(std::span<const uint8_t> input, std::span<const uint8_t> chunkSizes) {
  FrameReader reader(kFuzzFrameLimit);
  StreamOutcome outcome;
  size_t pos = 0;
  size_t turn = 0;
  while (pos < input.size() && outcome.last != FrameReader::Status::kBadLength) {
    size_t chunk = input.size() - pos;
    if (!chunkSizes.empty())
      chunk = std::min<size_t>(chunk, 1 + chunkSizes[turn++ % chunkSizes.size()] % 16);
    reader.Append(input.subspan(pos, chunk));
    pos += chunk;
    for (;;) {
      outcome.last = reader.Next();
      if (outcome.last != FrameReader::Status::kFrame) break;
      FUZZ_CHECK(!reader.Body().empty() && reader.Body().size() <= kFuzzFrameLimit);
      outcome.frames.emplace_back(reader.Body().begin(), reader.Body().end());
    }
  }
  outcome.insideFrame = reader.InsideFrame();
  return outcome;
}

void CheckStream(std::span<const uint8_t> input) {
  const StreamOutcome whole = ReadStream(input, {});
  const StreamOutcome chunked = ReadStream(input, input);
  FUZZ_CHECK(whole == chunked);
  for (const Bytes& frame : whole.frames) {
    CheckRequest(frame);
    // Framing a body again gives a frame that reads back as that body.
    FrameReader reader(kFuzzFrameLimit);
    reader.Append(EncodeFrame(frame));
    FUZZ_CHECK(reader.Next() == FrameReader::Status::kFrame);
    FUZZ_CHECK(Bytes(reader.Body().begin(), reader.Body().end()) == frame);
    FUZZ_CHECK(!reader.InsideFrame());
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::span<const uint8_t> input(data, size);
  try {
    CheckScanAgainstParser(input);
    CheckRequest(input);
    CheckReply(input);
    CheckStream(input);
  } catch (const std::exception& e) {
    std::fprintf(stderr, "codec threw: %s\n", e.what());
    std::abort();
  }
  return 0;
}
