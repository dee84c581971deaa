// The fake dispatcher's guarantees that the core's unit tests lean on.

#include "tests/fakes/FakeDispatcher.h"

#include <string>
#include <vector>

#include <gtest/gtest-spi.h>
#include <gtest/gtest.h>

#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeRandomSource.h"

namespace tavrin::testing {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

TEST(FakeDispatcherTest, NothingRunsUntilAskedThenQueuesKeepSubmissionOrder) {
  FakeDispatcher dispatcher;
  auto a = dispatcher.CreateSerialQueue("a", QualityOfService::kUserInitiated);
  auto b = dispatcher.CreateSerialQueue("b", QualityOfService::kUtility);
  std::vector<std::string> log;
  a->Async([&] {
    log.push_back("a1");
    // Queued while running: runs in the same call, after what was already waiting.
    a->Async([&] { log.push_back("a3"); });
  });
  b->Async([&] { log.push_back("b1"); });
  a->Async([&] { log.push_back("a2"); });
  dispatcher.BackgroundQueue().Async([&] { log.push_back("bg"); });

  EXPECT_TRUE(log.empty());
  EXPECT_EQ(dispatcher.PendingCount(*a), 2u);
  EXPECT_EQ(dispatcher.PendingCount(), 4u);
  EXPECT_EQ(dispatcher.RunUntilIdle(), 5u);
  EXPECT_EQ(log, (std::vector<std::string>{"a1", "b1", "a2", "bg", "a3"}));
  EXPECT_EQ(dispatcher.PendingCount(), 0u);

  ASSERT_EQ(dispatcher.CreatedQueues().size(), 2u);
  EXPECT_EQ(dispatcher.CreatedQueues()[1].label, "b");
  EXPECT_EQ(dispatcher.CreatedQueues()[1].qos, QualityOfService::kUtility);
  EXPECT_EQ(dispatcher.FindQueue("a"), a);
  EXPECT_EQ(dispatcher.FindQueue("missing"), nullptr);
  EXPECT_EQ(dispatcher.BackgroundQueue().Label(), "com.quorvex.tavrin.background");
}

TEST(FakeDispatcherTest, IsCurrentOnlyInsideItemsOfThatQueue) {
  FakeDispatcher dispatcher;
  auto a = dispatcher.CreateSerialQueue("a", QualityOfService::kDefault);
  auto b = dispatcher.CreateSerialQueue("b", QualityOfService::kDefault);
  bool aInside = false;
  bool bInside = true;
  a->Async([&] {
    aInside = a->IsCurrent();
    bInside = b->IsCurrent();
  });
  dispatcher.RunUntilIdle();
  EXPECT_TRUE(aInside);
  EXPECT_FALSE(bInside);
  EXPECT_FALSE(a->IsCurrent());
}

TEST(FakeDispatcherTest, SuspensionIsCountedAndHoldsOnlyThatQueue) {
  FakeDispatcher dispatcher;
  auto held = dispatcher.CreateSerialQueue("held", QualityOfService::kDefault);
  auto other = dispatcher.CreateSerialQueue("other", QualityOfService::kDefault);
  std::vector<int> log;
  held->Async([&] {
    log.push_back(1);
    // Suspending from inside the running item: it finishes, the next one waits.
    held->Suspend();
  });
  held->Async([&] { log.push_back(2); });
  held->Async([&] { log.push_back(3); });
  other->Async([&] { log.push_back(10); });

  dispatcher.RunUntilIdle();
  EXPECT_EQ(log, (std::vector<int>{1, 10}));
  EXPECT_TRUE(dispatcher.IsSuspended(*held));
  EXPECT_EQ(dispatcher.PendingCount(*held), 2u);

  held->Suspend();
  held->Resume();
  dispatcher.RunUntilIdle();
  EXPECT_EQ(log.size(), 2u) << "one Resume for two Suspends must not release the queue";

  held->Resume();
  EXPECT_FALSE(dispatcher.IsSuspended(*held));
  dispatcher.RunUntilIdle();
  EXPECT_EQ(log, (std::vector<int>{1, 10, 2, 3}));

  EXPECT_NONFATAL_FAILURE(held->Resume(), "not suspended");
}

TEST(FakeDispatcherTest, AdvanceByFiresDueItemsInFireOrderWithTheClockAtTheirDate) {
  FakeClock clock;
  FakeDispatcher dispatcher(clock);
  auto queue = dispatcher.CreateSerialQueue("q", QualityOfService::kDefault);
  const SteadyTime start = clock.Now();
  std::vector<std::pair<std::string, Duration>> log;
  auto record = [&](std::string name) {
    return [&, name] { log.emplace_back(name, clock.Now() - start); };
  };
  queue->AsyncAfter(seconds(9), record("nine"));
  dispatcher.BackgroundQueue().AsyncAfter(seconds(2), record("two"));
  queue->AsyncAfter(seconds(2), [&, record] {
    record("two-b")();
    // Scheduled from a fired item: falls inside the same AdvanceBy.
    queue->AsyncAfter(seconds(1), record("three"));
  });

  EXPECT_EQ(dispatcher.RunUntilIdle(), 0u);
  EXPECT_EQ(dispatcher.DelayedCount(), 3u);
  EXPECT_EQ(dispatcher.NextFireDelay(), Duration(seconds(2)));
  EXPECT_EQ(dispatcher.AdvanceBy(milliseconds(1999)), 0u);

  dispatcher.AdvanceBy(seconds(5));  // to 6.999 s
  EXPECT_EQ(log, (std::vector<std::pair<std::string, Duration>>{
                     {"two", seconds(2)}, {"two-b", seconds(2)}, {"three", seconds(3)}}));
  EXPECT_EQ(clock.Now() - start, milliseconds(6999));

  dispatcher.AdvanceBy(seconds(10));
  ASSERT_EQ(log.size(), 4u);
  EXPECT_EQ(log[3], std::make_pair(std::string("nine"), Duration(seconds(9))));
  EXPECT_EQ(dispatcher.BackgroundDelays(), std::vector<Duration>{seconds(2)});
  EXPECT_EQ(dispatcher.DelayedCount(), 0u);
}

TEST(FakeDispatcherTest, DelayedItemOnSuspendedQueueWaitsForResume) {
  FakeDispatcher dispatcher;
  auto queue = dispatcher.CreateSerialQueue("q", QualityOfService::kDefault);
  int runs = 0;
  queue->Suspend();
  queue->AsyncAfter(seconds(1), [&] { ++runs; });
  dispatcher.AdvanceBy(seconds(2));
  EXPECT_EQ(runs, 0);
  EXPECT_EQ(dispatcher.PendingCount(*queue), 1u);
  queue->Resume();
  dispatcher.RunUntilIdle();
  EXPECT_EQ(runs, 1);
}

TEST(FakeDispatcherTest, RearmedOrCancelledTimerNeverRunsEarlierWork) {
  FakeDispatcher dispatcher;
  auto queue = dispatcher.CreateSerialQueue("q", QualityOfService::kDefault);
  const SteadyTime start = dispatcher.Time().Now();
  std::vector<Duration> fired;
  auto timer =
      dispatcher.CreateTimer(*queue, [&] { fired.push_back(dispatcher.Time().Now() - start); });

  timer->ScheduleAfter(seconds(5));
  dispatcher.AdvanceBy(seconds(3));
  timer->ScheduleAfter(seconds(5));  // moves the fire date to 8 s
  EXPECT_EQ(dispatcher.DelayedCount(), 1u);
  dispatcher.AdvanceBy(seconds(4));
  EXPECT_TRUE(fired.empty());
  dispatcher.AdvanceBy(seconds(1));
  EXPECT_EQ(fired, std::vector<Duration>{seconds(8)});

  // Expired with its work already waiting on a suspended queue, then re-armed: the waiting work
  // belongs to the old arming and must not run.
  queue->Suspend();
  timer->ScheduleAfter(seconds(1));
  dispatcher.AdvanceBy(seconds(1));
  EXPECT_EQ(dispatcher.PendingCount(*queue), 1u);
  timer->ScheduleAfter(seconds(1));
  queue->Resume();
  dispatcher.RunUntilIdle();
  EXPECT_EQ(fired.size(), 1u);
  dispatcher.AdvanceBy(seconds(1));
  EXPECT_EQ(fired.size(), 2u);

  // Cancelled, then destroyed while its expired work waits: nothing runs.
  timer->ScheduleAfter(seconds(1));
  timer->Cancel();
  EXPECT_EQ(dispatcher.DelayedCount(), 0u);
  queue->Suspend();
  timer->ScheduleAfter(seconds(1));
  dispatcher.AdvanceBy(seconds(1));
  timer.reset();
  queue->Resume();
  dispatcher.AdvanceBy(seconds(10));
  EXPECT_EQ(fired.size(), 2u);
  EXPECT_EQ(dispatcher.TimerDelays().size(), 6u);
}

}  // namespace
}  // namespace tavrin::testing
