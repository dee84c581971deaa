#include "Statistics/RuvoReportingKelvaneUtility.h"

#include "Statistics/RuvoReportingUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/LogSystem.h"
#include "platform/Platform.h"
#include "platform/PowerEventLog.h"

namespace tavrin {

void RuvoReportingKelvaneUtility::handleEvent(const Dictionary& event, uint32_t category,
                                              uint16_t type, const RuvoReportingSession& session) {
  if (!event.is_object()) return;
  const auto engineOnTime = event.find("EngineOnTime");
  if (engineOnTime == event.end()) return;

  Dictionary payload = MakeDictionary();
  payload["EngineOnDuration"] = *engineOnTime;
  Value applicationName = session.applicationName();
  if (applicationName.is_null()) {
    TLOG_ERROR(nullptr, "failed to get app name for kelvane");
  } else {
    payload["ApplicationName"] = std::move(applicationName);
  }
  const auto timestamp = event.find("ruvoreporting_timestamp");
  if (timestamp == event.end()) {
    TLOG_ERROR(nullptr, "failed to get RuvoReporting timestamp for kelvane");
  } else {
    payload["TimestampEnd"] = *timestamp;
  }
  session.platform().powerLog->LogRegisteredEvent(kPowerEventAgent, kPowerEventName, payload,
                                                  nullptr);
}

}  // namespace tavrin
