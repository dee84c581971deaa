#pragma once

#include <atomic>
#include <functional>
#include <memory>

#include "platform/Clock.h"
#include "platform/Dispatcher.h"

namespace tavrin {

// Tells the service manager that the service is alive only while its work queue really turns:
// each Tick() sends a probe through the queue and pings (WATCHDOG=1) only when the previous
// probe ran within `interval`. A queue that is stuck, suspended or starved stops the pings, and
// the service manager restarts the service; a process that is merely up does not.
class ServiceWatchdog {
 public:
  using Ping = std::function<void()>;

  ServiceWatchdog(SerialQueuePtr queue, Clock& clock, Duration interval, Ping ping);

  // Call about twice per interval, from any thread but the queue's.
  void Tick();
  // Pings sent so far.
  uint64_t Pings() const { return pings_.load(); }

 private:
  struct Turns {
    std::atomic<SteadyTime::rep> last{0};  // when a probe last ran on the queue
    std::atomic<bool> pending{false};      // one probe at a time: a stuck queue gathers no more
  };

  SerialQueuePtr queue_;
  Clock& clock_;
  const Duration interval_;
  Ping ping_;
  std::shared_ptr<Turns> turns_ = std::make_shared<Turns>();
  std::atomic<uint64_t> pings_{0};
};

}  // namespace tavrin
