// Orientation tracking of telephony and long-form audio sessions on internal builds.

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

using std::chrono::microseconds;
using std::chrono::milliseconds;
using Kind = FakeOrientationRegistry::Kind;

constexpr const char* kCallbackID = "RuvoReportingService 42";

class OrientationTest : public SessionTestBase {
 protected:
  std::shared_ptr<RuvoReportingSession> Started(uint16_t serviceType) {
    auto session = Create(42, serviceType);
    session->start();
    platform.dispatcher.RunUntilIdle();
    return session;
  }
};

TEST_F(OrientationTest, TelephonyAndLongFormAudioRegisterDeviceThenUI) {
  for (uint16_t type : {uint16_t{2}, uint16_t{7}}) {
    const size_t before = platform.orientation.History().size();
    auto session = Started(type);
    EXPECT_TRUE(session->shouldReportOrientation());
    EXPECT_EQ(session->orientationCallbackID(), kCallbackID);
    EXPECT_EQ(session->startDate(), platform.clock.Now());
    session->stop();
    EXPECT_FALSE(session->orientationCallbackID().has_value());
    EXPECT_EQ(platform.orientation.FireDevice("portrait"), 0u);

    const auto history = platform.orientation.History();
    ASSERT_EQ(history.size(), before + 4);
    const Kind kinds[] = {Kind::kDevice, Kind::kUI, Kind::kDevice, Kind::kUI};
    const bool registered[] = {true, true, false, false};
    for (size_t i = 0; i < 4; ++i) {
      EXPECT_EQ(history[before + i].kind, kinds[i]) << i;
      EXPECT_EQ(history[before + i].registered, registered[i]) << i;
      EXPECT_EQ(history[before + i].id, kCallbackID) << i;
    }
  }
}

TEST_F(OrientationTest, OtherServiceTypesDeviceClassSixAndNeverStartedSessionsNeverTrack) {
  for (uint16_t type : {uint16_t{0}, uint16_t{3}, uint16_t{8}, uint16_t{0xFFFF}}) {
    auto session = Started(type);
    EXPECT_FALSE(session->orientationCallbackID().has_value()) << type;
    session->stop();
  }
  Create(42, 2)->stop();  // never started: nothing to unregister
  platform.deviceInfo.SetInt32(kDeviceInfoDeviceClassNumber, 6);
  auto session = Started(2);
  EXPECT_FALSE(session->shouldReportOrientation());
  EXPECT_FALSE(session->orientationCallbackID().has_value());
  EXPECT_TRUE(platform.orientation.History().empty());

  platform.deviceInfo.SetInt32(kDeviceInfoDeviceClassNumber, 5);
  EXPECT_TRUE(session->shouldReportOrientation());
}

TEST_F(OrientationTest, TimesAreRoundedToWholeMilliseconds) {
  platform.orientation.SetText("3", "landscape-left");
  auto session = Started(2);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "com.example.call"}});
  platform.clock.Advance(microseconds(12600));
  EXPECT_EQ(platform.orientation.FireUI("3"), 1u);
  platform.clock.Advance(microseconds(2000400 - 12600));
  EXPECT_EQ(platform.orientation.FireDevice("portrait"), 1u);
  platform.clock.Advance(microseconds(500));  // 2.0009 s: rounded, not cut off
  platform.orientation.FireDevice("face-up");

  EXPECT_EQ(Aggregated(session->summaryTexts()), 3u);
  const Dictionary summary{{"Ruvo_Session_Summary_Event", "2"},
                           {"ui_orientation", "landscape-left"},
                           {"ui_orientation_time", "0.013"},
                           {"device_orientation", "portrait,face-up"},
                           {"device_orientation_time", "2,2.001"}};
  EXPECT_EQ(session->createSummaryEventForSession()->dump(), summary.dump());
  // Records are not messages: not counted, not in the nested list.
  EXPECT_EQ(session->messageTypeCounts(), Dictionary::object());
  EXPECT_TRUE(Entries(session->spool()).empty());

  for (const char* line :
       {"mode=ui orientation=\"landscape-left\" app=\"com.example.call\", time=0.013",
        "mode=device orientation=\"portrait\" app=\"com.example.call\", time=2"}) {
    EXPECT_EQ(CountMessage(std::string("Orientation handler callback ") + line +
                               ", id=\"RuvoReportingService 42\"",
                           LogLevel::kDebug),
              1u);
  }
}

TEST_F(OrientationTest, TheCallbacksHoldTheSessionUntilStopUnregistersThem) {
  std::weak_ptr<RuvoReportingSession> weak = Started(2);
  // Released without stop: still registered, still aggregating.
  ASSERT_FALSE(weak.expired());
  EXPECT_EQ(platform.orientation.FireUI("portrait"), 1u);
  EXPECT_EQ(Aggregated(weak.lock()->summaryTexts()), 1u);

  // A type changed before stop leaves the callbacks registered; what they report after stop is
  // kept nowhere.
  weak.lock()->setServiceType(3);
  weak.lock()->stop();
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kDevice, kCallbackID));
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kUI, kCallbackID));
  EXPECT_EQ(weak.lock()->orientationCallbackID(), kCallbackID);
  EXPECT_EQ(platform.orientation.FireDevice("portrait"), 1u);
  EXPECT_EQ(weak.lock()->summaryTexts(), nullptr);
  EXPECT_EQ(CountMessage("deallocing this session 42"), 0u);
}

TEST_F(OrientationTest, ARestartRegistersAgainAndRecordsInterleaveWithMessages) {
  auto session = Started(7);
  session->stop();
  platform.clock.Advance(std::chrono::seconds(30));
  session->start();
  EXPECT_EQ(session->startDate(), platform.clock.Now());
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kDevice, kCallbackID));
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  platform.clock.Advance(milliseconds(250));
  platform.orientation.FireDevice("portrait");
  session->sendMessage(Dictionary{{"a", 2}}, 1, 1, nullptr);
  platform.orientation.FireUI("portrait");
  EXPECT_EQ(*session->createSummaryEventForSession(),
            (Dictionary{{"Ruvo_Session_Summary_Event", "7"},
                        {"a", "1,2"},
                        {"device_orientation", "portrait"},
                        {"device_orientation_time", "0.25"},
                        {"ui_orientation", "portrait"},
                        {"ui_orientation_time", "0.25"}}));
  EXPECT_EQ(CountMessage("Orientation handler callback mode=ui orientation=\"portrait\" "
                         "app=\"(null)\", time=0.25, id=\"RuvoReportingService 42\""),
            1u);
}

}  // namespace
}  // namespace tavrin::testing
