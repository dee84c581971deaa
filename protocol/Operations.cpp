#include "protocol/Operations.h"

#include <array>

namespace tavrin::protocol {
namespace {

struct OperationInfo {
  std::string_view name;
  int argumentCount;
};

constexpr std::array<OperationInfo, kLastOp> kOperations{{
    {"createReportingSession:reply:", 1},
    {"setServiceType:reportingSession:reply:", 2},
    {"getServiceNameForReporterID:reply:", 1},
    {"setConfiguration:forReporterID:reply:", 2},
    {"startReportingSessionForID:reply:", 1},
    {"sendMessage:withCategory:andType:forReportingIDs:reply:", 4},
    {"stopReportingSessionForID:reply:", 1},
    {"destroyReportingSession:reply:", 1},
    {"reporterID:valid:", 1},
    {"getAllReporters:", 0},
    {"killService:", 0},
    {"status", 0},
}};

const OperationInfo* Find(uint64_t op) {
  if (op < kFirstOp || op > kLastOp) return nullptr;
  return &kOperations[op - kFirstOp];
}

}  // namespace

std::optional<std::string_view> OperationName(uint64_t op) {
  const OperationInfo* info = Find(op);
  if (info == nullptr) return std::nullopt;
  return info->name;
}

std::optional<int> ArgumentCount(uint64_t op) {
  const OperationInfo* info = Find(op);
  if (info == nullptr) return std::nullopt;
  return info->argumentCount;
}

}  // namespace tavrin::protocol
