#pragma once

#include <cstdint>

#include "base/Dictionary.h"

namespace tavrin {

class RuvoReportingSession;

// The analytics sink's side of message delivery: every message a session receives becomes one
// analytics event "com.quorvex.tavrin.<category name>.<type name>". Stateless.
class RuvoReportingStratikBridge {
 public:
  RuvoReportingStratikBridge() = delete;

  // Sends `event` (null counts as empty) with "HostApplicationDisplayID" set to the application
  // name of the session's user info, through the session's platform analytics sink. The name is
  // read here; the event's copy is made by the sink's lazy builder, so only when the sink's
  // policy wants the event.
  static void handleEvent(const PayloadPtr& event, uint32_t category, uint16_t type,
                          const RuvoReportingSession& session);
  static void handleEvent(const Dictionary& event, uint32_t category, uint16_t type,
                          const RuvoReportingSession& session);
};

}  // namespace tavrin
