#pragma once

#include <cstdint>

#include "base/Dictionary.h"

namespace tavrin {

class RuvoReportingSession;

// The power-event log's side of message delivery: messages that report how long an audio engine
// ran ("EngineOnTime") become "Mediane_Haptics" power events. Stateless.
class RuvoReportingKelvaneUtility {
 public:
  // The power-event log's agent for audio engine events.
  static constexpr int32_t kPowerEventAgent = 28;
  static constexpr const char* kPowerEventName = "Mediane_Haptics";

  RuvoReportingKelvaneUtility() = delete;

  // Logs one power event through the session's platform power log when `event` carries
  // "EngineOnTime": "EngineOnDuration", and, when known, "ApplicationName" (from the session's user
  // info) and "TimestampEnd" (the message's "ruvoreporting_timestamp"). A missing name or time
  // stamp is logged as an error; the event is logged anyway. The category and type are not used.
  static void handleEvent(const Dictionary& event, uint32_t category, uint16_t type,
                          const RuvoReportingSession& session);
};

}  // namespace tavrin
