#include "Statistics/RuvoReportingUtility.h"

#include <array>
#include <chrono>
#include <cmath>

#include "platform/Platform.h"

namespace tavrin {
namespace {

// Indexed by service type code 0..12; 65535 is handled on its own.
constexpr std::array<const char*, 13> kServiceTypeNames = {
    "generic",          "ondra",         "telephony",
    "haptics",          "alarms",        "standalone",
    "soundautoconfig",  "longformaudio", "nonlongformaudio",
    "audiodeviceusage", "alerts",        "test",
    "apiusage",
};

struct CategoryGroup {
  uint32_t highHalf;
  const char* name;
};

// A group is named only when the whole high half equals its single bit.
constexpr std::array<CategoryGroup, 5> kCategoryGroups = {{
    {0x08000000, "Session"},
    {0x10000000, "DSP"},
    {0x20000000, "HAL"},
    {0x40000000, "Routing"},
    {0x80000000, "Toolbox"},
}};

// Indexed by the category's low half; 0 and 12 up are "Undefined".
constexpr std::array<const char*, 12> kCategoryKindNames = {
    "Undefined",     "Generic",     "Record", "Playback",   "PlaybackAndRecord", "Setup",
    "ClientRequest", "RouteChange", "Error",  "Metrioning", "Performance",       "Volume",
};

constexpr std::array<const char*, 6> kTypeNames = {
    "Generic", "Start", "Stop", "Setup", "Error", "IssueDetector",
};

constexpr const char* kUndefinedName = "Undefined";
constexpr const char* kUnknownName = "Unknown";
constexpr const char* kHostApplicationKey = "HostApplicationDisplayID";

constexpr uint32_t kLowHalfMask = 0xFFFF;
constexpr uint32_t kFirstGroupedCategory = 0x10000;

// Longest single wait a caller can ask for: keeps "now + time-out" far from the clock's range
// limit (about 292 years of nanoseconds) while being longer than any real wait.
constexpr double kMaxWaitSeconds = 100.0 * 365 * 24 * 3600;

Duration WaitDuration(double seconds) {
  // NaN and negative time-outs time out at once; huge ones are capped so the deadline is valid.
  if (!(seconds > 0)) return Duration::zero();
  if (seconds > kMaxWaitSeconds) seconds = kMaxWaitSeconds;
  return std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds));
}

// Releases the condition's lock on every way out of the wait, exceptions included.
class ConditionUnlocker {
 public:
  explicit ConditionUnlocker(Condition& condition) : condition_(condition) {}
  ~ConditionUnlocker() { condition_.Unlock(); }
  ConditionUnlocker(const ConditionUnlocker&) = delete;
  ConditionUnlocker& operator=(const ConditionUnlocker&) = delete;

 private:
  Condition& condition_;
};

}  // namespace

std::optional<std::string> ServiceTypeName(uint16_t serviceType) {
  if (serviceType < kServiceTypeNames.size()) return std::string(kServiceTypeNames[serviceType]);
  if (serviceType == service_type::kUnknown) return std::string("unknown");
  return std::nullopt;
}

std::string CategoryName(uint32_t category) {
  std::string name;
  if (category >= kFirstGroupedCategory && category != kSummaryEventCategory) {
    const uint32_t highHalf = category & ~kLowHalfMask;
    for (const auto& group : kCategoryGroups) {
      if (group.highHalf == highHalf) {
        name += group.name;
        break;
      }
    }
    name += '_';
  }
  const uint32_t kind = category & kLowHalfMask;
  name += kind < kCategoryKindNames.size() ? kCategoryKindNames[kind] : kUndefinedName;
  return name;
}

std::string TypeName(uint16_t type) {
  if (type < kTypeNames.size()) return kTypeNames[type];
  if (type == 0xFFFF) return kUnknownName;
  return kUndefinedName;
}

Value ApplicationNameFromUserInfo(const Dictionary* userInfo) {
  if (userInfo != nullptr && userInfo->is_object()) {
    const auto found = userInfo->find(kHostApplicationKey);
    if (found != userInfo->end()) return *found;
  }
  return kUnknownName;
}

bool IsInternalBuild(PlatformServices& platform) {
  DeviceFactOnce& fact = *platform.internalBuild;
  std::call_once(fact.once, [&] {
    // A platform without the query has no way to say "internal"; the safe answer is no.
    fact.value = platform.deviceInfo != nullptr &&
                 platform.deviceInfo->QueryBool(kDeviceInfoInternalBuild, false);
  });
  return fact.value;
}

bool RuvoReportingUtilityWait(Condition& condition, bool& flag, std::string_view waitingMessage,
                              std::string_view timeoutMessage, const LogHandle& log,
                              double timeoutSeconds) {
  condition.Lock();
  ConditionUnlocker unlocker(condition);
  if (flag) return true;
  const Duration timeout = WaitDuration(timeoutSeconds);
  for (;;) {
    TLOG_DEFAULT(log, "{}", waitingMessage);
    // Every round gets a whole new time-out: a signal that leaves the flag unset restarts it.
    const SteadyTime deadline = condition.GetClock().Now() + timeout;
    if (!condition.WaitUntil(deadline)) {
      TLOG_ERROR(log, "{}", timeoutMessage);
      return false;
    }
    TLOG_DEFAULT(log, "continuing");
    if (flag) return true;
  }
}

}  // namespace tavrin
