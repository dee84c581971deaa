// The analytics and power-event sinks that every delivered message is offered to.

#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/RuvoReportingKelvaneUtility.h"
#include "Statistics/RuvoReportingStratikBridge.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

using Builders = FakeAnalyticsSink::Builders;

class SinksTest : public SessionTestBase {
 protected:
  SinksTest() : session(Create(42, 3)) {
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "com.example.game"}});
  }

  // Both sinks, in the order the client instance offers a message to them.
  void Offer(const Dictionary& event, uint32_t category, uint16_t type) {
    RuvoReportingStratikBridge::handleEvent(event, category, type, *session);
    RuvoReportingKelvaneUtility::handleEvent(event, category, type, *session);
  }

  std::shared_ptr<RuvoReportingSession> session;
};

// --- analytics --------------------------------------------------------------------------------

TEST_F(SinksTest, EveryMessageBecomesANamedAnalyticsEventWithTheSessionsApplicationName) {
  Offer(Dictionary{{"latency", 12}, {"route", "speaker"}}, 0x80000001, 1);
  Offer(Dictionary{{"HostApplicationDisplayID", "forged"}}, 12, 6);
  Offer(Dictionary(), 0xFFFFFFFF, 0xFFFF);  // absent: an event all the same
  Offer(Dictionary::object(), 0x90000001, 5);
  RuvoReportingKelvaneUtility::handleEvent(Value::array({"EngineOnTime"}), 1, 1, *session);
  RuvoReportingStratikBridge::handleEvent(Dictionary{{"HostApplicationDisplayID", "forged"}}, 1, 1,
                                          *Create(7, 3));
  const auto events = platform.analytics.Events();
  ASSERT_EQ(events.size(), 5u);
  const std::string names[] = {"Toolbox_Generic.Start", "Undefined.Undefined", "Undefined.Unknown",
                               "_Generic.IssueDetector"};
  for (size_t i = 0; i < 4; ++i) EXPECT_EQ(events[i].name, "com.quorvex.tavrin." + names[i]);
  EXPECT_EQ(events[0].builderCalls, 1u);
  const Dictionary game{{"HostApplicationDisplayID", "com.example.game"}};
  EXPECT_EQ(*events[0].payload, (Dictionary{{"latency", 12},
                                            {"route", "speaker"},
                                            {"HostApplicationDisplayID", "com.example.game"}}));
  EXPECT_EQ(*events[1].payload, game);
  EXPECT_EQ(*events[2].payload, game);
  EXPECT_EQ(*events[3].payload, game);
  EXPECT_EQ(*events[4].payload, (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
  // No engine time, or no dictionary: no power event.
  EXPECT_TRUE(platform.powerLog.Events().empty());
  EXPECT_TRUE(DefaultMessages(LogLevel::kError).empty());
}

TEST_F(SinksTest, TheLazyPayloadIsTheOnePreparedAtSendTimeAndASwitchedOffSinkNeverBuildsIt) {
  platform.analytics.SetBuilders(Builders::kCallLater);
  Offer(Dictionary{{"n", 1}}, 1, 1);
  EXPECT_EQ(platform.analytics.Events()[0].builderCalls, 0u);
  // Changes after the send do not reach the payload built later.
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "changed"}});
  EXPECT_EQ(platform.analytics.RunPendingBuilders(), 1u);
  EXPECT_EQ(*platform.analytics.Events()[0].payload,
            (Dictionary{{"n", 1}, {"HostApplicationDisplayID", "com.example.game"}}));

  platform.analytics.SetBuilders(Builders::kNeverCall);
  Offer(Dictionary{{"n", 2}}, 1, 1);
  const auto events = platform.analytics.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[1].builderCalls, 0u);
  EXPECT_FALSE(events[1].payload.has_value());
}

// --- power events -----------------------------------------------------------------------------

TEST_F(SinksTest, EngineTimeBecomesAPowerEventAndAMissingTimestampIsLogged) {
  Offer(Dictionary{{"EngineOnTime", 12.5}, {"ruvoreporting_timestamp", 1700000000123}, {"x", 1}}, 3,
        2);
  EXPECT_TRUE(DefaultMessages(LogLevel::kError).empty());
  Offer(Dictionary{{"EngineOnTime", 3}}, 1, 1);
  const auto events = platform.powerLog.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].agent, 28);
  EXPECT_EQ(events[0].name, "Mediane_Haptics");
  EXPECT_FALSE(events[0].extra.has_value());
  EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", 12.5},
                                           {"ApplicationName", "com.example.game"},
                                           {"TimestampEnd", 1700000000123}}));
  EXPECT_TRUE(events[0].payload["EngineOnDuration"].is_number_float());
  EXPECT_EQ(events[1].payload,
            (Dictionary{{"EngineOnDuration", 3}, {"ApplicationName", "com.example.game"}}));
  EXPECT_EQ(DefaultMessages(LogLevel::kError),
            std::vector<std::string>{"failed to get RuvoReporting timestamp for kelvane"});
  // The analytics events are made as well.
  EXPECT_EQ(platform.analytics.Events().size(), 2u);
}

TEST_F(SinksTest, AnAbsentApplicationNameIsLoggedAndLeftOut) {
  // "Unknown" stands in for a missing key; only a present but empty value gives no name.
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", nullptr}});
  Offer(Dictionary{{"EngineOnTime", "7"}, {"ruvoreporting_timestamp", 5}}, 1, 1);
  const auto events = platform.powerLog.Events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", "7"}, {"TimestampEnd", 5}}));
  EXPECT_EQ(DefaultMessages(LogLevel::kError),
            std::vector<std::string>{"failed to get app name for kelvane"});

  RuvoReportingKelvaneUtility::handleEvent(Dictionary{{"EngineOnTime", 1}}, 1, 1, *Create(7, 3));
  EXPECT_EQ(platform.powerLog.Events()[1].payload["ApplicationName"], "Unknown");
}

}  // namespace
}  // namespace tavrin::testing
