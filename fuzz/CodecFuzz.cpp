// Feeds arbitrary bytes to the wire codec as one request body and as one reply body, and aborts
// on any broken invariant (framing is FrameTest's: byte at a time, in one chunk, at the limits):
//  - nothing throws;
//  - the byte scan agrees with nlohmann's parser on what is well-formed;
//  - an accepted request re-encodes to bytes that decode to the same request and re-encode
//    identically; a rejected one is answered under the call the scan found.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <span>
#include <variant>
#include <vector>

#include "protocol/Codec.h"
#include "protocol/MessagePack.h"

namespace {

using namespace tavrin::protocol;
using Bytes = std::vector<uint8_t>;

// Largest malformed input handed to nlohmann for comparison: its parser recurses, and a malformed
// input is not depth-checked beyond the point where it broke.
constexpr size_t kMaxCompareSize = 1024;

[[noreturn]] void Fail(const char* condition, int line) {
  std::fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, line, condition);
  std::abort();
}
#define FUZZ_CHECK(condition) ((condition) ? void() : Fail(#condition, __LINE__))

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

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::span<const uint8_t> input(data, size);
  try {
    CheckScanAgainstParser(input);
    CheckRequest(input);
    CheckReply(input);
  } catch (const std::exception& e) {
    std::fprintf(stderr, "codec threw: %s\n", e.what());
    std::abort();
  }
  return 0;
}
