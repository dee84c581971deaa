#pragma once

// Requests and replies of the service's wire protocol, as bytes of one frame body. Pure functions
// over byte spans: the service's listener and the client library frame, send and receive; this
// file only says what the bytes mean.
//
// Request, client to service: [call, op, arg...]
//   call  an unsigned integer echoed in every reply, or nil for "no reply wanted";
//   op    the operation's number (protocol::Op), its arguments following in the order of
//         RuvoReportingServiceProtocol.
// Reply, service to client: [call, status, value]
//   status 0  the operation's answer (boolean, service type, dictionary, array of reporter IDs,
//             or nil);
//   status 1  the operation's own error {"domain": string, "code": integer};
//   status 2  the request was not understood {"domain": kProtocolErrorDomain, "code": RejectCode,
//             "reason": string}; the connection stays open.

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "protocol/Operations.h"

namespace tavrin::protocol {

inline constexpr std::string_view kProtocolErrorDomain = "com.quorvex.tavrin.protocol";
// The message path's own error domain, and its one code: reporting is disabled by the defaults.
inline constexpr std::string_view kReportingErrorDomain = "com.quorvex.audio.reporting";
inline constexpr int64_t kReportingDisabledCode = 1;
// Requests over one of the service's limits are answered status 1 in this domain, with these
// codes and a reason; the request has no other effect.
inline constexpr std::string_view kLimitsErrorDomain = "com.quorvex.tavrin.limits";
enum class LimitCode : int64_t {
  kSessionsPerConnection = 1,
  kReporterListTooLong = 2,
  kEntriesPerFrame = 3,
  kConnectionsPerUid = 4,
  kReplyBacklog = 5,
};

// What one request may hold. Each bound is a setting (the defaults file's [limits] table) with
// this default and a floor below which it is not lowered.
struct RequestLimits {
  // Elements of all arrays plus pairs of all maps in one frame. A real message has tens; the bound
  // keeps one frame's decoding and memory small whatever its shape.
  static constexpr uint64_t kDefaultEntriesPerFrame = 65'536;
  static constexpr uint64_t kMinEntriesPerFrame = 1'024;
  // Reporter IDs in one sendMessage list: each one is a copy of the message on the work queue.
  static constexpr uint64_t kDefaultReporterIDsPerMessage = 1'024;
  static constexpr uint64_t kMinReporterIDsPerMessage = 16;

  // Sessions one connection keeps: each holds its aggregation, queue and timers in the service.
  // A client has a few; the bound stops one connection from creating them without end.
  static constexpr uint64_t kDefaultSessionsPerConnection = 1'024;
  static constexpr uint64_t kMinSessionsPerConnection = 16;

  uint64_t entriesPerFrame = kDefaultEntriesPerFrame;
  uint64_t reporterIDsPerMessage = kDefaultReporterIDsPerMessage;
  uint64_t sessionsPerConnection = kDefaultSessionsPerConnection;
};

// Refusals of a peer that may not make the request; code 1: not allowed to stop the service.
inline constexpr std::string_view kAccessErrorDomain = "com.quorvex.tavrin.access";
inline constexpr int64_t kKillNotAllowedCode = 1;

// Codes of status 2 replies.
enum class RejectCode : int64_t {
  kUnknownOp = 1,           // op not an integer from 1 to 11
  kWrongArgumentCount = 2,  // more or fewer arguments than the op takes
  kWrongArgumentType = 3,   // e.g. a float, boolean or string where an integer belongs; a map
                            // key that is not a string
  kIntegerOutOfRange = 4,   // an integer that does not fit the argument's type
  kTooDeep = 5,             // nesting deeper than kMaxNestingDepth
  kUnsupportedType = 6,     // bin or ext anywhere in the request
};

enum class Status : uint8_t {
  kOk = 0,
  kOperationError = 1,
  kRejected = 2,
};

// Typed arguments of the twelve operations; the alternative's index is the op number minus one.
struct CreateReportingSession {
  int64_t reporterID = 0;
  bool operator==(const CreateReportingSession&) const = default;
};
struct SetServiceType {
  uint16_t serviceType = 0;
  int64_t reporterID = 0;
  bool operator==(const SetServiceType&) const = default;
};
struct GetServiceNameForReporterID {
  int64_t reporterID = 0;
  bool operator==(const GetServiceNameForReporterID&) const = default;
};
struct SetConfiguration {
  Dictionary configuration = Dictionary::object();
  int64_t reporterID = 0;
  bool operator==(const SetConfiguration&) const = default;
};
struct StartReportingSessionForID {
  int64_t reporterID = 0;
  bool operator==(const StartReportingSessionForID&) const = default;
};
struct SendMessage {
  Dictionary message = Dictionary::object();
  uint32_t category = 0;
  uint16_t type = 0;
  std::optional<std::vector<int64_t>> reporterIDs;  // absent (nil): every running session
  bool operator==(const SendMessage&) const = default;
};
struct StopReportingSessionForID {
  int64_t reporterID = 0;
  bool operator==(const StopReportingSessionForID&) const = default;
};
struct DestroyReportingSession {
  int64_t reporterID = 0;
  bool operator==(const DestroyReportingSession&) const = default;
};
struct ReporterIDValid {
  int64_t reporterID = 0;
  bool operator==(const ReporterIDValid&) const = default;
};
struct GetAllReporters {
  bool operator==(const GetAllReporters&) const = default;
};
struct KillService {
  bool operator==(const KillService&) const = default;
};
struct GetStatus {
  bool operator==(const GetStatus&) const = default;
};

using Arguments = std::variant<CreateReportingSession, SetServiceType, GetServiceNameForReporterID,
                               SetConfiguration, StartReportingSessionForID, SendMessage,
                               StopReportingSessionForID, DestroyReportingSession, ReporterIDValid,
                               GetAllReporters, KillService, GetStatus>;
static_assert(std::variant_size_v<Arguments> == kLastOp, "one alternative per operation");

struct Request {
  std::optional<uint64_t> call;  // nullopt (nil on the wire): the client wants no reply
  Arguments arguments;

  Op op() const { return static_cast<Op>(arguments.index() + kFirstOp); }
  bool operator==(const Request&) const = default;
};

// Why a request frame was not accepted.
struct RequestError {
  enum class Kind {
    // Undecodable: bad MessagePack, bytes left over, not an array, fewer than 2 elements, or
    // `call` neither an unsigned integer nor nil. Nothing can be answered; the service closes
    // the connection.
    kCloseConnection,
    // Understood enough to answer with status 2 and `code` (when `call` is not nil).
    kReject,
    // Over one of the request limits: answered status 1 in kLimitsErrorDomain with `limit`.
    kOverLimit,
  };
  Kind kind = Kind::kCloseConnection;
  std::optional<uint64_t> call;  // kReject: the call to answer; nullopt = nil, send nothing
  RejectCode code = RejectCode::kUnknownOp;  // kReject only
  std::string reason;  // for the reply (kReject, kOverLimit) or the log line (all)
  LimitCode limit = LimitCode::kEntriesPerFrame;  // kOverLimit only
};

// Decodes one request frame body. Never throws on bad input.
//
// Order of the checks, first failure wins:
//  1. the MessagePack form (truncated, bytes left over, invalid byte), then the outer shape (an
//     array of at least 2 whose element 0 is an integer >= 0, in any integer format, or nil):
//     kCloseConnection;
//  2. what the byte scan finds anywhere in the value, before any element is looked at: nesting
//     deeper than kMaxNestingDepth (5), then bin/ext (6), then a map key that is not a string (3),
//     then more entries than limits.entriesPerFrame (status 1, LimitCode::kEntriesPerFrame; the
//     frame is never built);
//  3. op: not an integer from 1 to 11 (1);
//  4. the number of arguments (2);
//  5. each argument in order: wrong type (3) or integer out of range (4). For the reporter ID list
//     of sendMessage, first its length against limits.reporterIDsPerMessage (status 1,
//     LimitCode::kReporterListTooLong), then element by element.
std::variant<Request, RequestError> DecodeRequest(std::span<const uint8_t> body,
                                                  const RequestLimits& limits = {});

// The request as a frame body; DecodeRequest() gives back an equal Request.
std::vector<uint8_t> EncodeRequest(const Request& request);

// Reply frame bodies, service side. `call` is the request's call (requests with a nil call get no
// reply).
std::vector<uint8_t> EncodeBoolReply(uint64_t call, bool value);
std::vector<uint8_t> EncodeServiceTypeReply(uint64_t call, uint16_t serviceType);
std::vector<uint8_t> EncodeDictionaryReply(uint64_t call, const Dictionary& value);
std::vector<uint8_t> EncodeReportersReply(uint64_t call, std::span<const int64_t> reporterIDs);
std::vector<uint8_t> EncodeNilReply(uint64_t call);
// Status 1 {"domain", "code"}, and "reason" when one is given; the error's description does not
// travel.
std::vector<uint8_t> EncodeOperationErrorReply(uint64_t call, std::string_view domain, int64_t code,
                                               std::string_view reason = {});
// Status 2 {"domain": kProtocolErrorDomain, "code", "reason"}.
std::vector<uint8_t> EncodeRejectReply(uint64_t call, RejectCode code, std::string_view reason);
// The status 2 reply for a rejected request, or the status 1 reply for one over a limit; nothing
// when there is none to send (the request closes the connection, or its call is nil).
std::optional<std::vector<uint8_t>> EncodeRejectReply(const RequestError& error);

// A reply as the client sees it.
struct Reply {
  uint64_t call = 0;
  Status status = Status::kOk;
  // kOk: the operation's answer, checked by the accessors below against what the op answers.
  // kOperationError, kRejected: the error map, already checked (see ReplyError()).
  Value value;
};

// Decodes one reply frame body: well-formed MessagePack within the nesting limit and without
// bin/ext, an array of exactly 3, call an integer >= 0, status 0 to 2, and for status 1 a map
// with a string "domain" and an integer "code" (status 2: also a string "reason").
// Anything else is a broken service; the answer is the reason, and the client closes the
// connection. Never throws on bad input.
std::variant<Reply, std::string> DecodeReply(std::span<const uint8_t> body);

// Status 0 values, by the op that was called; nothing when the value has the wrong shape.
std::optional<bool> BoolReplyValue(const Value& value);             // ops 1, 2, 4, 5, 7, 8
std::optional<uint16_t> ServiceTypeReplyValue(const Value& value);  // op 3
// op 9: a map holding "reporterID" (signed 64-bit) and "serviceType" (unsigned 16-bit).
std::optional<Dictionary> ValidityReplyValue(const Value& value);
std::optional<std::vector<int64_t>> ReportersReplyValue(const Value& value);  // op 10
// op 6: nil on success.
bool IsNilReplyValue(const Value& value);
// The error of a status 1 or 2 reply (reason as description); nothing for status 0.
OptionalError ReplyError(const Reply& reply);

// The integer in `value` if it is one (stored signed or unsigned; not a boolean, not a float)
// and its value fits T.
template <typename T>
std::optional<T> IntegerAs(const Value& value) {
  static_assert(std::is_integral_v<T> && !std::is_same_v<T, bool>);
  if (value.is_number_unsigned()) {
    const auto number = value.get<uint64_t>();
    if (std::in_range<T>(number)) return static_cast<T>(number);
  } else if (value.is_number_integer()) {
    const auto number = value.get<int64_t>();
    if (std::in_range<T>(number)) return static_cast<T>(number);
  }
  return std::nullopt;
}

}  // namespace tavrin::protocol
