#include "Statistics/Service/ServiceWatchdog.h"

#include <utility>

namespace tavrin {

ServiceWatchdog::ServiceWatchdog(SerialQueuePtr queue, Clock& clock, Duration interval, Ping ping)
    : queue_(std::move(queue)), clock_(clock), interval_(interval), ping_(std::move(ping)) {
  // Counts as turned at start, so that the first pings do not wait for a probe to come back.
  turns_->last.store(clock_.Now().time_since_epoch().count());
}

void ServiceWatchdog::Tick() {
  const SteadyTime now = clock_.Now();
  const SteadyTime lastTurn{SteadyTime::duration(turns_->last.load())};
  if (now - lastTurn <= interval_) {
    pings_.fetch_add(1);
    if (ping_) ping_();
  }
  if (turns_->pending.exchange(true)) return;
  // The probe holds the shared record and the clock only, so a queue that runs it late, after
  // the watchdog is gone, touches nothing else.
  queue_->Async([turns = turns_, &clock = clock_] {
    turns->last.store(clock.Now().time_since_epoch().count());
    turns->pending.store(false);
  });
}

}  // namespace tavrin
