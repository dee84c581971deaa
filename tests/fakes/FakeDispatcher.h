#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Dispatcher.h"
#include "tests/fakes/FakeClock.h"

namespace tavrin::testing {

// A deterministic Dispatcher for unit tests of the core. Nothing runs until the test says so:
// - RunUntilIdle() runs every runnable item, including items queued meanwhile and delayed items
//   already due. Across queues items run in the order they were queued; within a queue always in
//   order; a suspended queue's items wait until its last Resume().
// - AdvanceBy() moves the clock to each fire date in turn (AsyncAfter items and armed timers, in
//   fire-date order, ties in scheduling order), queues what fell due and runs until idle; then
//   moves the clock to the end of the interval and runs until idle again.
// Work may be queued from any thread; it runs only on the thread that calls RunUntilIdle() or
// AdvanceBy(). Items run with IsCurrent() true for their queue. Queues and timers follow the real
// contracts (counted suspension; a cancelled or re-armed timer never runs its earlier work), and
// misuse that the real dispatcher would abort on (Resume without Suspend) fails the test instead.
// Queues live as long as the dispatcher; after it is gone they drop whatever they are given.
class FakeDispatcher final : public Dispatcher {
 public:
  static constexpr const char* kBackgroundLabel = "com.quorvex.tavrin.background";

  // With a clock of its own, starting at FakeClock's fixed date.
  FakeDispatcher();
  // With the test's clock, which must outlive the dispatcher.
  explicit FakeDispatcher(FakeClock& clock);
  ~FakeDispatcher() override;
  FakeDispatcher(const FakeDispatcher&) = delete;
  FakeDispatcher& operator=(const FakeDispatcher&) = delete;

  SerialQueuePtr CreateSerialQueue(std::string label, QualityOfService qos) override;
  WorkQueue& BackgroundQueue() override;
  // `queue` may be any WorkQueue; the timer's work is handed to its Async when the timer fires.
  std::unique_ptr<Timer> CreateTimer(WorkQueue& queue, Work work) override;
  // Held back as AsyncAfter items are; RunDeferredNow() hands them to their queues (run them with
  // RunUntilIdle), and their later expiry does nothing.
  void AsyncDeferred(WorkQueue& queue, Duration delay, Work work) override;
  size_t RunDeferredNow() override;
  size_t DeferredCount() const override;
  Clock& GetClock() override { return clock_; }

  // Returns the number of items run. Calling either from inside a work item fails the test.
  size_t RunUntilIdle();
  size_t AdvanceBy(Duration duration);

  // Items queued on `queue` and not yet run (held by suspension or not).
  size_t PendingCount(const WorkQueue& queue) const;
  // How long from now until the earliest delayed item or armed timer falls due.
  std::optional<Duration> NextFireDelay() const;
  bool IsSuspended(const WorkQueue& queue) const;
  // The most recently created serial queue with `label`, or nullptr.
  SerialQueuePtr FindQueue(std::string_view label) const;

  struct State;

 private:
  FakeDispatcher(std::unique_ptr<FakeClock> own, FakeClock* clock);

  std::unique_ptr<FakeClock> ownClock_;
  FakeClock& clock_;
  std::shared_ptr<State> state_;
  WorkQueue& background_;
};

}  // namespace tavrin::testing
