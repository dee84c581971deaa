#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace tavrin::protocol {

// Operation numbers of the remote interface, as sent on the wire.
enum class Op : uint8_t {
  kCreateReportingSession = 1,
  kSetServiceType = 2,
  kGetServiceNameForReporterID = 3,
  kSetConfiguration = 4,
  kStartReportingSessionForID = 5,
  kSendMessage = 6,
  kStopReportingSessionForID = 7,
  kDestroyReportingSession = 8,
  kReporterIDValid = 9,
  kGetAllReporters = 10,
  kKillService = 11,
  // The service's counts (uptime, memory, sessions, the message ledger); answered by the
  // listener itself, so it answers even while the work queue is stuck.
  kStatus = 12,
};

inline constexpr uint8_t kFirstOp = 1;
inline constexpr uint8_t kLastOp = 12;

// The operation's name as the remote interface spells it ("createReportingSession:reply:"), or
// nothing for an unknown number.
std::optional<std::string_view> OperationName(uint64_t op);

// How many arguments follow `call` and `op` in a request of this operation.
std::optional<int> ArgumentCount(uint64_t op);

}  // namespace tavrin::protocol
