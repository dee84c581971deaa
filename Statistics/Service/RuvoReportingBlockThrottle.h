#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "base/Dictionary.h"
#include "platform/Clock.h"
#include "platform/Dispatcher.h"

namespace tavrin {

// One pending delivery of the throttle: the newest callback for a key, when it is due, and the
// dispatcher timer that runs it then. `block` and the fire date may be read and written from any
// thread; the timer is armed only under the throttle's lock.
class RuvoReportingBlockThrottleTimerWrapper {
 public:
  using Block = std::function<void()>;

  explicit RuvoReportingBlockThrottleTimerWrapper(Clock& clock) : clock_(clock) {}

  Block block() const;
  void setBlock(Block block);

  // Moves the fire date to now plus `seconds` (negative or NaN: now) and returns the delay.
  Duration sleepFor(double seconds);
  SteadyTime fireDate() const;

 private:
  friend class RuvoReportingBlockThrottle;

  Clock& clock_;
  mutable std::mutex blockMutex_;
  Block block_;  // guarded by blockMutex_
  std::atomic<SteadyTime::rep> fireDate_{0};
  std::unique_ptr<Timer> timer_;  // guarded by the throttle's lock
};

// Per-key trailing-edge debounce: the first callback for a message key runs one throttle time
// after it was added, and every duplicate added before that replaces the callback and pushes the
// run to one throttle time after itself. Callbacks run one at a time on the throttle's own serial
// queue, in fire-date order, on the dispatcher's timers and clock. Messages configure it
// themselves with "_throttle_seconds" and "_comparison_field_blacklist".
class RuvoReportingBlockThrottle {
 public:
  using Block = RuvoReportingBlockThrottleTimerWrapper::Block;
  static constexpr const char* kQueueLabel = "com.quorvex.tavrin.blockthrottle";

  struct Timing {
    // waitForCompletion waits `completionSteps` times `completionStep` at the most.
    Duration completionStep = std::chrono::milliseconds(500);
    unsigned completionSteps = 10;
  };

  explicit RuvoReportingBlockThrottle(Dispatcher& dispatcher);
  RuvoReportingBlockThrottle(Dispatcher& dispatcher, Timing timing);
  // Pending callbacks never run once the throttle is gone; one that is running finishes. Never
  // call it from a callback.
  ~RuvoReportingBlockThrottle();

  RuvoReportingBlockThrottle(const RuvoReportingBlockThrottle&) = delete;
  RuvoReportingBlockThrottle& operator=(const RuvoReportingBlockThrottle&) = delete;

  // Schedules `block`, which delivers `message`, under the message's key. Returns at once; from
  // any thread.
  void addMessageBlock(Block block, int64_t reporterID, const Dictionary& message,
                       uint32_t category, uint16_t type);

  // Blocks until nothing is pending or the completion bound (5 s by default) has passed. Never
  // call it from a callback: the deliveries it waits for run on the throttle's queue.
  void waitForCompletion();

  // The key under which duplicates of `message` collapse: the message's fields sorted by name
  // (bytewise), each followed by its value text or "^" when the field is excluded from the
  // comparison, then "reporterID", the reporter ID, the category name and the type name, all
  // joined with "|".
  static std::string buildMessageKey(const Dictionary& message, int64_t reporterID,
                                     uint32_t category, uint16_t type);

  // The message's "_throttle_seconds", or 0.5 s when it is missing, not a number, or 5 s or more.
  static double determineSleepTime(const Dictionary& message);

 private:
  using WrapperPtr = std::shared_ptr<RuvoReportingBlockThrottleTimerWrapper>;

  // What the timers' work reaches: shared so that a delivery already running when the throttle
  // goes keeps it alive until it ends.
  struct State {
    std::mutex mutex;
    std::condition_variable emptied;
    std::map<std::string, WrapperPtr> timersInFlight;  // guarded by mutex
    bool stopped = false;                              // guarded by mutex
    std::atomic<uint64_t> failedDeliveries{0};
  };

  static void deliver(const std::shared_ptr<State>& state, const std::string& key,
                      const std::weak_ptr<RuvoReportingBlockThrottleTimerWrapper>& wrapper);
  size_t timersInFlightCount() const;

  Dispatcher& dispatcher_;
  const Timing timing_;
  SerialQueuePtr queue_;
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace tavrin
