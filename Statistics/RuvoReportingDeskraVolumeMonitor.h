#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/Dispatcher.h"

namespace tavrin {

class RuvoReportingSession;

// Volume monitor. This platform has no volume notifications to watch, so creation yields nothing
// and the session operations do nothing; the properties exist so that the class keeps its shape.
// Nothing in the service creates one.
class RuvoReportingDeskraVolumeMonitor {
 public:
  // Always nullptr on this platform.
  static std::unique_ptr<RuvoReportingDeskraVolumeMonitor> create();

  void addSession(const std::shared_ptr<RuvoReportingSession>& session);
  void removeSession(const std::shared_ptr<RuvoReportingSession>& session);
  void stop();

  std::unique_ptr<Timer> timer;
  std::thread timerThread;
  std::vector<uint32_t> deviceIDs;
  std::vector<std::string> deviceNames;
  std::vector<float> deviceVolumes;
  std::vector<std::weak_ptr<RuvoReportingSession>> sessions;

 private:
  RuvoReportingDeskraVolumeMonitor() = default;
};

}  // namespace tavrin
