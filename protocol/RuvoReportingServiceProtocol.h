#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"

namespace tavrin {

// The remote interface that clients call, operation numbers 1 to 11 in declaration order. Every
// reply is a callback given with the call; a reply may be called more than once, later, or never,
// as each operation's contract says.
class RuvoReportingServiceProtocol {
 public:
  using BoolReply = std::function<void(bool)>;
  using ServiceTypeReply = std::function<void(uint16_t)>;
  using ErrorReply = std::function<void(const OptionalError&)>;
  using DictionaryReply = std::function<void(const Dictionary&)>;
  using ReportersReply = std::function<void(const std::vector<int64_t>&)>;

  virtual ~RuvoReportingServiceProtocol() = default;

  virtual void createReportingSession(int64_t reporterID, BoolReply reply) = 0;                // 1
  virtual void setServiceType(uint16_t serviceType, int64_t reporterID, BoolReply reply) = 0;  // 2
  virtual void getServiceNameForReporterID(int64_t reporterID, ServiceTypeReply reply) = 0;    // 3
  virtual void setConfiguration(const Dictionary& configuration, int64_t reporterID,
                                BoolReply reply) = 0;                                // 4
  virtual void startReportingSessionForID(int64_t reporterID, BoolReply reply) = 0;  // 5
  // `reporterIDs` absent means every running session. The message is taken, not copied.
  virtual void sendMessage(Dictionary message, uint32_t category, uint16_t type,
                           const std::optional<std::vector<int64_t>>& reporterIDs,
                           ErrorReply reply) = 0;                                   // 6
  virtual void stopReportingSessionForID(int64_t reporterID, BoolReply reply) = 0;  // 7
  virtual void destroyReportingSession(int64_t reporterID, BoolReply reply) = 0;    // 8
  virtual void reporterID(int64_t reporterID, DictionaryReply valid) = 0;           // 9
  virtual void getAllReporters(ReportersReply reply) = 0;                           // 10
  virtual void killService(BoolReply reply) = 0;                                    // 11
};

}  // namespace tavrin
