#include "protocol/Codec.h"

#include <fmt/format.h>

#include <limits>
#include <utility>

#include "protocol/MessagePack.h"

namespace tavrin::protocol {
namespace {

// How a value is named in a reason text ("a string, not an integer").
std::string_view KindName(const Value& value) {
  switch (value.type()) {
    case Value::value_t::null:
      return "nil";
    case Value::value_t::boolean:
      return "a boolean";
    case Value::value_t::number_integer:
    case Value::value_t::number_unsigned:
      return "an integer";
    case Value::value_t::number_float:
      return "a float";
    case Value::value_t::string:
      return "a string";
    case Value::value_t::array:
      return "an array";
    case Value::value_t::object:
      return "a map";
    default:
      return "an unsupported value";
  }
}

// The integer's decimal text; only called for integers.
std::string IntegerText(const Value& value) {
  return value.is_number_unsigned() ? std::to_string(value.get<uint64_t>())
                                    : std::to_string(value.get<int64_t>());
}

RequestError Close(std::string reason) {
  return RequestError{RequestError::Kind::kCloseConnection, std::nullopt, RejectCode::kUnknownOp,
                      std::move(reason)};
}

RequestError Reject(std::optional<uint64_t> call, RejectCode code, std::string reason) {
  return RequestError{RequestError::Kind::kReject, call, code, std::move(reason)};
}

RequestError OverLimit(std::optional<uint64_t> call, LimitCode limit, std::string reason) {
  return RequestError{RequestError::Kind::kOverLimit, call, RejectCode::kUnknownOp,
                      std::move(reason), limit};
}

// Reads the arguments of one request, remembering the first failure.
class ArgumentReader {
 public:
  // Map() moves its argument out of `request`: each argument is read once.
  ArgumentReader(Value& request, std::optional<uint64_t> call, std::string_view operation,
                 const RequestLimits& limits)
      : request_(request), call_(call), operation_(operation), limits_(limits) {}

  // Argument `index` (1-based, after call and op) as an integer of type T.
  template <typename T>
  T Integer(size_t index, std::string_view name, std::string_view typeName) {
    if (failure_) return T{};
    const Value& value = request_[index + 1];
    if (!value.is_number_integer()) {
      Fail(RejectCode::kWrongArgumentType,
           fmt::format("argument {} ({}) of {} is {}, not an integer", index, name, operation_,
                       KindName(value)));
      return T{};
    }
    auto number = IntegerAs<T>(value);
    if (!number) {
      Fail(RejectCode::kIntegerOutOfRange,
           fmt::format("argument {} ({}) of {}: {} does not fit {}", index, name, operation_,
                       IntegerText(value), typeName));
      return T{};
    }
    return *number;
  }

  Dictionary Map(size_t index, std::string_view name) {
    if (failure_) return Dictionary::object();
    Value& value = request_[index + 1];
    if (!value.is_object()) {
      Fail(RejectCode::kWrongArgumentType, fmt::format("argument {} ({}) of {} is {}, not a map",
                                                       index, name, operation_, KindName(value)));
      return Dictionary::object();
    }
    return std::move(value);
  }

  std::optional<std::vector<int64_t>> ReporterList(size_t index, std::string_view name) {
    if (failure_) return std::nullopt;
    const Value& value = request_[index + 1];
    if (value.is_null()) return std::nullopt;
    if (!value.is_array()) {
      Fail(RejectCode::kWrongArgumentType,
           fmt::format("argument {} ({}) of {} is {}, not an array or nil", index, name, operation_,
                       KindName(value)));
      return std::nullopt;
    }
    if (value.size() > limits_.reporterIDsPerMessage) {
      failure_ = OverLimit(call_, LimitCode::kReporterListTooLong,
                           fmt::format("{} reporter IDs in one {}; the limit is {}", value.size(),
                                       operation_, limits_.reporterIDsPerMessage));
      return std::nullopt;
    }
    std::vector<int64_t> ids;
    ids.reserve(value.size());
    for (size_t i = 0; i < value.size(); ++i) {
      const Value& element = value[i];
      if (!element.is_number_integer()) {
        Fail(RejectCode::kWrongArgumentType,
             fmt::format("element {} of argument {} ({}) of {} is {}, not an integer", i, index,
                         name, operation_, KindName(element)));
        return std::nullopt;
      }
      auto id = IntegerAs<int64_t>(element);
      if (!id) {
        Fail(RejectCode::kIntegerOutOfRange,
             fmt::format("element {} of argument {} ({}) of {}: {} does not fit a signed 64-bit "
                         "integer",
                         i, index, name, operation_, IntegerText(element)));
        return std::nullopt;
      }
      ids.push_back(*id);
    }
    return ids;
  }

  int64_t ReporterID(size_t index) {
    return Integer<int64_t>(index, "reporterID", "a signed 64-bit integer");
  }

  std::optional<RequestError> TakeFailure() { return std::move(failure_); }

 private:
  void Fail(RejectCode code, std::string reason) {
    failure_ = Reject(call_, code, std::move(reason));
  }

  Value& request_;
  std::optional<uint64_t> call_;
  std::string_view operation_;
  const RequestLimits& limits_;
  std::optional<RequestError> failure_;
};

Arguments ReadArguments(Op op, ArgumentReader& reader) {
  switch (op) {
    case Op::kCreateReportingSession:
      return CreateReportingSession{reader.ReporterID(1)};
    case Op::kSetServiceType: {
      const auto serviceType =
          reader.Integer<uint16_t>(1, "serviceType", "an unsigned 16-bit integer");
      return SetServiceType{serviceType, reader.ReporterID(2)};
    }
    case Op::kGetServiceNameForReporterID:
      return GetServiceNameForReporterID{reader.ReporterID(1)};
    case Op::kSetConfiguration: {
      Dictionary configuration = reader.Map(1, "configuration");
      return SetConfiguration{std::move(configuration), reader.ReporterID(2)};
    }
    case Op::kStartReportingSessionForID:
      return StartReportingSessionForID{reader.ReporterID(1)};
    case Op::kSendMessage: {
      Dictionary message = reader.Map(1, "message");
      const auto category = reader.Integer<uint32_t>(2, "category", "an unsigned 32-bit integer");
      const auto type = reader.Integer<uint16_t>(3, "type", "an unsigned 16-bit integer");
      auto reporterIDs = reader.ReporterList(4, "reporterIDs");
      return SendMessage{std::move(message), category, type, std::move(reporterIDs)};
    }
    case Op::kStopReportingSessionForID:
      return StopReportingSessionForID{reader.ReporterID(1)};
    case Op::kDestroyReportingSession:
      return DestroyReportingSession{reader.ReporterID(1)};
    case Op::kReporterIDValid:
      return ReporterIDValid{reader.ReporterID(1)};
    case Op::kGetAllReporters:
      return GetAllReporters{};
    case Op::kKillService:
      return KillService{};
    case Op::kStatus:
      return GetStatus{};
  }
  return GetAllReporters{};  // not reached: the op was checked against the table
}

Value ReplyArray(uint64_t call, Status status, Value value) {
  Value reply = Value::array();
  reply.push_back(call);
  reply.push_back(static_cast<uint8_t>(status));
  reply.push_back(std::move(value));
  return reply;
}

std::vector<uint8_t> EncodeReply(uint64_t call, Status status, Value value) {
  return EncodeMessagePack(ReplyArray(call, status, std::move(value)));
}

Value ReporterArray(std::span<const int64_t> reporterIDs) {
  Value array = Value::array();
  for (int64_t id : reporterIDs) array.push_back(id);
  return array;
}

// The request's elements after call and op.
Value ArgumentValues(const Arguments& arguments) {
  Value args = Value::array();
  std::visit(
      [&args](const auto& a) {
        using T = std::decay_t<decltype(a)>;
        if constexpr (std::is_same_v<T, SetServiceType>) {
          args.push_back(a.serviceType);
          args.push_back(a.reporterID);
        } else if constexpr (std::is_same_v<T, SetConfiguration>) {
          args.push_back(a.configuration);
          args.push_back(a.reporterID);
        } else if constexpr (std::is_same_v<T, SendMessage>) {
          args.push_back(a.message);
          args.push_back(a.category);
          args.push_back(a.type);
          args.push_back(a.reporterIDs ? ReporterArray(*a.reporterIDs) : Value(nullptr));
        } else if constexpr (std::is_same_v<T, GetAllReporters> || std::is_same_v<T, KillService> ||
                             std::is_same_v<T, GetStatus>) {
          // no arguments
        } else {
          args.push_back(a.reporterID);
        }
      },
      arguments);
  return args;
}

}  // namespace

std::variant<Request, RequestError> DecodeRequest(std::span<const uint8_t> body,
                                                  const RequestLimits& limits) {
  DecodedValue decoded = DecodeMessagePack(body, limits.entriesPerFrame);
  const ScanResult& scan = decoded.scan;
  if (!scan.WellFormed()) {
    return Close(fmt::format("undecodable MessagePack ({} at byte {} of {})", FormName(scan.form),
                             scan.offset, body.size()));
  }
  if (!scan.topLevelArraySize) return Close("request is not an array");
  if (*scan.topLevelArraySize < 2) {
    return Close(fmt::format("request array holds {} element(s); call and op are needed",
                             *scan.topLevelArraySize));
  }
  std::optional<uint64_t> call;
  switch (scan.first) {
    case ScanResult::First::kNil:
      break;
    case ScanResult::First::kUnsigned:
      call = scan.firstValue;
      break;
    default:
      return Close("call is neither an unsigned integer nor nil");
  }

  if (scan.tooDeep) {
    return Reject(call, RejectCode::kTooDeep,
                  fmt::format("nesting deeper than {} levels", kMaxNestingDepth));
  }
  if (!scan.unsupportedType.empty()) {
    return Reject(call, RejectCode::kUnsupportedType,
                  fmt::format("unsupported MessagePack type {}", scan.unsupportedType));
  }
  if (scan.nonStringKey) {
    return Reject(call, RejectCode::kWrongArgumentType, "map key is not a string");
  }
  if (scan.tooManyEntries) {
    return OverLimit(call, LimitCode::kEntriesPerFrame,
                     fmt::format("{} entries in one frame; the limit is {}", scan.entries,
                                 limits.entriesPerFrame));
  }
  if (!decoded.value) return Close("undecodable MessagePack");

  Value& request = *decoded.value;
  const Value& opValue = request[1];
  const auto op = IntegerAs<uint8_t>(opValue);
  const auto name = op ? OperationName(*op) : std::nullopt;
  if (!name) {
    return Reject(call, RejectCode::kUnknownOp,
                  opValue.is_number_integer()
                      ? fmt::format("unknown operation {}", IntegerText(opValue))
                      : fmt::format("operation is {}, not a number from {} to {}",
                                    KindName(opValue), kFirstOp, kLastOp));
  }
  const int expected = *ArgumentCount(*op);
  const size_t given = request.size() - 2;
  if (given != static_cast<size_t>(expected)) {
    return Reject(call, RejectCode::kWrongArgumentCount,
                  fmt::format("{} takes {} argument(s), got {}", *name, expected, given));
  }
  ArgumentReader reader(request, call, *name, limits);
  Arguments arguments = ReadArguments(static_cast<Op>(*op), reader);
  if (auto failure = reader.TakeFailure()) return std::move(*failure);
  return Request{call, std::move(arguments)};
}

std::vector<uint8_t> EncodeRequest(const Request& request) {
  Value array = Value::array();
  array.push_back(request.call ? Value(*request.call) : Value(nullptr));
  array.push_back(static_cast<uint8_t>(request.op()));
  for (Value& argument : ArgumentValues(request.arguments)) array.push_back(std::move(argument));
  return EncodeMessagePack(array);
}

std::vector<uint8_t> EncodeBoolReply(uint64_t call, bool value) {
  return EncodeReply(call, Status::kOk, value);
}

std::vector<uint8_t> EncodeServiceTypeReply(uint64_t call, uint16_t serviceType) {
  return EncodeReply(call, Status::kOk, serviceType);
}

std::vector<uint8_t> EncodeDictionaryReply(uint64_t call, const Dictionary& value) {
  return EncodeReply(call, Status::kOk, value);
}

std::vector<uint8_t> EncodeReportersReply(uint64_t call, std::span<const int64_t> reporterIDs) {
  return EncodeReply(call, Status::kOk, ReporterArray(reporterIDs));
}

std::vector<uint8_t> EncodeNilReply(uint64_t call) {
  return EncodeReply(call, Status::kOk, nullptr);
}

std::vector<uint8_t> EncodeOperationErrorReply(uint64_t call, std::string_view domain, int64_t code,
                                               std::string_view reason) {
  Value error = Value::object();
  error["domain"] = domain;
  error["code"] = code;
  if (!reason.empty()) error["reason"] = reason;
  return EncodeReply(call, Status::kOperationError, std::move(error));
}

std::vector<uint8_t> EncodeRejectReply(uint64_t call, RejectCode code, std::string_view reason) {
  Value error = Value::object();
  error["domain"] = kProtocolErrorDomain;
  error["code"] = static_cast<int64_t>(code);
  error["reason"] = reason;
  return EncodeReply(call, Status::kRejected, std::move(error));
}

std::optional<std::vector<uint8_t>> EncodeRejectReply(const RequestError& error) {
  if (error.kind == RequestError::Kind::kCloseConnection || !error.call) return std::nullopt;
  if (error.kind == RequestError::Kind::kOverLimit) {
    return EncodeOperationErrorReply(*error.call, kLimitsErrorDomain,
                                     static_cast<int64_t>(error.limit), error.reason);
  }
  return EncodeRejectReply(*error.call, error.code, error.reason);
}

std::variant<Reply, std::string> DecodeReply(std::span<const uint8_t> body) {
  DecodedValue decoded = DecodeMessagePack(body);
  const ScanResult& scan = decoded.scan;
  if (!scan.WellFormed()) {
    return fmt::format("undecodable MessagePack ({} at byte {} of {})", FormName(scan.form),
                       scan.offset, body.size());
  }
  if (scan.tooDeep) return fmt::format("nesting deeper than {} levels", kMaxNestingDepth);
  if (!scan.unsupportedType.empty()) {
    return fmt::format("unsupported MessagePack type {}", scan.unsupportedType);
  }
  if (scan.nonStringKey) return std::string("map key is not a string");
  if (!decoded.value) return std::string("undecodable MessagePack");
  Value& reply = *decoded.value;
  if (!reply.is_array() || reply.size() != 3) {
    return std::string("reply is not an array of 3 elements");
  }
  const auto call = IntegerAs<uint64_t>(reply[0]);
  if (!call) return std::string("reply call is not an unsigned integer");
  const auto status = IntegerAs<uint8_t>(reply[1]);
  if (!status || *status > static_cast<uint8_t>(Status::kRejected)) {
    return std::string("reply status is not 0, 1 or 2");
  }
  const Value& value = reply[2];
  if (*status != static_cast<uint8_t>(Status::kOk)) {
    const bool shaped = value.is_object() && value.contains("domain") &&
                        value["domain"].is_string() && value.contains("code") &&
                        IntegerAs<int64_t>(value["code"]).has_value();
    if (!shaped) return std::string("error reply lacks a string domain or an integer code");
    if (*status == static_cast<uint8_t>(Status::kRejected) &&
        (!value.contains("reason") || !value["reason"].is_string())) {
      return std::string("protocol error reply lacks a string reason");
    }
  }
  return Reply{*call, static_cast<Status>(*status), std::move(reply[2])};
}

std::optional<bool> BoolReplyValue(const Value& value) {
  if (!value.is_boolean()) return std::nullopt;
  return value.get<bool>();
}

std::optional<uint16_t> ServiceTypeReplyValue(const Value& value) {
  return IntegerAs<uint16_t>(value);
}

std::optional<Dictionary> ValidityReplyValue(const Value& value) {
  if (!value.is_object() || !value.contains("reporterID") || !value.contains("serviceType") ||
      !IntegerAs<int64_t>(value["reporterID"]) || !IntegerAs<uint16_t>(value["serviceType"])) {
    return std::nullopt;
  }
  return value;
}

std::optional<std::vector<int64_t>> ReportersReplyValue(const Value& value) {
  if (!value.is_array()) return std::nullopt;
  std::vector<int64_t> ids;
  ids.reserve(value.size());
  for (const Value& element : value) {
    auto id = IntegerAs<int64_t>(element);
    if (!id) return std::nullopt;
    ids.push_back(*id);
  }
  return ids;
}

bool IsNilReplyValue(const Value& value) { return value.is_null(); }

OptionalError ReplyError(const Reply& reply) {
  if (reply.status == Status::kOk) return std::nullopt;
  Error error;
  if (!reply.value.is_object()) return error;
  error.domain = reply.value.value("domain", std::string());
  error.code = IntegerAs<int64_t>(reply.value.value("code", Value())).value_or(0);
  if (reply.value.contains("reason") && reply.value["reason"].is_string()) {
    error.description = reply.value["reason"].get<std::string>();
  }
  return error;
}

}  // namespace tavrin::protocol
