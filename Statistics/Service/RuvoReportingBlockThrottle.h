#pragma once

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/Dictionary.h"
#include "platform/Clock.h"

namespace tavrin {

class RuvoReportingBlockThrottle;

// One pending delivery of the throttle: the newest callback for a key and when it is due.
// `block` and the fire date may be read and written from any thread. The asio timer that carries
// the fire date is created, armed and destroyed only on the throttle's thread.
class RuvoReportingBlockThrottleTimerWrapper {
 public:
  using Block = std::function<void()>;

  Block block() const;
  void setBlock(Block block);

  // Moves the fire date to now plus `seconds` (negative or NaN: now).
  void sleepFor(double seconds);
  SteadyTime fireDate() const;

 private:
  friend class RuvoReportingBlockThrottle;

  mutable std::mutex blockMutex_;
  Block block_;  // guarded by blockMutex_
  std::atomic<SteadyTime::rep> fireDate_{0};

  // Throttle thread only.
  std::optional<asio::steady_timer> timer_;
  uint64_t generation_ = 0;  // the wait whose completion may deliver; older ones are stale
  bool attached_ = false;
  bool invalidated_ = false;
};

// Per-key trailing-edge debounce with its own thread: the first callback for a message key runs
// one throttle time after it was added, and every duplicate added before that replaces the
// callback and pushes the run to one throttle time after itself. Callbacks run on the throttle
// thread, one at a time, in fire-date order. Messages configure it themselves with
// "_throttle_seconds" and "_comparison_field_blacklist".
//
// Timers are asio steady timers on a private io_context that only the throttle thread runs.
// A round of that thread attaches the timers of newly added keys and runs the io_context until
// no timer is left, then pauses for the poll interval.
class RuvoReportingBlockThrottle {
 public:
  using Block = RuvoReportingBlockThrottleTimerWrapper::Block;

  struct Timing {
    // Pause between rounds of the throttle thread while no new key is waiting.
    Duration pollInterval = std::chrono::milliseconds(100);
    // waitForCompletion polls `completionSteps` times, `completionStep` apart.
    Duration completionStep = std::chrono::milliseconds(500);
    unsigned completionSteps = 10;
  };

  // Starts the throttle thread with the standard timing (0.1 s pause, 10 x 0.5 s wait).
  RuvoReportingBlockThrottle();
  // For tests: the same with shorter pauses.
  explicit RuvoReportingBlockThrottle(const Timing& timing);

  // The service keeps its throttle for the life of the process; this exists for tests and an
  // orderly exit. It finishes the callback that is running, if any, and stops the thread;
  // pending callbacks never run. Never call it from a callback.
  ~RuvoReportingBlockThrottle();

  RuvoReportingBlockThrottle(const RuvoReportingBlockThrottle&) = delete;
  RuvoReportingBlockThrottle& operator=(const RuvoReportingBlockThrottle&) = delete;

  // Schedules `block`, which delivers `message`, under the message's key. Returns at once; from
  // any thread.
  void addMessageBlock(Block block, int64_t reporterID, const Dictionary& message,
                       uint32_t category, uint16_t type);

  // Blocks until nothing is pending or the completion bound (5 s by default) has passed. Never
  // call it from a callback: the deliveries it waits for run on that same thread.
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

  void threadLoop();
  void attachUnscheduledTimers();
  void runUntilNoTimersLeft();
  void arm(const WrapperPtr& wrapper, const std::string& key);
  void onTimer(const WrapperPtr& wrapper, const std::string& key, uint64_t generation,
               const std::error_code& error);
  void deliver(Block block, const std::string& key);
  void removeEntry(const std::string& key);
  static void invalidate(RuvoReportingBlockThrottleTimerWrapper& wrapper);
  WrapperPtr findEntry(const std::string& key) const;
  size_t timersInFlightCount() const;
  size_t unscheduledTimerKeysCount() const;

  const Timing timing_;
  std::atomic<bool> shouldKeepRunning_{true};

  // Declared before the entries so that timers are destroyed before their io_context.
  asio::io_context io_;

  mutable std::recursive_mutex timersInFlightMutex_;
  std::map<std::string, WrapperPtr> timersInFlight_;  // guarded by timersInFlightMutex_

  mutable std::recursive_mutex unscheduledTimerKeysMutex_;
  std::vector<std::string> unscheduledTimerKeys_;  // guarded by unscheduledTimerKeysMutex_

  // Wakes the pause between rounds when the throttle is destroyed.
  std::mutex pauseMutex_;
  std::condition_variable pauseWake_;

  std::atomic<uint64_t> failedDeliveries_{0};
  std::thread queueThread_;  // last: starts after everything it uses exists
};

}  // namespace tavrin
