// Sessions on a build that is not internal: no summary file, no orientation tracking. The
// internal-build answer is fixed once per process, hence an executable of its own.

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

class ExternalBuildTest : public SessionTestBase {
 protected:
  ExternalBuildTest() : SessionTestBase(/*internalBuild=*/false) {}
};

TEST_F(ExternalBuildTest, NoFileIsWrittenAndNoOrientationTrackedHoweverMuchWasAggregated) {
  // Telephony: a type that tracks orientation on an internal build (long-form audio, the other
  // one, takes the same road here: the build decides first).
  auto session = Create(42, 2);
  EXPECT_FALSE(session->shouldReportOrientation());
  StartAndRun(session);
  EXPECT_FALSE(session->orientationCallbackID().has_value());
  EXPECT_FALSE(session->startDate().has_value());
  for (int i = 0; i < 50; ++i) session->sendMessage(Dictionary{{"n", i}}, 1, 1, nullptr);
  session->stop();
  session->start();
  session->sendMessage(Dictionary{{"n", 0}}, 1, 1, nullptr);
  StopAndRun(session);
  EXPECT_TRUE(platform.fileSystem.CreateDirectoriesCalls().empty());
  EXPECT_TRUE(platform.fileSystem.WriteCalls().empty());
  EXPECT_TRUE(platform.orientation.History().empty());
  // The summary event itself is still sent.
  EXPECT_EQ(CountMessage("sending summary event for reporter 42"), 2u);
  // The device was asked at most once, whatever number of stops asked; its class never, as the
  // build alone decides about orientation.
  EXPECT_LE(platform.deviceInfo.QueryCount(kDeviceInfoInternalBuild), 1u);
  EXPECT_EQ(platform.deviceInfo.QueryCount(kDeviceInfoDeviceClassNumber), 0u);
}

}  // namespace
}  // namespace tavrin::testing
