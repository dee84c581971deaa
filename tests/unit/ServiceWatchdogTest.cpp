#include "Statistics/Service/ServiceWatchdog.h"

#include <gtest/gtest.h>

#include "tests/fakes/FakeDispatcher.h"

namespace tavrin {
namespace {

using std::chrono::seconds;

// Pings only while probes come back through the work queue within the interval; a stuck queue
// stops them, holds one probe at the most, and they resume once it turns again.
TEST(ServiceWatchdogTest, PingsOnlyWhileTheQueueTurns) {
  testing::FakeDispatcher dispatcher;
  SerialQueuePtr queue = dispatcher.CreateSerialQueue("work", QualityOfService::kUserInteractive);
  int pings = 0;
  ServiceWatchdog watchdog(queue, dispatcher.GetClock(), seconds(10), [&] { ++pings; });

  for (int i = 0; i < 4; ++i) {
    watchdog.Tick();
    dispatcher.AdvanceBy(seconds(5));
  }
  EXPECT_EQ(pings, 4);

  queue->Suspend();  // stuck: the probe that is queued now never comes back
  watchdog.Tick();
  dispatcher.AdvanceBy(seconds(5));
  watchdog.Tick();  // the last probe ran 10 s ago: just alive
  EXPECT_EQ(pings, 6);
  for (int i = 0; i < 6; ++i) {
    dispatcher.AdvanceBy(seconds(5));
    watchdog.Tick();
  }
  EXPECT_EQ(pings, 6) << "pinged for a queue that had not turned for over 10 s";
  EXPECT_EQ(dispatcher.PendingCount(*queue), 1u) << "probes piled up behind the stuck queue";

  queue->Resume();
  dispatcher.RunUntilIdle();
  watchdog.Tick();
  EXPECT_EQ(pings, 7);
  EXPECT_EQ(watchdog.Pings(), 7u);
}

}  // namespace
}  // namespace tavrin
