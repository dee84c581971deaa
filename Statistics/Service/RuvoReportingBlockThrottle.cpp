#include "Statistics/Service/RuvoReportingBlockThrottle.h"

#include <asio/error.hpp>
#include <asio/post.hpp>

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

// Keys added during one round of the throttle thread rarely exceed a handful.
constexpr size_t kUnscheduledKeysInitialCapacity = 6;

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

void RuvoReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  Duration delay = Duration::zero();
  if (seconds > 0) {
    delay = std::chrono::duration_cast<Duration>(
        std::chrono::duration<double>(std::min(seconds, kMaxSleepSeconds)));
  }
  fireDate_.store((std::chrono::steady_clock::now() + delay).time_since_epoch().count());
}

SteadyTime RuvoReportingBlockThrottleTimerWrapper::fireDate() const {
  return SteadyTime(SteadyTime::duration(fireDate_.load()));
}

// ---------------------------------------------------------------------------------------------
// RuvoReportingBlockThrottle

RuvoReportingBlockThrottle::RuvoReportingBlockThrottle() : RuvoReportingBlockThrottle(Timing{}) {}

RuvoReportingBlockThrottle::RuvoReportingBlockThrottle(const Timing& timing) : timing_(timing) {
  unscheduledTimerKeys_.reserve(kUnscheduledKeysInitialCapacity);
  queueThread_ = std::thread([this] { threadLoop(); });
}

RuvoReportingBlockThrottle::~RuvoReportingBlockThrottle() {
  shouldKeepRunning_ = false;
  {
    // Taking the pause lock orders the flag before the thread's next look at it.
    std::lock_guard lock(pauseMutex_);
  }
  pauseWake_.notify_all();
  io_.stop();
  if (queueThread_.joinable()) queueThread_.join();

  // The thread is gone, so its timers may be released here; no pending wait outlives them.
  std::lock_guard lock(timersInFlightMutex_);
  for (auto& [key, wrapper] : timersInFlight_) invalidate(*wrapper);
  timersInFlight_.clear();
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

  // The look-up and the insert below are separate steps: two first messages of one key at the
  // same moment may both create entries, and only the later one is kept and delivered.
  if (WrapperPtr existing = findEntry(key)) {
    TLOG_DEBUG(nullptr, "Dropping duplicate message for {}", key);
    existing->sleepFor(seconds);
    existing->setBlock(std::move(block));
    // Only the throttle thread touches timers: it moves this one if it is already attached
    // (a timer not attached yet picks the new date up when it is).
    asio::post(io_, [this, weak = std::weak_ptr(existing), key = std::move(key)] {
      WrapperPtr wrapper = weak.lock();
      if (wrapper && wrapper->attached_) arm(wrapper, key);
    });
    return;
  }

  auto wrapper = std::make_shared<RuvoReportingBlockThrottleTimerWrapper>();
  wrapper->setBlock(std::move(block));
  wrapper->sleepFor(seconds);
  {
    std::lock_guard lock(timersInFlightMutex_);
    timersInFlight_[key] = wrapper;
  }
  {
    std::lock_guard lock(unscheduledTimerKeysMutex_);
    unscheduledTimerKeys_.push_back(std::move(key));
  }
}

void RuvoReportingBlockThrottle::waitForCompletion() {
  TLOG_INFO(nullptr, "waitForCompletion. timersInFlight={} unscheduledTimerKeys={}",
            timersInFlightCount(), unscheduledTimerKeysCount());
  if (timersInFlightCount() == 0) return;

  const auto boundSeconds =
      static_cast<unsigned>(std::chrono::duration_cast<std::chrono::seconds>(
                                timing_.completionStep * timing_.completionSteps)
                                .count());
  TLOG_DEBUG(nullptr, "Waiting up to {} seconds for blockThrottle queue to be empty.",
             boundSeconds);
  for (unsigned step = 0; step < timing_.completionSteps; ++step) {
    if (timersInFlightCount() == 0) break;
    std::this_thread::sleep_for(timing_.completionStep);
  }
  const size_t left = timersInFlightCount();
  if (left != 0) {
    TLOG_DEFAULT(nullptr, "Giving up on waiting for completion after {} seconds. timersInFlight={}",
                 boundSeconds, left);
  }
}

// ---------------------------------------------------------------------------------------------
// The throttle thread

void RuvoReportingBlockThrottle::threadLoop() {
  while (shouldKeepRunning_) {
    if (unscheduledTimerKeysCount() != 0) {
      TLOG_DEBUG(nullptr, "calling workingRunLoop run from inside thread block");
      attachUnscheduledTimers();
      runUntilNoTimersLeft();
    }
    TLOG_DEBUG(nullptr, "sleeping in thread");
    std::unique_lock lock(pauseMutex_);
    pauseWake_.wait_for(lock, timing_.pollInterval, [this] { return !shouldKeepRunning_; });
  }
}

void RuvoReportingBlockThrottle::attachUnscheduledTimers() {
  std::vector<std::string> keys;
  {
    std::lock_guard lock(unscheduledTimerKeysMutex_);
    keys.swap(unscheduledTimerKeys_);
    unscheduledTimerKeys_.reserve(kUnscheduledKeysInitialCapacity);
  }
  // Looked up one by one afterwards, so the two locks are never held together.
  for (const std::string& key : keys) {
    WrapperPtr wrapper = findEntry(key);
    // A key listed twice (two first messages at once) names one stored entry; attach it once.
    if (!wrapper || wrapper->attached_ || wrapper->invalidated_) continue;
    wrapper->attached_ = true;
    wrapper->timer_.emplace(io_);
    arm(wrapper, key);
  }
}

void RuvoReportingBlockThrottle::runUntilNoTimersLeft() {
  // A callback's exception escapes io_context::run() on this thread. Nothing else could observe
  // it, and letting it end the thread would strand every pending key (and end the process), so
  // it is logged and counted here and the round goes on; its entry was already removed.
  while (shouldKeepRunning_) {
    try {
      io_.run();
      break;
    } catch (const std::exception& error) {
      const uint64_t failures = ++failedDeliveries_;
      TLOG_ERROR(nullptr, "Throttled delivery raised an exception: {} ({} so far)", error.what(),
                 failures);
    } catch (...) {
      const uint64_t failures = ++failedDeliveries_;
      TLOG_ERROR(nullptr, "Throttled delivery raised an unknown exception ({} so far)", failures);
    }
  }
  io_.restart();
}

void RuvoReportingBlockThrottle::arm(const WrapperPtr& wrapper, const std::string& key) {
  if (wrapper->invalidated_ || !wrapper->timer_) return;
  const uint64_t generation = ++wrapper->generation_;
  // Moving the expiry aborts a pending wait, but a completion already queued still runs: the
  // generation tells onTimer which wait is current.
  wrapper->timer_->expires_at(wrapper->fireDate());
  wrapper->timer_->async_wait([this, wrapper, key, generation](const std::error_code& error) {
    onTimer(wrapper, key, generation, error);
  });
}

void RuvoReportingBlockThrottle::onTimer(const WrapperPtr& wrapper, const std::string& key,
                                         uint64_t generation, const std::error_code& error) {
  if (error == asio::error::operation_aborted) return;
  if (generation != wrapper->generation_ || wrapper->invalidated_) return;
  // The callback is read before the fire date: a duplicate moves the date before it replaces the
  // callback, so a callback seen here is never run before its own throttle time.
  Block block = wrapper->block();
  // A duplicate pushed the fire date after this wait was armed.
  if (wrapper->fireDate() > std::chrono::steady_clock::now()) {
    arm(wrapper, key);
    return;
  }
  // Replaced in the dictionary by a later first message of the same key: that one delivers.
  if (findEntry(key) != wrapper) {
    invalidate(*wrapper);
    return;
  }
  deliver(std::move(block), key);
}

void RuvoReportingBlockThrottle::deliver(Block block, const std::string& key) {
  // Removes the entry after the callback, also when the callback throws, so no stale entry
  // swallows later messages of the key.
  struct EntryRemover {
    RuvoReportingBlockThrottle& throttle;
    const std::string& key;
    ~EntryRemover() { throttle.removeEntry(key); }
  } remover{*this, key};
  if (block) block();
}

void RuvoReportingBlockThrottle::removeEntry(const std::string& key) {
  WrapperPtr entry;
  {
    std::lock_guard lock(timersInFlightMutex_);
    const auto found = timersInFlight_.find(key);
    if (found == timersInFlight_.end()) return;
    entry = std::move(found->second);
    timersInFlight_.erase(found);
  }
  invalidate(*entry);
}

void RuvoReportingBlockThrottle::invalidate(RuvoReportingBlockThrottleTimerWrapper& wrapper) {
  wrapper.invalidated_ = true;
  // Destroying the timer here keeps every timer's life on the thread that runs its io_context.
  wrapper.timer_.reset();
}

RuvoReportingBlockThrottle::WrapperPtr RuvoReportingBlockThrottle::findEntry(
    const std::string& key) const {
  std::lock_guard lock(timersInFlightMutex_);
  const auto found = timersInFlight_.find(key);
  return found == timersInFlight_.end() ? nullptr : found->second;
}

size_t RuvoReportingBlockThrottle::timersInFlightCount() const {
  std::lock_guard lock(timersInFlightMutex_);
  return timersInFlight_.size();
}

size_t RuvoReportingBlockThrottle::unscheduledTimerKeysCount() const {
  std::lock_guard lock(unscheduledTimerKeysMutex_);
  return unscheduledTimerKeys_.size();
}

}  // namespace tavrin
