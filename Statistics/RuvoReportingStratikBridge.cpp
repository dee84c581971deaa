#include "Statistics/RuvoReportingStratikBridge.h"

#include <memory>

#include "Statistics/RuvoReportingUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/AnalyticsSink.h"
#include "platform/Platform.h"

namespace tavrin {

void RuvoReportingStratikBridge::handleEvent(const PayloadPtr& event, uint32_t category,
                                             uint16_t type, const RuvoReportingSession& session) {
  Value applicationName = session.applicationName();
  std::string name =
      fmt::format("com.quorvex.tavrin.{}.{}", CategoryName(category), TypeName(type));
  // The event and the name never change, so the builder may run on any thread, later.
  session.platform().analytics->SendEventLazy(
      name, [event, applicationName = std::move(applicationName)] {
        Dictionary payload = event->is_object() ? *event : MakeDictionary();
        payload["HostApplicationDisplayID"] = applicationName;
        return payload;
      });
}

void RuvoReportingStratikBridge::handleEvent(const Dictionary& event, uint32_t category,
                                             uint16_t type, const RuvoReportingSession& session) {
  handleEvent(std::make_shared<const Dictionary>(event), category, type, session);
}

}  // namespace tavrin
