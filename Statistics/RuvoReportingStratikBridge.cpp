#include "Statistics/RuvoReportingStratikBridge.h"

#include <memory>

#include "Statistics/RuvoReportingUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/AnalyticsSink.h"
#include "platform/Platform.h"

namespace tavrin {

void RuvoReportingStratikBridge::handleEvent(const Dictionary& event, uint32_t category,
                                             uint16_t type, const RuvoReportingSession& session) {
  Dictionary payload = event.is_object() ? event : MakeDictionary();
  const Dictionary userInfo = session.userInfo();
  payload["HostApplicationDisplayID"] = ApplicationNameFromUserInfo(&userInfo);
  std::string name =
      fmt::format("com.quorvex.tavrin.{}.{}", CategoryName(category), TypeName(type));
  // Nothing changes the payload after this point, so the builder may run on any thread, later.
  auto prepared = std::make_shared<const Dictionary>(std::move(payload));
  session.platform().analytics->SendEventLazy(name, [prepared] { return *prepared; });
}

}  // namespace tavrin
