// The promises of platform/Dispatcher.h, kept by the real pool (real threads and time) and by the
// fake the core's tests run on (nothing runs until the test runs it; time moves only when the test
// moves it): one suite over both. Then what only real threads can show.

#include <array>
#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/linux/dispatch/AsioDispatcher.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using Events = std::vector<std::string>;

constexpr auto kQuiet = 50ms;  // how long a "has not run" check watches

struct Driver {
  virtual ~Driver() = default;
  virtual Dispatcher& Get() = 0;
  // Lets `time` go by: the fake moves its clock and runs what falls due; the real one sleeps.
  virtual void Pass(Duration time) = 0;
  // Until `done` holds: the fake runs what it can, moving its clock from fire date to fire date.
  virtual bool Eventually(const std::function<bool()>& done) = 0;
  Duration slack = Duration::zero();  // how late delayed work may start
  bool totalOrder = true;             // items of every queue run in the order they were queued
};

// The real pool on one thread, so that a suspended queue holding on to it would stall the rest.
struct RealDriver final : Driver {
  RealDriver() { slack = testing::kWaitLimit, totalOrder = false; }
  Dispatcher& Get() override { return dispatcher; }
  void Pass(Duration time) override { std::this_thread::sleep_for(time); }
  bool Eventually(const std::function<bool()>& done) override { return testing::WaitFor(done); }
  AsioDispatcher dispatcher{1};
};

struct FakeDriver final : Driver {
  Dispatcher& Get() override { return dispatcher; }
  void Pass(Duration time) override { dispatcher.AdvanceBy(time); }
  bool Eventually(const std::function<bool()>& done) override {
    for (dispatcher.RunUntilIdle(); !done(); dispatcher.AdvanceBy(*dispatcher.NextFireDelay())) {
      if (!dispatcher.NextFireDelay()) return false;
    }
    return true;
  }
  testing::FakeDispatcher dispatcher;
};

class DispatcherContractTest : public ::testing::TestWithParam<std::unique_ptr<Driver> (*)()> {
 protected:
  SerialQueuePtr Queue() { return dispatcher_.CreateSerialQueue("q", QualityOfService::kDefault); }
  // Work that notes `event`, with "!" unless `queue` is the current one, and when it ran.
  Work Note(std::string event, const SerialQueuePtr& queue = nullptr) {
    return [this, event, queue] {
      std::lock_guard lock(mutex_);
      events_.push_back(event + (!queue || queue->IsCurrent() ? "" : "!"));
      at_[event] = dispatcher_.GetClock().Now() - start_;
    };
  }
  // The events so far, those starting with `first` when given.
  Events Seen(char first = 0) {
    std::lock_guard lock(mutex_);
    Events seen;
    std::copy_if(events_.begin(), events_.end(), std::back_inserter(seen),
                 [&](const std::string& e) { return !first || e[0] == first; });
    return seen;
  }
  bool SeenCount(size_t n) {
    return driver_->Eventually([&] { return Seen().size() == n; });
  }
  // Delayed work starts `delay` after it was asked at the soonest, and at most the slack later.
  void ExpectStartedAfter(const std::string& event, Duration delay) {
    std::lock_guard lock(mutex_);
    EXPECT_GE(at_[event], delay) << event;
    EXPECT_LE(at_[event], delay + driver_->slack) << event;
  }

  std::unique_ptr<Driver> driver_ = GetParam()();
  Dispatcher& dispatcher_ = driver_->Get();
  const SteadyTime start_ = dispatcher_.GetClock().Now();
  std::mutex mutex_;
  Events events_;                       // guarded by mutex_
  std::map<std::string, Duration> at_;  // guarded by mutex_
};

INSTANTIATE_TEST_SUITE_P(
    , DispatcherContractTest,
    ::testing::Values([]() -> std::unique_ptr<Driver> { return std::make_unique<RealDriver>(); },
                      []() -> std::unique_ptr<Driver> { return std::make_unique<FakeDriver>(); }),
    [](const auto& info) { return info.index == 0 ? "Asio" : "Fake"; });

TEST_P(DispatcherContractTest, SerialQueueRunsItsItemsInOrderAndIsCurrentOnlyInsideThem) {
  auto a = Queue(), b = Queue();
  a->Suspend();  // so that everything below waits when a1 runs
  a->Async([&] {
    Note("a1", a)();
    a->Async(Note("a3", a));  // queued while running: after what was already waiting
  });
  b->Async(Note("b1", b));
  a->Async(Note("a2", a));
  dispatcher_.BackgroundQueue().Async(
      [&] { Note(a->IsCurrent() || b->IsCurrent() ? "g!" : "g")(); });
  a->Resume();
  ASSERT_TRUE(SeenCount(5));
  EXPECT_EQ(Seen('a'), (Events{"a1", "a2", "a3"}));
  EXPECT_EQ(Seen('b'), (Events{"b1"}));
  EXPECT_EQ(Seen('g'), (Events{"g"}));
  EXPECT_FALSE(a->IsCurrent());
  EXPECT_TRUE(!driver_->totalOrder || Seen() == Events({"a1", "b1", "a2", "g", "a3"}));
}

// Suspended from inside its running item, which finishes; then suspended once more and resumed
// once. Its items, delayed ones too, wait; the other queue runs on the only pool thread.
TEST_P(DispatcherContractTest, SuspensionIsCountedAndHoldsOnlyThatQueueAndNoThread) {
  auto held = Queue(), other = Queue();
  held->Async([&] { Note("h1")(), held->Suspend(); });
  held->Async(Note("h2"));
  other->Async(Note("o1"));
  ASSERT_TRUE(SeenCount(2));
  held->Suspend();
  held->Resume();
  held->AsyncAfter(1ms, Note("h3"));
  driver_->Pass(kQuiet);
  EXPECT_EQ(Seen('h'), (Events{"h1"}));
  other->Async(Note("o2"));
  EXPECT_TRUE(SeenCount(3));
  held->Resume();
  ASSERT_TRUE(SeenCount(5));
  EXPECT_EQ(Seen('h'), (Events{"h1", "h2", "h3"}));
}

TEST_P(DispatcherContractTest, DelayedWorkRunsOnItsQueueNoSoonerThanItsDelay) {
  auto queue = Queue();
  queue->AsyncAfter(40ms, Note("q40", queue));
  dispatcher_.BackgroundQueue().AsyncAfter(20ms, Note("g20"));
  queue->AsyncAfter(20ms, [&] {
    Note("q20", queue)();
    queue->AsyncAfter(10ms, Note("q30", queue));  // counted from the time it is asked
  });
  driver_->Pass(45ms);  // the fake steps its clock from fire date to fire date within it
  ASSERT_TRUE(SeenCount(4));
  EXPECT_EQ(Seen('q').size(), 3u) << "delayed work ran off its queue";
  for (auto [event, delay] :
       {std::pair{"q40", 40ms}, {"g20", 20ms}, {"q20", 20ms}, {"q30", 30ms}}) {
    ExpectStartedAfter(event, delay);
  }
  EXPECT_GE(at_["q30"] - at_["q20"], 10ms);
}

// Deferred work waits for its delay like delayed work, is counted while it waits, and runs at
// once when it is asked to (the service asks when it stops); its own expiry then runs nothing.
TEST_P(DispatcherContractTest, DeferredWorkRunsAtItsDelayOrWhenAskedButOnce) {
  auto queue = Queue();
  dispatcher_.AsyncDeferred(*queue, 30ms, Note("d30", queue));
  ASSERT_TRUE(SeenCount(1));
  ExpectStartedAfter("d30", 30ms);
  EXPECT_EQ(dispatcher_.DeferredCount(), 0u);

  dispatcher_.AsyncDeferred(*queue, 500ms, Note("d500", queue));
  dispatcher_.AsyncDeferred(dispatcher_.BackgroundQueue(), 500ms, Note("g500"));
  EXPECT_EQ(dispatcher_.DeferredCount(), 2u);
  EXPECT_EQ(dispatcher_.RunDeferredNow(), 2u);
  EXPECT_EQ(dispatcher_.DeferredCount(), 0u);
  ASSERT_TRUE(SeenCount(3));
  EXPECT_EQ(Seen('d'), (Events{"d30", "d500"}));
  driver_->Pass(700ms);  // past their own expiry
  EXPECT_EQ(Seen().size(), 3u);
  EXPECT_EQ(dispatcher_.RunDeferredNow(), 0u);
  // Once released, later deferred work is not held back (work queued at a stop defers more).
  dispatcher_.AsyncDeferred(*queue, 10s, Note("late", queue));
  EXPECT_EQ(dispatcher_.DeferredCount(), 0u);
  ASSERT_TRUE(SeenCount(4));
}

// A re-armed timer forgets its earlier arming, a cancelled one fires no more, both can be armed
// again. Expired with its work already waiting on the (suspended) queue, then re-armed, cancelled
// or destroyed: that work belongs to an arming that no longer exists and never runs.
TEST_P(DispatcherContractTest, TimerRunsOnItsQueueForItsLatestArmingOnly) {
  // Passes work on to the queue, counting hand-overs: a timer's expiry is one.
  struct CountingQueue final : WorkQueue {
    explicit CountingQueue(WorkQueue& to) : target(to) {}
    void Async(Work work) override { target.Async(std::move(work)), ++handedOver; }
    void AsyncAfter(Duration, Work) override { ADD_FAILURE(); }
    const std::string& Label() const override { return target.Label(); }
    QualityOfService Qos() const override { return target.Qos(); }
    WorkQueue& target;
    std::atomic<size_t> handedOver{0};
  };
  auto queue = Queue();
  CountingQueue counting(*queue);
  int fired = 0;  // touched by the timer's work only
  auto timer =
      dispatcher_.CreateTimer(counting, [&] { Note("t" + std::to_string(++fired), queue)(); });
  timer->ScheduleAfter(5ms);
  timer->ScheduleAfter(60ms);
  ASSERT_TRUE(SeenCount(1));
  ExpectStartedAfter("t1", 60ms);
  timer->ScheduleAfter(1ms);
  timer->Cancel();
  driver_->Pass(kQuiet);
  timer->ScheduleAfter(1ms);
  ASSERT_TRUE(SeenCount(2));

  const std::function<void()> endings[] = {[&] { timer->ScheduleAfter(1h); },
                                           [&] { timer->Cancel(); }, [&] { timer.reset(); }};
  for (size_t i = 0; i < std::size(endings); ++i) {
    const size_t expiries = counting.handedOver + 1;
    queue->Suspend();
    timer->ScheduleAfter(Duration::zero());
    ASSERT_TRUE(driver_->Eventually([&] { return counting.handedOver == expiries; }));
    endings[i]();
    queue->Resume();
    queue->Async(Note("drained"));
    ASSERT_TRUE(SeenCount(3 + i));
  }
  EXPECT_EQ(Seen(), (Events{"t1", "t2", "drained", "drained", "drained"}));
}

// ---- Only the real pool ------------------------------------------------------------------------

TEST(AsioDispatcherTest, PerQueueOrderHoldsUnderLoadFromSeveralProducers) {
  AsioDispatcher dispatcher;
  constexpr int kQueues = 3, kProducers = 4, kItems = 1500;
  std::array<SerialQueuePtr, kQueues> queues;
  for (auto& q : queues) q = dispatcher.CreateSerialQueue("load", QualityOfService::kDefault);
  std::array<std::array<int, kProducers>, kQueues> last{};  // written by that queue's items
  std::array<std::atomic<int>, kQueues> inFlight{};
  std::atomic<int> faults{0};
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 1; i <= kItems; ++i) {
        const int q = (i + p) % kQueues;
        queues[q]->Async([&, p, i, q] {
          faults += inFlight[q]++ != 0;  // two items of one serial queue at once
          faults += !queues[q]->IsCurrent() || queues[(q + 1) % kQueues]->IsCurrent();
          faults += i <= last[q][p];  // reordered
          last[q][p] = i;
          --inFlight[q];
        });
      }
    });
  }
  for (auto& producer : producers) producer.join();
  ASSERT_TRUE(dispatcher.WaitUntilDrained(testing::kWaitLimit));
  EXPECT_EQ(faults.load(), 0);
}

// Drained means every item handed to a queue has run, a suspended queue's too; timers and delayed
// items count once due, and items freed with a queue that never resumed no longer count. An item
// that throws is logged and counted, and its queue carries on. Shutdown returns promptly, lets
// items queued on running queues finish, and drops (and counts) whatever comes late.
TEST(AsioDispatcherTest, DrainAndShutdownAccountForEveryItem) {
  testing::FakeLogSystem log;
  auto dispatcher = std::make_unique<AsioDispatcher>(2);
  auto queue = dispatcher->CreateSerialQueue("pending", QualityOfService::kDefault);
  auto held = dispatcher->CreateSerialQueue("held", QualityOfService::kDefault);
  std::atomic<int> ran{0}, late{0};
  auto timer = dispatcher->CreateTimer(*queue, [&] { ++late; });
  timer->ScheduleAfter(1h);
  queue->AsyncAfter(1h, [&] { ++late; });
  dispatcher->BackgroundQueue().AsyncAfter(59s, [&] { ++late; });
  held->Suspend();
  held->Async([] { throw std::runtime_error("boom"); });
  held->Async([] { throw 42; });
  held->Async([&] { ++ran; });
  EXPECT_FALSE(dispatcher->WaitUntilDrained(kQuiet));
  EXPECT_EQ(dispatcher->QueuedItems(), 3u);
  std::thread resumer([&] { std::this_thread::sleep_for(kQuiet), held->Resume(); });
  EXPECT_TRUE(dispatcher->WaitUntilDrained(testing::kWaitLimit));
  resumer.join();
  EXPECT_EQ(ran.load(), 1);
  EXPECT_EQ(dispatcher->FailedItems(), 2u);
  EXPECT_TRUE(log.Contains("held ended with an exception: boom"));
  EXPECT_TRUE(log.Contains("held ended with an unknown exception"));
  auto abandoned = dispatcher->CreateSerialQueue("abandoned", QualityOfService::kDefault);
  abandoned->Suspend();
  abandoned->Async([&] { ++late; });
  EXPECT_EQ(dispatcher->QueuedItems(), 1u);
  abandoned.reset();
  EXPECT_TRUE(dispatcher->WaitUntilDrained(Duration::zero()));

  held->Suspend();
  held->Async([&] { ++late; });
  for (int i = 0; i < 100; ++i) queue->Async([&] { ++ran; });
  const auto start = std::chrono::steady_clock::now();
  dispatcher->Shutdown();
  EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
  EXPECT_EQ(ran.load(), 101);
  EXPECT_EQ(dispatcher->DroppedAtShutdown(), 3u);  // the timer and the two delayed items
  queue->Async([&] { ++late; });
  timer->ScheduleAfter(Duration::zero());
  held->Resume();
  EXPECT_EQ(dispatcher->DroppedAtShutdown(), 5u);
  dispatcher->Shutdown();  // idempotent
  dispatcher.reset();
  // Queues and timers outliving the dispatcher drop what they are given.
  queue->Async([&] { ++late; });
  timer->ScheduleAfter(Duration::zero());
  timer.reset();
  EXPECT_EQ(late.load(), 0);
}

}  // namespace
}  // namespace tavrin
