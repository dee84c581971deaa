#include "Statistics/RuvoReportingDeskraVolumeMonitor.h"

namespace tavrin {

std::unique_ptr<RuvoReportingDeskraVolumeMonitor> RuvoReportingDeskraVolumeMonitor::create() {
  return nullptr;
}

void RuvoReportingDeskraVolumeMonitor::addSession(const std::shared_ptr<RuvoReportingSession>&) {}

void RuvoReportingDeskraVolumeMonitor::removeSession(const std::shared_ptr<RuvoReportingSession>&) {
}

void RuvoReportingDeskraVolumeMonitor::stop() {}

}  // namespace tavrin
