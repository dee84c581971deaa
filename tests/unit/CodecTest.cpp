#include "protocol/Codec.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "protocol/MessagePack.h"
#include "tests/support/MessagePackBytes.h"

namespace tavrin::protocol {
namespace {

using Bytes = std::vector<uint8_t>;
using tavrin::testing::IntFormat;
using tavrin::testing::Pack;

constexpr int64_t kInt64Min = std::numeric_limits<int64_t>::min();
constexpr int64_t kInt64Max = std::numeric_limits<int64_t>::max();
constexpr uint64_t kUint64Max = std::numeric_limits<uint64_t>::max();

// What a decoding gave instead of the alternative a test expected.
std::string Why(const RequestError& error) { return "refused: " + error.reason; }
std::string Why(const std::string& reason) { return "refused: " + reason; }
std::string Why(const Request&) { return "accepted"; }
std::string Why(const Reply&) { return "accepted"; }

// The `T` alternative of a decoding, or a test failure saying what came instead.
template <typename T, typename Decoded>
T Expect(Decoded decoded) {
  if (T* value = std::get_if<T>(&decoded)) return std::move(*value);
  std::visit([](const auto& other) { ADD_FAILURE() << Why(other); }, decoded);
  return T{};
}

Request Accepted(std::span<const uint8_t> body) { return Expect<Request>(DecodeRequest(body)); }
RequestError Refused(std::span<const uint8_t> body) {
  return Expect<RequestError>(DecodeRequest(body));
}
Reply DecodedReply(const Bytes& body) { return Expect<Reply>(DecodeReply(body)); }

// A request with call 77 and `op`, `args` elements following (their bytes in `argBytes`).
Bytes RequestBytes(uint64_t args, Pack op, const Bytes& argBytes) {
  return Pack().array(2 + args).uint(77).append(op).append(argBytes);
}

Bytes Nested(int levels) {
  Pack pack;
  for (int i = 0; i < levels; ++i) pack.array(1);
  return pack.nil();
}

// ---------------------------------------------------------------------------------------------
// Accepted requests

std::vector<Request> EveryRequest() {
  Dictionary message = Dictionary::object();
  message["volume"] = 0.5;
  message["route"] = "speaker";
  message["counts"] = Value::array({1, -2, kUint64Max});
  message["nested"] = {{"on", true}, {"none", nullptr}};
  Dictionary configuration = Dictionary::object();
  configuration["device_name"] = "dock";
  return {
      {0, CreateReportingSession{kInt64Min}},
      {1, SetServiceType{0xffff, kInt64Max}},
      {kUint64Max, GetServiceNameForReporterID{0}},
      {std::nullopt, SetConfiguration{configuration, -1}},
      {5, SetConfiguration{Dictionary::object(), 9}},
      {6, StartReportingSessionForID{42}},
      {7, SendMessage{message, 0xffffffff, 0xffff, std::nullopt}},
      {8, SendMessage{message, 0x80000001, 1, std::vector<int64_t>{}}},
      {9, SendMessage{Dictionary::object(), 0, 0, std::vector<int64_t>{kInt64Min, 0, kInt64Max}}},
      {std::nullopt, StopReportingSessionForID{3}},
      {11, DestroyReportingSession{-3}},
      {12, ReporterIDValid{kInt64Max}},
      {13, GetAllReporters{}},
      {std::nullopt, KillService{}},
      {14, GetStatus{}},
  };
}

TEST(CodecTest, EveryRequestRoundTrips) {
  for (const Request& request : EveryRequest()) {
    const Bytes body = EncodeRequest(request);
    const Request decoded = Accepted(body);
    EXPECT_EQ(decoded, request) << "op " << static_cast<int>(request.op());
    EXPECT_EQ(decoded.op(), request.op());
    EXPECT_EQ(EncodeRequest(decoded), body);
  }
}

TEST(CodecTest, RequestWireFormIsCallOpThenArgumentsInOrder) {
  EXPECT_EQ(EncodeRequest({7, CreateReportingSession{5}}),
            Pack().array(3).uint(7).uint(1).uint(5).bytes());
  EXPECT_EQ(EncodeRequest({std::nullopt, SetServiceType{3, -2}}),
            Pack().array(4).nil().uint(2).uint(3).integer(IntFormat::kNegativeFixint, -2).bytes());
  EXPECT_EQ(EncodeRequest({1, SendMessage{Dictionary::object(), 65536, 2, std::nullopt}}),
            Pack().array(6).uint(1).uint(6).map(0).uint(65536).uint(2).nil().bytes());
  EXPECT_EQ(EncodeRequest({2, GetAllReporters{}}), Pack().array(2).uint(2).uint(10).bytes());
}

// ---------------------------------------------------------------------------------------------
// Integers at every format's edges, in every argument position that takes an integer

struct IntegerCase {
  IntFormat format;
  uint64_t bits;  // two's complement of the value
  bool fitsInt64;
  bool fitsUint16;
  bool fitsUint32;
};

std::vector<IntegerCase> IntegerCases() {
  const auto neg = [](int64_t v) { return static_cast<uint64_t>(v); };
  return {
      {IntFormat::kPositiveFixint, 0, true, true, true},
      {IntFormat::kPositiveFixint, 127, true, true, true},
      {IntFormat::kNegativeFixint, neg(-1), true, false, false},
      {IntFormat::kNegativeFixint, neg(-32), true, false, false},
      {IntFormat::kUint8, 255, true, true, true},
      {IntFormat::kUint16, 65535, true, true, true},
      {IntFormat::kUint32, 65536, true, false, true},
      {IntFormat::kUint32, 4294967295, true, false, true},
      {IntFormat::kUint64, 65535, true, true, true},
      {IntFormat::kUint64, 4294967296, true, false, false},
      {IntFormat::kUint64, static_cast<uint64_t>(kInt64Max), true, false, false},
      {IntFormat::kUint64, static_cast<uint64_t>(kInt64Max) + 1, false, false, false},
      {IntFormat::kUint64, kUint64Max, false, false, false},
      {IntFormat::kInt8, neg(-128), true, false, false},
      {IntFormat::kInt16, neg(-32768), true, false, false},
      {IntFormat::kInt32, neg(std::numeric_limits<int32_t>::min()), true, false, false},
      {IntFormat::kInt32, 65535, true, true, true},
      {IntFormat::kInt32, 65536, true, false, true},
      {IntFormat::kInt32, 2147483647, true, false, true},
      {IntFormat::kInt64, neg(kInt64Min), true, false, false},
      {IntFormat::kInt64, 4294967295, true, false, true},
      {IntFormat::kInt64, 4294967296, true, false, false},
      {IntFormat::kInt64, static_cast<uint64_t>(kInt64Max), true, false, false},
  };
}

// The arguments of `body` when it `fits`; otherwise expects it refused with code 4 and call 77.
std::optional<Arguments> FitsOrOutOfRange(const Bytes& body, bool fits) {
  if (fits) return Accepted(body).arguments;
  const RequestError error = Refused(body);
  EXPECT_EQ(error.kind, RequestError::Kind::kReject);
  EXPECT_EQ(error.code, RejectCode::kIntegerOutOfRange) << error.reason;
  EXPECT_EQ(error.call, 77u);
  return std::nullopt;
}

TEST(CodecTest, IntegersAtEveryFormatsEdgesFitTheirArgumentTypeByValue) {
  for (const IntegerCase& c : IntegerCases()) {
    SCOPED_TRACE("format " + std::to_string(static_cast<int>(c.format)) + " bits " +
                 std::to_string(c.bits));
    const Bytes n = Pack().integer(c.format, c.bits);
    // In each integer argument, with the value that arrives: reporterID (signed 64-bit),
    // serviceType (unsigned 16-bit; type converts the same way), category (unsigned 32-bit) and an
    // element of reporterIDs.
    if (auto a = FitsOrOutOfRange(RequestBytes(1, Pack().uint(1), n), c.fitsInt64)) {
      EXPECT_EQ(std::get<CreateReportingSession>(*a).reporterID, static_cast<int64_t>(c.bits));
    }
    if (auto a = FitsOrOutOfRange(RequestBytes(2, Pack().uint(2), Pack().append(n).uint(1)),
                                  c.fitsUint16)) {
      EXPECT_EQ(std::get<SetServiceType>(*a).serviceType, static_cast<uint16_t>(c.bits));
    }
    if (auto a = FitsOrOutOfRange(
            RequestBytes(4, Pack().uint(6), Pack().map(0).append(n).uint(0).nil()), c.fitsUint32)) {
      EXPECT_EQ(std::get<SendMessage>(*a).category, static_cast<uint32_t>(c.bits));
    }
    const Bytes ids =
        RequestBytes(4, Pack().uint(6), Pack().map(0).uint(0).uint(0).array(2).uint(1).append(n));
    if (auto a = FitsOrOutOfRange(ids, c.fitsInt64)) {
      EXPECT_EQ(std::get<SendMessage>(*a).reporterIDs,
                (std::vector<int64_t>{1, static_cast<int64_t>(c.bits)}));
    }

    // As the call: any integer >= 0 is echoed, a negative one makes the frame undecodable.
    const bool negative = c.format == IntFormat::kNegativeFixint ||
                          (c.format >= IntFormat::kInt8 && static_cast<int64_t>(c.bits) < 0);
    const Bytes asCall = Pack().array(2).append(n).uint(10);
    if (negative) {
      EXPECT_EQ(Refused(asCall).kind, RequestError::Kind::kCloseConnection);
    } else {
      EXPECT_EQ(Accepted(asCall).call, c.bits);
    }
  }
}

// ---------------------------------------------------------------------------------------------
// Rejections: status 2 with the call echoed

struct RejectCase {
  std::string name;
  Bytes body;
  RejectCode code;
  std::string reason = "";  // checked when given
};

// One row per branch that rejects (integers out of range: the integer table above), with the
// reason for one of each kind.
std::vector<RejectCase> RejectCases() {
  using C = RejectCode;
  return {
      // 1: op not an integer from 1 to 12
      {"op 0", RequestBytes(0, Pack().uint(0), {}), C::kUnknownOp},
      {"op 13", RequestBytes(0, Pack().uint(13), {}), C::kUnknownOp, "unknown operation 13"},
      {"op 2^64-1", RequestBytes(0, Pack().uint(kUint64Max), {}), C::kUnknownOp},
      {"op -1", RequestBytes(0, Pack().integer(IntFormat::kNegativeFixint, -1), {}), C::kUnknownOp},
      {"op \"1\"", RequestBytes(1, Pack().str("1"), Pack().uint(1)), C::kUnknownOp},
      // 2: argument count, one short and one over
      {"create without ID", RequestBytes(0, Pack().uint(1), {}), C::kWrongArgumentCount},
      {"create with 2", RequestBytes(2, Pack().uint(1), Pack().uint(1).uint(2)),
       C::kWrongArgumentCount, "createReportingSession:reply: takes 1 argument(s), got 2"},
      // 3: argument of the wrong type
      {"reporterID string", RequestBytes(1, Pack().uint(1), Pack().str("5")), C::kWrongArgumentType,
       "argument 1 (reporterID) of createReportingSession:reply: is a string, not an integer"},
      {"serviceType 70000", RequestBytes(2, Pack().uint(2), Pack().uint(70000).uint(1)),
       C::kIntegerOutOfRange,
       "argument 1 (serviceType) of setServiceType:reportingSession:reply:: 70000 does not fit an "
       "unsigned 16-bit integer"},
      {"configuration array", RequestBytes(2, Pack().uint(4), Pack().array(0).uint(1)),
       C::kWrongArgumentType},
      {"reporterIDs map", RequestBytes(4, Pack().uint(6), Pack().map(0).uint(1).uint(1).map(0)),
       C::kWrongArgumentType},
      {"reporterIDs element float",
       RequestBytes(4, Pack().uint(6), Pack().map(0).uint(1).uint(1).array(2).uint(1).float64(2)),
       C::kWrongArgumentType},
      {"integer map key",
       RequestBytes(4, Pack().uint(6), Pack().map(1).uint(1).str("v").uint(1).uint(1).nil()),
       C::kWrongArgumentType},
      // 5: nesting
      {"65 levels", RequestBytes(1, Pack().uint(1), Nested(64)), C::kTooDeep},
      // 6: bin and ext
      {"bin8 in a message",
       RequestBytes(4, Pack().uint(6),
                    Pack().map(1).str("b").raw({0xc4, 1, 0}).uint(1).uint(1).nil()),
       C::kUnsupportedType},
  };
}

TEST(CodecTest, EveryRejectionIsAnsweredWithItsCodeAndTheCall) {
  for (const RejectCase& c : RejectCases()) {
    const RequestError error = Refused(c.body);
    EXPECT_EQ(error.kind, RequestError::Kind::kReject) << c.name << ": " << error.reason;
    EXPECT_EQ(error.code, c.code) << c.name << ": " << error.reason;
    EXPECT_EQ(error.call, 77u) << c.name;
    EXPECT_FALSE(error.reason.empty()) << c.name;
    EXPECT_TRUE(c.reason.empty() || error.reason == c.reason) << error.reason;

    // The reply a client receives for it.
    const auto replyBody = EncodeRejectReply(error);
    ASSERT_TRUE(replyBody) << c.name;
    auto reply = DecodeReply(*replyBody);
    ASSERT_TRUE(std::holds_alternative<Reply>(reply)) << c.name;
    const Reply& r = std::get<Reply>(reply);
    EXPECT_EQ(r.call, 77u);
    EXPECT_EQ(r.status, Status::kRejected);
    EXPECT_EQ(r.value["domain"], "com.quorvex.tavrin.protocol");
    EXPECT_EQ(r.value["code"], static_cast<int64_t>(c.code));
    EXPECT_EQ(r.value["reason"], error.reason);
  }
}

TEST(CodecTest, RejectionOfANilCallSendsNothing) {
  const RequestError error = Refused(Pack().array(2).nil().uint(99));
  EXPECT_EQ(error.kind, RequestError::Kind::kReject);
  EXPECT_EQ(error.code, RejectCode::kUnknownOp);
  EXPECT_FALSE(error.call.has_value());
  EXPECT_FALSE(EncodeRejectReply(error).has_value());
}

// ---------------------------------------------------------------------------------------------
// Nesting

// [call, 6, message, 0, 0, nil] whose message holds arrays down to `depth` in all.
Bytes SendWithDepth(int depth) {
  // The request array is level 1 and the message map level 2.
  Pack message;
  message.map(1).str("deep");
  for (int i = 0; i < depth - 2; ++i) message.array(1);
  message.uint(1);
  return RequestBytes(4, Pack().uint(6), Pack().append(message).uint(0).uint(0).nil());
}

TEST(CodecTest, NestingOfExactlyTheLimitIsAccepted) {
  const Request request = Accepted(SendWithDepth(kMaxNestingDepth));
  const Value* v = &std::get<SendMessage>(request.arguments).message["deep"];
  int levels = 2;
  while (v->is_array()) {
    v = &(*v)[0];
    ++levels;
  }
  EXPECT_EQ(levels, kMaxNestingDepth);
  // And it encodes back to the same bytes. (One level more: the "65 levels" rejection above.)
  EXPECT_EQ(EncodeRequest(request), SendWithDepth(kMaxNestingDepth));
}

// ---------------------------------------------------------------------------------------------
// Undecodable frames close the connection

TEST(CodecTest, UndecodableFramesCloseTheConnection) {
  const Bytes valid = Pack().array(3).uint(1).uint(1).uint(5);
  Bytes trailing = valid;
  trailing.push_back(0xc0);
  Bytes deepCut = SendWithDepth(70);
  deepCut.pop_back();
  const std::vector<std::pair<std::string, Bytes>> cases = {
      // Other form faults are MessagePackTest's; every truncation is below.
      {"trailing byte", trailing},
      {"a map", Pack().map(1).str("call").uint(1)},
      {"call alone", Pack().array(1).uint(1)},
      {"string call", Pack().array(2).str("1").uint(10)},
      {"bin call", Pack().array(2).raw({0xc4, 0}).uint(10)},
      // A form fault wins over what the scan found before it.
      {"too deep and truncated", deepCut},
      {"bin and truncated", Pack().array(3).uint(1).raw({0xc4, 5, 1})},
      // Without a call there is no one to answer, whatever else is wrong.
      {"too deep under a string call", Pack().array(2).str("x").append(Nested(100))},
  };
  for (const auto& [name, body] : cases) {
    const RequestError error = Refused(body);
    EXPECT_EQ(error.kind, RequestError::Kind::kCloseConnection) << name << ": " << error.reason;
    EXPECT_FALSE(error.reason.empty()) << name;
    EXPECT_FALSE(EncodeRejectReply(error).has_value()) << name;
  }
}

TEST(CodecTest, EveryTruncationOfEveryRequestClosesTheConnection) {
  for (const Request& request : EveryRequest()) {
    const Bytes body = EncodeRequest(request);
    for (size_t size = 0; size < body.size(); ++size) {
      const RequestError error = Refused({body.data(), size});
      EXPECT_EQ(error.kind, RequestError::Kind::kCloseConnection)
          << "op " << static_cast<int>(request.op()) << " cut at " << size;
    }
  }
}

// ---------------------------------------------------------------------------------------------
// Precedence

TEST(CodecTest, ChecksRunInTheirDocumentedOrder) {
  using C = RejectCode;
  const std::pair<Bytes, C> cases[] = {
      // Depth before bin/ext before a non-string key before the op.
      {RequestBytes(2, Pack().uint(99), Pack().raw({0xc4, 0}).append(Nested(70))), C::kTooDeep},
      {RequestBytes(2, Pack().uint(99), Pack().map(1).uint(1).nil().raw({0xc4, 0})),
       C::kUnsupportedType},
      {RequestBytes(1, Pack().uint(99), Pack().map(1).uint(1).nil()), C::kWrongArgumentType},
      // The op before the argument count.
      {RequestBytes(5, Pack().uint(99), Pack().nil().nil().nil().nil().nil()), C::kUnknownOp},
      // The argument count before the argument types.
      {RequestBytes(2, Pack().uint(1), Pack().str("a").str("b")), C::kWrongArgumentCount},
      // Arguments in order: the first one's fault is reported.
      {RequestBytes(2, Pack().uint(2), Pack().str("a").uint(kUint64Max)), C::kWrongArgumentType},
      {RequestBytes(2, Pack().uint(2), Pack().uint(70000).str("b")), C::kIntegerOutOfRange},
  };
  for (size_t i = 0; i < std::size(cases); ++i) {
    EXPECT_EQ(Refused(cases[i].first).code, cases[i].second) << "case " << i;
  }
}

// ---------------------------------------------------------------------------------------------
// Replies

TEST(CodecTest, ReplyWireFormIsCallStatusValue) {
  EXPECT_EQ(EncodeBoolReply(3, true), Pack().array(3).uint(3).uint(0).boolean(true).bytes());
  EXPECT_EQ(EncodeServiceTypeReply(kUint64Max, 0xffff),
            Pack().array(3).uint(kUint64Max).uint(0).uint(0xffff).bytes());
  EXPECT_EQ(EncodeNilReply(0), Pack().array(3).uint(0).uint(0).nil().bytes());
  const Bytes error =
      Pack().map(2).str("domain").str("com.quorvex.audio.reporting").str("code").uint(1);
  EXPECT_EQ(EncodeOperationErrorReply(4, kReportingErrorDomain, kReportingDisabledCode),
            Pack().array(3).uint(4).uint(1).append(error).bytes());
}

TEST(CodecTest, EveryReplyRoundTripsThroughTheClientSide) {
  // Call, status, a value of each kind and an operation error's domain and code through
  // dispatch: DispatchTest. Here the edges of the values, and the error of a rejection.
  EXPECT_FALSE(ReplyError(DecodedReply(EncodeBoolReply(1, true))));
  EXPECT_FALSE(ReplyError(DecodedReply(EncodeNilReply(6))));
  EXPECT_EQ(ServiceTypeReplyValue(DecodedReply(EncodeServiceTypeReply(3, 0)).value), 0);

  Dictionary validity = Dictionary::object();
  validity["reporterID"] = int64_t{-9};
  validity["serviceType"] = uint16_t{4};
  const auto decodedValidity =
      ValidityReplyValue(DecodedReply(EncodeDictionaryReply(4, validity)).value);
  ASSERT_TRUE(decodedValidity);
  EXPECT_EQ(decodedValidity->dump(), R"({"reporterID":-9,"serviceType":4})");

  const std::vector<int64_t> ids = {kInt64Min, -1, 0, kInt64Max};
  EXPECT_EQ(ReportersReplyValue(DecodedReply(EncodeReportersReply(5, ids)).value), ids);
  EXPECT_EQ(ReportersReplyValue(DecodedReply(EncodeReportersReply(5, {})).value),
            std::vector<int64_t>{});

  const Reply rejected = DecodedReply(EncodeRejectReply(8, RejectCode::kTooDeep, "too deep"));
  EXPECT_EQ(rejected.status, Status::kRejected);
  const OptionalError protocolError = ReplyError(rejected);
  ASSERT_TRUE(protocolError);
  EXPECT_EQ(protocolError->domain, kProtocolErrorDomain);
  EXPECT_EQ(protocolError->code, 5);
  EXPECT_EQ(protocolError->description, "too deep");
}

TEST(CodecTest, ReplyValueAccessorsRefuseTheWrongShape) {
  EXPECT_FALSE(BoolReplyValue(1));
  EXPECT_FALSE(BoolReplyValue(nullptr));
  EXPECT_FALSE(ServiceTypeReplyValue(65536));
  EXPECT_FALSE(ServiceTypeReplyValue(-1));
  EXPECT_FALSE(ServiceTypeReplyValue(3.0));
  EXPECT_FALSE(ReportersReplyValue(Value::array({1, "2"})));
  EXPECT_FALSE(ReportersReplyValue(Value::array({1, kUint64Max})));
  EXPECT_FALSE(ValidityReplyValue(Value{{"reporterID", 1}}));
  EXPECT_FALSE(ValidityReplyValue(Value{{"reporterID", 1}, {"serviceType", 70000}}));
  EXPECT_FALSE(IsNilReplyValue(false));
}

TEST(CodecTest, MalformedRepliesAreRefused) {
  const std::vector<std::pair<std::string, Bytes>> cases = {
      {"empty", {}},
      {"not an array", Pack().map(0)},
      {"4 elements", Pack().array(4).uint(1).uint(0).nil().nil()},
      {"nil call", Pack().array(3).nil().uint(0).nil()},
      {"negative call", Pack().array(3).integer(IntFormat::kNegativeFixint, -1).uint(0).nil()},
      {"status 3", Pack().array(3).uint(1).uint(3).nil()},
      {"status 1 without map", Pack().array(3).uint(1).uint(1).nil()},
      {"status 1 without code", Pack().array(3).uint(1).uint(1).map(1).str("domain").str("d")},
      {"status 1 string code",
       Pack().array(3).uint(1).uint(1).map(2).str("domain").str("d").str("code").str("1")},
      {"status 2 without reason",
       Pack().array(3).uint(1).uint(2).map(2).str("domain").str("d").str("code").uint(1)},
      {"bin value", Pack().array(3).uint(1).uint(0).raw({0xc4, 0})},
      {"too deep", Pack().array(3).uint(1).uint(0).append(Nested(70))},
  };
  for (const auto& [name, body] : cases) {
    EXPECT_TRUE(std::holds_alternative<std::string>(DecodeReply(body))) << name;
  }
}

}  // namespace
}  // namespace tavrin::protocol
