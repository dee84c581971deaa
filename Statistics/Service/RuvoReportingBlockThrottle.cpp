#include "Statistics/Service/RuvoReportingBlockThrottle.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <exception>
#include <limits>
#include <set>
#include <string_view>
#include <utility>

#include "Statistics/RuvoReportingUtility.h"
#include "platform/LogSystem.h"

namespace tavrin {
namespace {

// Fields whose values never take part in the comparison: time stamps that differ in every
// message, and the throttle's own configuration fields.
constexpr std::array<std::string_view, 5> kDefaultComparisonBlacklist = {
    "systemuptime_sec", "processuptime_ms", "ruvoreporting_timestamp",
    "_comparison_field_blacklist", "_throttle_seconds"};

constexpr const char* kComparisonBlacklistField = "_comparison_field_blacklist";
constexpr const char* kThrottleSecondsField = "_throttle_seconds";
constexpr const char* kVolumeField = "Volume";
constexpr const char* kVolumeOperationTimeField = "VolumeOperationTime";
constexpr const char* kExcludedValueText = "^";
constexpr char kKeySeparator = '|';

constexpr double kDefaultThrottleSeconds = 0.5;
// A throttle time of this many seconds or more is refused: it would hold a burst's last message
// back too long.
constexpr double kMaxThrottleSeconds = 5.0;
constexpr int64_t kLargestAcceptedWholeSeconds = 4;

// Caps a fire date far beyond any accepted throttle time, so the deadline arithmetic stays valid.
constexpr double kMaxSleepSeconds = 24.0 * 3600;

// A throttle time as the timer reads it: single precision, widened back.
double AsSinglePrecision(double seconds) {
  // Out-of-range finite values cannot be converted to float; any negative fires at once anyway.
  constexpr double kLowestFloat = std::numeric_limits<float>::lowest();
  return static_cast<double>(static_cast<float>(std::max(seconds, kLowestFloat)));
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// RuvoReportingBlockThrottleTimerWrapper

RuvoReportingBlockThrottleTimerWrapper::Block RuvoReportingBlockThrottleTimerWrapper::block()
    const {
  std::lock_guard lock(blockMutex_);
  return block_;
}

void RuvoReportingBlockThrottleTimerWrapper::setBlock(Block block) {
  Block previous;
  {
    std::lock_guard lock(blockMutex_);
    previous = std::exchange(block_, std::move(block));
  }
  // `previous` (and whatever it captured) is released here, outside the lock.
}

Duration RuvoReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  Duration delay = Duration::zero();
  if (seconds > 0) {
    delay = std::chrono::duration_cast<Duration>(
        std::chrono::duration<double>(std::min(seconds, kMaxSleepSeconds)));
  }
  fireDate_.store((clock_.Now() + delay).time_since_epoch().count());
  return delay;
}

SteadyTime RuvoReportingBlockThrottleTimerWrapper::fireDate() const {
  return SteadyTime(SteadyTime::duration(fireDate_.load()));
}

// ---------------------------------------------------------------------------------------------
// RuvoReportingBlockThrottle

RuvoReportingBlockThrottle::RuvoReportingBlockThrottle(Dispatcher& dispatcher)
    : RuvoReportingBlockThrottle(dispatcher, Timing{}) {}

RuvoReportingBlockThrottle::RuvoReportingBlockThrottle(Dispatcher& dispatcher, Timing timing)
    : dispatcher_(dispatcher),
      timing_(timing),
      queue_(dispatcher.CreateSerialQueue(kQueueLabel, QualityOfService::kUtility)) {}

RuvoReportingBlockThrottle::~RuvoReportingBlockThrottle() {
  std::map<std::string, WrapperPtr> pending;
  {
    std::lock_guard lock(state_->mutex);
    state_->stopped = true;
    pending.swap(state_->timersInFlight);
    // A cancelled timer never runs its work, even when its expiry is already being processed.
    for (auto& [key, wrapper] : pending) wrapper->timer_->Cancel();
  }
}

std::string RuvoReportingBlockThrottle::buildMessageKey(const Dictionary& message,
                                                        int64_t reporterID, uint32_t category,
                                                        uint16_t type) {
  std::set<std::string, std::less<>> excluded(kDefaultComparisonBlacklist.begin(),
                                              kDefaultComparisonBlacklist.end());
  std::vector<std::pair<std::string_view, const Value*>> fields;
  if (message.is_object()) {
    const auto blacklist = message.find(kComparisonBlacklistField);
    if (blacklist != message.end() && blacklist->is_array()) {
      for (const Value& field : *blacklist) {
        // Only a string can equal a field name.
        if (field.is_string()) excluded.insert(field.get<std::string>());
      }
    }
    // Volume reports (a level with its operation time) collapse whatever their values, so a
    // ramp delivers only its last level.
    if (message.contains(kVolumeField) && message.contains(kVolumeOperationTimeField)) {
      excluded.insert(kVolumeField);
      excluded.insert(kVolumeOperationTimeField);
    }
    fields.reserve(message.size());
    for (auto it = message.begin(); it != message.end(); ++it) {
      fields.emplace_back(it.key(), &it.value());
    }
  }
  // Bytewise order: std::char_traits<char> compares characters as unsigned codes.
  std::sort(fields.begin(), fields.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });

  std::string key;
  auto append = [&key](std::string_view part) {
    if (!key.empty()) key += kKeySeparator;
    key += part;
  };
  for (const auto& [name, value] : fields) {
    append(name);
    if (excluded.contains(name)) {
      append(kExcludedValueText);
    } else if (value->is_structured()) {
      // Equal dictionaries built in different orders are the same message: nested keys are
      // sorted at every depth (nlohmann::json keeps its keys in a sorted map).
      append(nlohmann::json::parse(value->dump()).dump());
    } else {
      append(ValueText(*value));
    }
  }
  append("reporterID");
  append(fmt::format("{}", reporterID));
  append(CategoryName(category));
  append(TypeName(type));
  return key;
}

double RuvoReportingBlockThrottle::determineSleepTime(const Dictionary& message) {
  if (!message.is_object()) return kDefaultThrottleSeconds;
  const auto found = message.find(kThrottleSecondsField);
  if (found == message.end()) return kDefaultThrottleSeconds;
  const Value& value = *found;

  // Booleans travel as numbers (1 and 0), as they do everywhere else in a message.
  if (value.is_number() || value.is_boolean()) {
    double seconds = 0;
    bool accepted = false;
    if (value.is_boolean()) {
      seconds = value.get<bool>() ? 1 : 0;
      accepted = true;
    } else if (value.is_number_unsigned()) {
      const uint64_t whole = value.get<uint64_t>();
      seconds = static_cast<double>(whole);
      accepted = whole <= static_cast<uint64_t>(kLargestAcceptedWholeSeconds);
    } else if (value.is_number_integer()) {
      const int64_t whole = value.get<int64_t>();
      seconds = static_cast<double>(whole);
      accepted = whole <= kLargestAcceptedWholeSeconds;
    } else {
      seconds = value.get<double>();
      // The whole part truncated toward zero is at most 4 exactly when the value is below 5.
      // NaN has no whole part and is refused.
      accepted = seconds < kLargestAcceptedWholeSeconds + 1;
    }
    if (accepted) return AsSinglePrecision(seconds);
    TLOG_INFO(nullptr, "Rejecting large throttle time. {{time={}, max={:f}}}", value,
              kMaxThrottleSeconds);
    return kDefaultThrottleSeconds;
  }
  TLOG_INFO(nullptr, "Rejecting non-number value of throttle time. {{time={}}}", value);
  return kDefaultThrottleSeconds;
}

void RuvoReportingBlockThrottle::addMessageBlock(Block block, int64_t reporterID,
                                                 const Dictionary& message, uint32_t category,
                                                 uint16_t type) {
  std::string key = buildMessageKey(message, reporterID, category, type);
  const double seconds = determineSleepTime(message);

  std::lock_guard lock(state_->mutex);
  if (state_->stopped) return;
  const auto existing = state_->timersInFlight.find(key);
  if (existing != state_->timersInFlight.end()) {
    TLOG_DEBUG(nullptr, "Dropping duplicate message for {}", key);
    RuvoReportingBlockThrottleTimerWrapper& wrapper = *existing->second;
    // Re-arming means the earlier arming's work never runs, even if its expiry was already
    // being processed: the replaced callback can never run early.
    wrapper.setBlock(std::move(block));
    wrapper.timer_->ScheduleAfter(wrapper.sleepFor(seconds));
    return;
  }
  auto wrapper = std::make_shared<RuvoReportingBlockThrottleTimerWrapper>(dispatcher_.GetClock());
  wrapper->setBlock(std::move(block));
  const Duration delay = wrapper->sleepFor(seconds);
  wrapper->timer_ = dispatcher_.CreateTimer(
      *queue_, [state = state_, key, weak = std::weak_ptr(wrapper)] { deliver(state, key, weak); });
  wrapper->timer_->ScheduleAfter(delay);
  state_->timersInFlight.emplace(std::move(key), std::move(wrapper));
}

void RuvoReportingBlockThrottle::deliver(
    const std::shared_ptr<State>& state, const std::string& key,
    const std::weak_ptr<RuvoReportingBlockThrottleTimerWrapper>& weak) {
  TLOG_OPERATION("deliver");
  WrapperPtr wrapper;
  {
    std::lock_guard lock(state->mutex);
    const auto found = state->timersInFlight.find(key);
    if (state->stopped || found == state->timersInFlight.end() || found->second != weak.lock()) {
      return;
    }
    // The entry goes before the callback runs, so no stale entry swallows later messages of the
    // key, also when the callback throws.
    wrapper = std::move(found->second);
    state->timersInFlight.erase(found);
    if (state->timersInFlight.empty()) state->emptied.notify_all();
  }
  try {
    if (Block block = wrapper->block()) block();
  } catch (const std::exception& error) {
    const uint64_t failures = ++state->failedDeliveries;
    TLOG_ERROR(nullptr, "Throttled delivery raised an exception: {} ({} so far)", error.what(),
               failures);
  } catch (...) {
    const uint64_t failures = ++state->failedDeliveries;
    TLOG_ERROR(nullptr, "Throttled delivery raised an unknown exception ({} so far)", failures);
  }
  // Releasing the wrapper here destroys the timer whose work this is: the dispatcher keeps
  // a running timer's work alive by itself.
}

void RuvoReportingBlockThrottle::waitForCompletion() {
  const size_t inFlight = timersInFlightCount();
  TLOG_INFO(nullptr, "waitForCompletion. timersInFlight={} unscheduledTimerKeys={}", inFlight, 0);
  if (inFlight == 0) return;

  const Duration bound = timing_.completionStep * timing_.completionSteps;
  const auto boundSeconds =
      static_cast<unsigned>(std::chrono::duration_cast<std::chrono::seconds>(bound).count());
  TLOG_DEBUG(nullptr, "Waiting up to {} seconds for blockThrottle queue to be empty.",
             boundSeconds);
  std::unique_lock lock(state_->mutex);
  if (!state_->emptied.wait_for(lock, bound, [&] { return state_->timersInFlight.empty(); })) {
    TLOG_DEFAULT(nullptr, "Giving up on waiting for completion after {} seconds. timersInFlight={}",
                 boundSeconds, state_->timersInFlight.size());
  }
}

size_t RuvoReportingBlockThrottle::timersInFlightCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->timersInFlight.size();
}

}  // namespace tavrin
