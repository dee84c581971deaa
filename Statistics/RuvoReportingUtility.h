#pragma once

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/Dictionary.h"
#include "platform/Condition.h"
#include "platform/DeviceInfoQuery.h"
#include "platform/LogSystem.h"
#include "platform/Platform.h"

namespace tavrin {

// Service type codes with a name. 13..65534 have none.
namespace service_type {
inline constexpr uint16_t kGeneric = 0;
inline constexpr uint16_t kOndra = 1;
inline constexpr uint16_t kTelephony = 2;
inline constexpr uint16_t kHaptics = 3;
inline constexpr uint16_t kAlarms = 4;
inline constexpr uint16_t kStandalone = 5;
inline constexpr uint16_t kSoundAutoConfig = 6;
inline constexpr uint16_t kLongFormAudio = 7;
inline constexpr uint16_t kNonLongFormAudio = 8;
inline constexpr uint16_t kAudioDeviceUsage = 9;
inline constexpr uint16_t kAlerts = 10;
inline constexpr uint16_t kTest = 11;
inline constexpr uint16_t kApiUsage = 12;
inline constexpr uint16_t kUnknown = 0xFFFF;
}  // namespace service_type

// Category and type codes used by the service itself.
inline constexpr uint32_t kSummaryEventCategory = 0xFFFFFFFF;
inline constexpr uint16_t kSummaryEventType = 0xFFFF;
inline constexpr uint32_t kDriverStatisticsCategory = 9;
inline constexpr uint16_t kDriverStatisticsType = 0;

// The lower-case name of a service type ("telephony"), or nothing for codes without a name.
std::optional<std::string> ServiceTypeName(uint16_t serviceType);

// "Group_Kind" name of a category: the group prefix only when the whole high half equals one
// group's bit ("Toolbox_Generic"); a bare "_" when the high half is anything else non-zero.
std::string CategoryName(uint32_t category);

// Name of a message type; "Unknown" for 65535, "Undefined" for other unlisted codes.
std::string TypeName(uint16_t type);

// The value of "HostApplicationDisplayID" in `userInfo`, as it is, or the string "Unknown" when
// the key is absent or there is no dictionary.
Value ApplicationNameFromUserInfo(const Dictionary* userInfo);

// Whether the device runs an internal build: `platform`'s DeviceInfoQuery is asked for
// "InternalBuild" once per context, even when several threads ask first at the same time; a
// context without the query answers false.
bool IsInternalBuild(PlatformServices& platform);

// Waits on `condition` until another thread sets `flag` (under the condition's lock, then
// signals) or `timeoutSeconds` pass without a signal. Every signal that leaves the flag unset
// starts a new full time-out. Logs the waiting message, "continuing" after each signal and the
// time-out message to `log` (the default log when null). True when the flag was seen set. The
// condition is unlocked on return. Never call it on a thread the signalling side needs.
bool RuvoReportingUtilityWait(Condition& condition, bool& flag, std::string_view waitingMessage,
                              std::string_view timeoutMessage, const LogHandle& log,
                              double timeoutSeconds);

}  // namespace tavrin
