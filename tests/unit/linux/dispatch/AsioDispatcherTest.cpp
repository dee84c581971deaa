// The real dispatcher against real threads: ordering, suspension without held threads, timers that
// never run stale work, and a prompt shutdown. Waits are bounded generously and only reached when
// something is wrong; nothing sleeps to let time pass except the short negative checks.

#include "platform/linux/dispatch/AsioDispatcher.h"

#include <pthread.h>

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <future>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/linux/time/SystemClock.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

// Reached only when something is broken; a loaded 2-core machine stays far below it.
constexpr milliseconds kGenerous(10000);
// How long a negative check ("has not run") watches.
constexpr milliseconds kQuietPeriod(50);

class Counter {
 public:
  void Add(int n = 1) {
    std::lock_guard lock(mutex_);
    count_ += n;
    changed_.notify_all();
  }
  bool WaitFor(int target, milliseconds timeout = kGenerous) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return count_ >= target; });
  }
  int Count() const {
    std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

// Runs a marker through `queue` and waits for it: everything queued before it has run by then.
bool Drain(WorkQueue& queue) {
  Counter done;
  queue.Async([&] { done.Add(); });
  return done.WaitFor(1);
}

// Passes work on to another queue, counting hand-overs, so a test can tell when a timer's expiry
// has delivered its work.
class CountingQueue final : public WorkQueue {
 public:
  explicit CountingQueue(WorkQueue& target) : target_(target) {}
  void Async(Work work) override {
    target_.Async(std::move(work));
    handedOver.Add();
  }
  void AsyncAfter(Duration delay, Work work) override {
    target_.AsyncAfter(delay, std::move(work));
  }
  const std::string& Label() const override { return target_.Label(); }
  QualityOfService Qos() const override { return target_.Qos(); }

  Counter handedOver;

 private:
  WorkQueue& target_;
};

TEST(AsioDispatcherTest, PerQueueOrderHoldsUnderLoadFromSeveralProducers) {
  AsioDispatcher dispatcher;
  constexpr int kQueues = 3;
  constexpr int kProducers = 4;
  constexpr int kItemsPerProducer = 1500;
  std::array<SerialQueuePtr, kQueues> queues;
  for (int q = 0; q < kQueues; ++q) {
    queues[q] =
        dispatcher.CreateSerialQueue("load-" + std::to_string(q), QualityOfService::kDefault);
  }
  // Written only by items of the queue they belong to.
  std::array<std::vector<std::pair<int, int>>, kQueues> seen;
  std::array<std::atomic<int>, kQueues> inFlight{};
  std::atomic<int> overlaps{0};
  std::atomic<int> notCurrent{0};
  Counter done;

  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < kItemsPerProducer; ++i) {
        const int q = (i + p) % kQueues;
        queues[q]->Async([&, p, i, q] {
          if (inFlight[q].fetch_add(1) != 0) ++overlaps;
          if (!queues[q]->IsCurrent() || queues[(q + 1) % kQueues]->IsCurrent()) ++notCurrent;
          seen[q].emplace_back(p, i);
          inFlight[q].fetch_sub(1);
          done.Add();
        });
      }
    });
  }
  for (auto& producer : producers) producer.join();
  ASSERT_TRUE(done.WaitFor(kProducers * kItemsPerProducer));

  EXPECT_EQ(overlaps.load(), 0) << "a serial queue ran two items at once";
  EXPECT_EQ(notCurrent.load(), 0);
  for (int q = 0; q < kQueues; ++q) {
    for (int p = 0; p < kProducers; ++p) {
      int last = -1;
      for (const auto& [producer, index] : seen[q]) {
        if (producer != p) continue;
        EXPECT_GT(index, last) << "queue " << q << " reordered producer " << p;
        last = index;
      }
    }
  }
  EXPECT_FALSE(queues[0]->IsCurrent());
}

TEST(AsioDispatcherTest, SuspendedQueueHoldsItsItemsButNoPoolThread) {
  AsioDispatcher dispatcher(1);  // one thread: a queue that kept it would stall everyone
  auto a = dispatcher.CreateSerialQueue("a", QualityOfService::kDefault);
  auto b = dispatcher.CreateSerialQueue("b", QualityOfService::kDefault);
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  Counter firstStarted;
  std::atomic<int> aRuns{0};
  a->Async([&] {
    firstStarted.Add();
    released.wait();
    ++aRuns;  // the running item finishes even though the queue is suspended meanwhile
  });
  a->Async([&] { ++aRuns; });
  a->Async([&] { ++aRuns; });
  ASSERT_TRUE(firstStarted.WaitFor(1));
  a->Suspend();
  release.set_value();

  Counter bRan;
  b->Async([&] { bRan.Add(); });
  ASSERT_TRUE(bRan.WaitFor(1)) << "suspended queue a kept the only pool thread";
  EXPECT_EQ(aRuns.load(), 1);
  std::this_thread::sleep_for(kQuietPeriod);
  EXPECT_EQ(aRuns.load(), 1);

  a->Resume();
  EXPECT_TRUE(Drain(*a));
  EXPECT_EQ(aRuns.load(), 3);
}

TEST(AsioDispatcherTest, ItemSuspendingItsOwnQueueFinishesAndLaterItemsWaitForResume) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("self-suspend", QualityOfService::kUserInitiated);
  std::vector<int> order;  // written by queue items only
  Counter suspended;
  queue->Async([&] {
    queue->Suspend();
    order.push_back(1);
    suspended.Add();
  });
  for (int i = 2; i <= 200; ++i) queue->Async([&, i] { order.push_back(i); });
  ASSERT_TRUE(suspended.WaitFor(1));
  std::this_thread::sleep_for(kQuietPeriod);

  std::promise<size_t> sizeAtResume;
  // The first item of the released queue sees what ran before it.
  queue->Async([&] { sizeAtResume.set_value(order.size()); });
  queue->Resume();
  for (int i = 201; i <= 300; ++i) queue->Async([&, i] { order.push_back(i); });
  ASSERT_TRUE(Drain(*queue));
  EXPECT_EQ(sizeAtResume.get_future().get(), 200u) << "items ran while the queue was suspended";
  ASSERT_EQ(order.size(), 300u);
  for (int i = 0; i < 300; ++i) ASSERT_EQ(order[i], i + 1);
}

TEST(AsioDispatcherTest, NestedSuspendNeedsAsManyResumes) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("nested", QualityOfService::kDefault);
  std::atomic<int> runs{0};
  queue->Suspend();
  queue->Suspend();
  queue->Async([&] { ++runs; });
  queue->Resume();
  std::this_thread::sleep_for(kQuietPeriod);
  EXPECT_EQ(runs.load(), 0);
  queue->Resume();
  EXPECT_TRUE(Drain(*queue));
  EXPECT_EQ(runs.load(), 1);
}

TEST(AsioDispatcherTest, IsCurrentOnlyOnTheThreadRunningThatQueuesItem) {
  AsioDispatcher dispatcher(2);
  auto a = dispatcher.CreateSerialQueue("a", QualityOfService::kDefault);
  auto b = dispatcher.CreateSerialQueue("b", QualityOfService::kDefault);
  std::promise<std::array<bool, 2>> inA;
  a->Async([&] { inA.set_value({a->IsCurrent(), b->IsCurrent()}); });
  EXPECT_EQ(inA.get_future().get(), (std::array<bool, 2>{true, false}));
  std::promise<bool> inBackground;
  dispatcher.BackgroundQueue().Async([&] { inBackground.set_value(a->IsCurrent()); });
  EXPECT_FALSE(inBackground.get_future().get());
  EXPECT_FALSE(a->IsCurrent());
}

TEST(AsioDispatcherTest, AsyncAfterRunsNotBeforeItsDelay) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("delayed", QualityOfService::kDefault);
  constexpr milliseconds kDelay(40);
  const auto start = steady_clock::now();
  std::promise<steady_clock::time_point> onQueue;
  std::promise<steady_clock::time_point> onBackground;
  queue->AsyncAfter(kDelay, [&] { onQueue.set_value(steady_clock::now()); });
  dispatcher.BackgroundQueue().AsyncAfter(kDelay,
                                          [&] { onBackground.set_value(steady_clock::now()); });
  auto queueFuture = onQueue.get_future();
  auto backgroundFuture = onBackground.get_future();
  ASSERT_EQ(queueFuture.wait_for(kGenerous), std::future_status::ready);
  ASSERT_EQ(backgroundFuture.wait_for(kGenerous), std::future_status::ready);
  EXPECT_GE(queueFuture.get() - start, kDelay);
  EXPECT_GE(backgroundFuture.get() - start, kDelay);

  // A delayed item for a suspended queue waits for Resume, like any other.
  std::atomic<int> runs{0};
  queue->Suspend();
  queue->AsyncAfter(milliseconds(1), [&] { ++runs; });
  std::this_thread::sleep_for(kQuietPeriod);
  EXPECT_EQ(runs.load(), 0);
  queue->Resume();
  // The delayed item was queued before the marker, since its timer has long expired.
  EXPECT_TRUE(Drain(*queue));
  EXPECT_EQ(runs.load(), 1);
}

TEST(AsioDispatcherTest, TimerFiresOnItsQueueAndRearmMovesTheFireDate) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("timer", QualityOfService::kDefault);
  Counter fired;
  std::atomic<bool> onQueue{false};
  steady_clock::time_point firedAt;
  auto timer = dispatcher.CreateTimer(*queue, [&] {
    onQueue = queue->IsCurrent();
    firedAt = steady_clock::now();
    fired.Add();
  });
  const auto start = steady_clock::now();
  timer->ScheduleAfter(milliseconds(5));
  timer->ScheduleAfter(milliseconds(60));  // moves the date; the first arming is forgotten
  ASSERT_TRUE(fired.WaitFor(1));
  EXPECT_GE(firedAt - start, milliseconds(60));
  EXPECT_TRUE(onQueue.load());
  std::this_thread::sleep_for(kQuietPeriod);
  EXPECT_EQ(fired.Count(), 1);

  timer->ScheduleAfter(milliseconds(1));  // a fired one-shot timer can be armed again
  EXPECT_TRUE(fired.WaitFor(2));
}

// Expired, its work already handed to the (suspended) queue, then re-armed, cancelled or
// destroyed: the waiting work belongs to an arming that no longer exists.
TEST(AsioDispatcherTest, TimerWorkAlreadyQueuedNeverRunsAfterRearmCancelOrDestruction) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("stale", QualityOfService::kDefault);
  CountingQueue counting(*queue);
  std::atomic<int> runs{0};
  auto timer = dispatcher.CreateTimer(counting, [&] { ++runs; });

  queue->Suspend();
  timer->ScheduleAfter(Duration::zero());
  ASSERT_TRUE(counting.handedOver.WaitFor(1));
  timer->ScheduleAfter(std::chrono::hours(1));
  queue->Resume();
  ASSERT_TRUE(Drain(*queue));
  EXPECT_EQ(runs.load(), 0) << "re-armed timer ran the work of its earlier arming";

  queue->Suspend();
  timer->ScheduleAfter(Duration::zero());
  ASSERT_TRUE(counting.handedOver.WaitFor(2));
  timer->Cancel();
  queue->Resume();
  ASSERT_TRUE(Drain(*queue));
  EXPECT_EQ(runs.load(), 0) << "cancelled timer ran its work";

  queue->Suspend();
  timer->ScheduleAfter(Duration::zero());
  ASSERT_TRUE(counting.handedOver.WaitFor(3));
  timer.reset();  // the queued work holds the timer's shared state, not the timer
  queue->Resume();
  ASSERT_TRUE(Drain(*queue));
  EXPECT_EQ(runs.load(), 0) << "destroyed timer ran its work";
}

// Re-arms and cancels land right around the expiry, so asio has often already queued the old
// completion (which then reports success) or the work is already waiting behind the re-arming
// item. Re-arming runs on the timer's own queue, so every run of the work can be attributed to the
// arming current at that moment.
TEST(AsioDispatcherTest, TimerRearmedOrCancelledAtExpiryNeverRunsStaleWork) {
  AsioDispatcher dispatcher(2);
  auto queue = dispatcher.CreateSerialQueue("race", QualityOfService::kDefault);
  constexpr Duration kDelay = std::chrono::microseconds(100);
  constexpr int kIterations = 600;

  struct Book {  // touched by items of `queue` only
    size_t generation = 0;
    std::vector<int> runs{0};
    steady_clock::time_point armedAt;
    bool cancelled = false;
    int legitimate = 0, early = 0, twice = 0, afterCancel = 0, cancels = 0;
  } book;
  std::unique_ptr<Timer> timer;
  timer = dispatcher.CreateTimer(*queue, [&] {
    const auto now = steady_clock::now();
    if (book.cancelled) {
      ++book.afterCancel;
    } else if (now < book.armedAt + kDelay) {
      ++book.early;  // before its own fire date: the work of an earlier arming
    } else if (++book.runs[book.generation] > 1) {
      ++book.twice;
    } else {
      ++book.legitimate;
    }
  });
  auto arm = [&] {
    ++book.generation;
    book.runs.push_back(0);
    book.cancelled = false;
    book.armedAt = steady_clock::now();
    timer->ScheduleAfter(kDelay);
  };

  for (int i = 0; i < kIterations; ++i) {
    std::promise<void> done;
    queue->Async([&, i] {
      arm();
      // Spin to a point between 40 us before and 60 us after the expiry.
      const auto until = book.armedAt + kDelay + std::chrono::microseconds(i % 11 * 10 - 40);
      while (steady_clock::now() < until) {
      }
      switch (i % 3) {
        case 0:
          arm();
          break;
        case 1:
          timer->Cancel();
          book.cancelled = true;
          ++book.cancels;
          break;
        default:
          break;  // left to fire
      }
      done.set_value();
    });
    ASSERT_EQ(done.get_future().wait_for(kGenerous), std::future_status::ready);
  }
  // A final arming left alone runs exactly once.
  std::promise<void> armed;
  queue->Async([&] {
    arm();
    armed.set_value();
  });
  armed.get_future().wait();
  const auto deadline = steady_clock::now() + kGenerous;
  for (;;) {
    std::promise<int> runs;
    queue->Async([&] { runs.set_value(book.runs[book.generation]); });
    if (runs.get_future().get() > 0 || steady_clock::now() > deadline) break;
    std::this_thread::sleep_for(milliseconds(1));
  }
  std::promise<Book> result;
  queue->Async([&] { result.set_value(book); });
  const Book final = result.get_future().get();
  EXPECT_EQ(final.early, 0);
  EXPECT_EQ(final.twice, 0);
  EXPECT_EQ(final.afterCancel, 0);
  EXPECT_EQ(final.runs.back(), 1);
  EXPECT_GT(final.legitimate, 0);
  EXPECT_EQ(final.cancels, kIterations / 3);
}

TEST(AsioDispatcherTest, ExceptionFromAnItemIsLoggedCountedAndTheQueueCarriesOn) {
  testing::FakeLogSystem log;
  AsioDispatcher dispatcher(1);
  auto queue = dispatcher.CreateSerialQueue("throws", QualityOfService::kDefault);
  std::atomic<bool> nextRan{false};
  queue->Async([] { throw std::runtime_error("boom"); });
  queue->Async([&] { nextRan = true; });
  ASSERT_TRUE(Drain(*queue));
  EXPECT_TRUE(nextRan.load());
  EXPECT_EQ(dispatcher.FailedItems(), 1u);
  EXPECT_TRUE(log.Contains("throws ended with an exception: boom"));
}

TEST(AsioDispatcherTest, DrainWaitsForItemsHeldBySuspendedQueuesButNotForFutureTimers) {
  AsioDispatcher dispatcher(2);
  EXPECT_TRUE(dispatcher.WaitUntilDrained(Duration::zero()));
  auto held = dispatcher.CreateSerialQueue("held", QualityOfService::kDefault);
  Counter ran;
  held->Suspend();
  for (int i = 0; i < 3; ++i) held->Async([&] { ran.Add(); });
  dispatcher.BackgroundQueue().Async([&] { ran.Add(); });
  auto timer = dispatcher.CreateTimer(*held, [&] { ran.Add(); });
  timer->ScheduleAfter(std::chrono::hours(1));

  ASSERT_TRUE(ran.WaitFor(1));
  EXPECT_FALSE(dispatcher.WaitUntilDrained(kQuietPeriod));
  EXPECT_EQ(dispatcher.QueuedItems(), 3u);  // the held items; the timer is not due
  std::thread resumer([&] {
    std::this_thread::sleep_for(kQuietPeriod);
    held->Resume();
  });
  EXPECT_TRUE(dispatcher.WaitUntilDrained(kGenerous));
  resumer.join();
  EXPECT_EQ(ran.Count(), 4);
  EXPECT_EQ(dispatcher.QueuedItems(), 0u);

  // Items freed with a queue that never resumed no longer count.
  auto abandoned = dispatcher.CreateSerialQueue("abandoned", QualityOfService::kDefault);
  abandoned->Suspend();
  abandoned->Async([&] { ran.Add(); });
  EXPECT_EQ(dispatcher.QueuedItems(), 1u);
  abandoned.reset();
  EXPECT_TRUE(dispatcher.WaitUntilDrained(Duration::zero()));
}

TEST(AsioDispatcherTest, ShutdownWithPendingTimersReturnsPromptlyAndDropsLateWork) {
  auto dispatcher = std::make_unique<AsioDispatcher>(2);
  auto queue = dispatcher->CreateSerialQueue("pending", QualityOfService::kDefault);
  auto held = dispatcher->CreateSerialQueue("held", QualityOfService::kDefault);
  std::atomic<int> lateRuns{0};
  std::atomic<int> drained{0};
  auto timer = dispatcher->CreateTimer(*queue, [&] { ++lateRuns; });
  timer->ScheduleAfter(std::chrono::hours(1));
  queue->AsyncAfter(std::chrono::hours(1), [&] { ++lateRuns; });
  dispatcher->BackgroundQueue().AsyncAfter(std::chrono::seconds(59), [&] { ++lateRuns; });
  held->Suspend();
  held->Async([&] { ++lateRuns; });
  // Already queued on a running queue: finishes before the threads are joined.
  for (int i = 0; i < 100; ++i) queue->Async([&] { ++drained; });

  const auto start = steady_clock::now();
  dispatcher->Shutdown();
  EXPECT_LT(steady_clock::now() - start, milliseconds(2000));
  EXPECT_EQ(drained.load(), 100);
  EXPECT_EQ(dispatcher->DroppedAtShutdown(), 3u);  // the timer and the two delayed items

  queue->Async([&] { ++lateRuns; });
  timer->ScheduleAfter(Duration::zero());
  held->Resume();
  EXPECT_EQ(dispatcher->DroppedAtShutdown(), 5u);
  dispatcher->Shutdown();  // idempotent
  dispatcher.reset();
  // Queues and timers outliving the dispatcher drop what they are given.
  queue->Async([&] { ++lateRuns; });
  timer->ScheduleAfter(Duration::zero());
  timer.reset();
  EXPECT_EQ(lateRuns.load(), 0);
}

}  // namespace
}  // namespace tavrin
