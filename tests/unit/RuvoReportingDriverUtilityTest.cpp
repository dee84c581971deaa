#include "Statistics/RuvoReportingDriverUtility.h"

#include <gtest/gtest.h>

#include "tests/fakes/FakeDriverStatsService.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using testing::FakeDriverStatsService;
using testing::FakeLogSystem;
using Failure = FakeDriverStatsService::Failure;
using std::nullopt;
using Lines = std::vector<std::string>;

// The counters that rose since `snapShot` (every counter above zero against none).
std::optional<Dictionary> Delta(RuvoReportingDriverUtility& utility, const Dictionary* snapShot) {
  return utility.getDriverStatisticsRelativeToSnapShot(snapShot);
}

Lines Descriptions(const RuvoReportingDriverUtility& utility) {
  Lines names;
  for (const auto& subscription : utility.ioChannelSubscriptions()) {
    names.push_back(subscription->driver()->description());
  }
  return names;
}

class DriverUtilityTest : public ::testing::Test {
 protected:
  DriverUtilityTest() { RuvoReportingDriverUtility::ResetLogScopeForTesting(); }
  ~DriverUtilityTest() override { RuvoReportingDriverUtility::ResetLogScopeForTesting(); }

  FakeLogSystem log;
  FakeDriverStatsService fake;
};

// --- Drivers, subscriptions and keys ---

// Absent names are written "(null)" in descriptions and left out of channel keys.
TEST(RuvoReportingDriverTest, DescriptionsAndChannelKeysOfPresentAndAbsentNames) {
  using Name = std::optional<std::string>;
  const struct {
    Name group, subgroup, channel;
    const char *description, *key;
  } cases[] = {
      {"Haptics", "Stats", "kicks", "Haptics-Stats", "Haptics_Stats_kicks"},
      {"Speaker", nullopt, "temp", "Speaker-(null)", "Speaker_temp"},
      {nullopt, "MCA", "resets", "(null)-MCA", "MCA_resets"},
      {"Haptics", "Stats", nullopt, "Haptics-Stats", "Haptics_Stats_"},
      {nullopt, nullopt, "x", "(null)-(null)", "x"},
      {nullopt, nullopt, nullopt, "(null)-(null)", ""},
  };
  for (const auto& c : cases) {
    const auto driver = RuvoReportingDriver::driverWithGroupName(c.group, c.subgroup);
    EXPECT_EQ(driver->description(), c.description);
    EXPECT_EQ(RuvoReportingDriverUtility::ChannelKey(*driver, c.channel), c.key) << c.description;
  }
}

// --- Creation ---

TEST_F(DriverUtilityTest, RegistersTheRvrdScopeOncePerProcessAndLogsToIt) {
  RuvoReportingDriverUtility first(fake);
  const auto registrations = log.Registrations();
  ASSERT_EQ(registrations.count("rvrd"), 1u);
  const auto& rvrd = registrations.at("rvrd");
  EXPECT_TRUE(rvrd.enabled);
  EXPECT_EQ(rvrd.code, FourCharCode("rvrd"));
  EXPECT_EQ(rvrd.subsystem, "com.quorvex.tavrin");
  EXPECT_EQ(rvrd.verbosityKey, "reporting_driver_verbose");
  EXPECT_EQ(rvrd.level, 31);

  // A second registration would now answer none and send the lines to the default log.
  log.FailRegistrations(true);
  log.Clear();
  RuvoReportingDriverUtility second(fake);
  const auto lines = log.Matching("creating metrioning driver utility");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].scope, "rvrd");
  EXPECT_EQ(lines[0].level, LogLevel::kInfo);

  // A registration that fails in a fresh process writes to the default log instead.
  RuvoReportingDriverUtility::ResetLogScopeForTesting();
  log.Clear();
  RuvoReportingDriverUtility third(fake);
  const auto fallback = log.Matching("creating metrioning driver utility");
  ASSERT_EQ(fallback.size(), 1u);
  EXPECT_EQ(fallback[0].scope, "default");
  EXPECT_EQ(fallback[0].text.rfind("RuvoReportingDriverUtility.cpp:", 0), 0u) << fallback[0].text;
}

TEST_F(DriverUtilityTest, SubscribesInTableOrderOnlyDriversWithChannels) {
  fake.AddChannel("Haptics", "Stats", "kicks", 1);
  fake.AddChannel("QuorvexAE2MCA", nullopt, "underruns", 1);
  fake.AnswerNoChannels(nullopt, "MCA");  // no description at all: nothing logged for it
  RuvoReportingDriverUtility utility(fake);

  using Query = std::pair<std::optional<std::string>, std::optional<std::string>>;
  EXPECT_EQ(fake.Queries(), (std::vector<Query>{{"QuorvexAE2MCA", nullopt},
                                                {"Speaker", nullopt},
                                                {nullopt, "MCA"},
                                                {"Haptics", "Stats"}}));
  EXPECT_EQ(Descriptions(utility), (Lines{"QuorvexAE2MCA-(null)", "Haptics-Stats"}));
  EXPECT_EQ(fake.CreateSubscriptionCalls(), 2);
  for (const auto& subscription : utility.ioChannelSubscriptions()) {
    EXPECT_NE(subscription->subscription(), 0u);
    ASSERT_TRUE(subscription->subscribedChannels());
    EXPECT_EQ(fake.ChannelCount(*subscription->subscribedChannels()), 1);
  }
  EXPECT_EQ(log.Messages(LogLevel::kInfo),
            (Lines{"creating metrioning driver utility",
                   "couldn't find any channels for driver group Speaker-(null)"}));
  // Speaker had a description without channels and is still reported as subscribed.
  EXPECT_EQ(log.Messages(LogLevel::kDefault),
            (Lines{"subscribed to group group QuorvexAE2MCA-(null)",
                   "subscribed to group group Speaker-(null)",
                   "subscribed to group group Haptics-Stats"}));
  EXPECT_TRUE(log.Messages(LogLevel::kError).empty());
}

TEST_F(DriverUtilityTest, ChannelsThatComeBackWithAnErrorAreStillUsed) {
  fake.AddChannel("Speaker", nullopt, "temp", 4);
  fake.AddChannel("Haptics", "Stats", "kicks", 5);
  fake.FailCopyChannels("Speaker", nullopt, Failure{.code = 35, .withResult = true});
  fake.FailCopyChannels("Haptics", "Stats", Failure{.code = 2, .withResult = false});
  RuvoReportingDriverUtility utility(fake);

  EXPECT_EQ(log.Messages(LogLevel::kError),
            (Lines{"error 35 getting channels for driver Speaker-(null)",
                   "error 2 getting channels for driver Haptics-Stats"}));
  EXPECT_EQ(Descriptions(utility), (Lines{"Speaker-(null)"}));
  // Haptics, whose channels came back as none, is not subscribed.
  EXPECT_EQ(
      log.Messages(LogLevel::kDefault),
      (Lines{"subscribed to group group QuorvexAE2MCA-(null)",
             "subscribed to group group Speaker-(null)", "subscribed to group group (null)-MCA"}));
  EXPECT_EQ(Delta(utility, nullptr), (Dictionary{{"Speaker_temp", 4}}));
}

// --- Snapshots and deltas ---

TEST_F(DriverUtilityTest, OnlyCountersThatRoseAppearAndNothingChangedIsNone) {
  const int rise = fake.AddChannel("QuorvexAE2MCA", nullopt, "rise", 10);
  fake.AddChannel("QuorvexAE2MCA", nullopt, "stay", 10);
  const int fall = fake.AddChannel("QuorvexAE2MCA", nullopt, "fall", 10);
  fake.AddChannel("QuorvexAE2MCA", nullopt, "zero", 0);
  const int negative = fake.AddChannel("Speaker", nullopt, "negative", -5);
  const int mca = fake.AddChannel("Speaker", "MCA", "resets", 1);
  const int haptics = fake.AddChannel("Haptics", "Stats", "kicks", 100);
  const int unnamed = fake.AddChannel("Haptics", "Stats", nullopt, 0);
  RuvoReportingDriverUtility utility(fake);

  const Dictionary unchanged = utility.getSnapShot();
  EXPECT_EQ(Delta(utility, &unchanged), nullopt);

  fake.SetValue(rise, 17);
  fake.SetValue(fall, 3);
  fake.SetValue(negative, -2);  // rose by 3 while below zero
  fake.SetValue(mca, 4);
  fake.SetValue(haptics, 101);
  fake.SetValue(unnamed, 2);
  log.Clear();
  const auto delta = Delta(utility, &unchanged);
  ASSERT_TRUE(delta);
  EXPECT_EQ(*delta, (Dictionary{{"QuorvexAE2MCA_rise", 7},
                                {"Speaker_negative", 3},
                                {"Speaker_resets", 3},
                                {"MCA_resets", 3},
                                {"Haptics_Stats_kicks", 1},
                                {"Haptics_Stats_", 2}}));
  EXPECT_TRUE((*delta)["QuorvexAE2MCA_rise"].is_number_integer());
  EXPECT_EQ(log.Messages(LogLevel::kInfo).size(), 8u);  // getting / done getting, per driver
  EXPECT_EQ(log.Count("getting latest samples", LogLevel::kInfo), 8u);
  EXPECT_EQ(log.Count("done getting latest samples", LogLevel::kInfo), 4u);
}

TEST_F(DriverUtilityTest, LaterChannelWithTheSameKeyReplacesTheEarlierValue) {
  const int own = fake.AddChannel("QuorvexAE2MCA", nullopt, "x", 0);
  const int sub = fake.AddChannel("QuorvexAE2MCA", "Sub", "x", 0);
  RuvoReportingDriverUtility utility(fake);
  const Dictionary snapShot = utility.getSnapShot();
  fake.SetValue(own, 5);
  fake.SetValue(sub, 9);
  EXPECT_EQ(Delta(utility, &snapShot), (Dictionary{{"QuorvexAE2MCA_x", 9}}));
  fake.SetValue(sub, 0);  // the later one is not positive: the earlier value stays
  EXPECT_EQ(Delta(utility, &snapShot), (Dictionary{{"QuorvexAE2MCA_x", 5}}));
}

TEST_F(DriverUtilityTest, SamplingErrorAtSnapshotLeavesTheDriverOutAndItsDeltaCountsFromNone) {
  fake.AddChannel("Speaker", nullopt, "temp", 40);
  const int kicks = fake.AddChannel("Haptics", "Stats", "kicks", 10);
  fake.FailCreateSamples("Speaker", nullopt, Failure{.code = 7, .withResult = true, .times = 1});
  RuvoReportingDriverUtility utility(fake);
  const Dictionary snapShot = utility.getSnapShot();
  EXPECT_EQ(snapShot.size(), 1u);
  EXPECT_TRUE(snapShot.contains("Haptics-Stats"));
  EXPECT_EQ(log.Messages(LogLevel::kError), (Lines{"MetrionCreateSamples error 7"}));

  fake.SetValue(kicks, 11);
  const auto delta = Delta(utility, &snapShot);
  EXPECT_EQ(delta, (Dictionary{{"Speaker_temp", 40}, {"Haptics_Stats_kicks", 1}}));
  const auto calls = fake.DeltaCalls();
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].earlier, nullopt);  // the Speaker key is missing from the snapshot
  EXPECT_EQ(calls[1].earlier, snapShot.at("Haptics-Stats"));
}

TEST_F(DriverUtilityTest, SamplingErrorAtStopLeavesOnlyThatDriverOut) {
  const int temp = fake.AddChannel("Speaker", nullopt, "temp", 1);
  const int kicks = fake.AddChannel("Haptics", "Stats", "kicks", 1);
  RuvoReportingDriverUtility utility(fake);
  const Dictionary snapShot = utility.getSnapShot();
  fake.SetValue(temp, 5);
  fake.SetValue(kicks, 5);
  fake.FailCreateSamples("Haptics", "Stats", Failure{.code = 12, .withResult = true});
  log.Clear();
  EXPECT_EQ(Delta(utility, &snapShot), (Dictionary{{"Speaker_temp", 4}}));
  EXPECT_EQ(log.Messages(LogLevel::kError), (Lines{"MetrionCreateSamples error 12"}));
  EXPECT_EQ(fake.DeltaCalls().size(), 1u);

  fake.FailCreateSamples("Speaker", nullopt, Failure{.code = 12});
  EXPECT_EQ(Delta(utility, &snapShot), nullopt);
}

TEST_F(DriverUtilityTest, FailedDifferenceFallsBackToTheAbsoluteValues) {
  const int temp = fake.AddChannel("Speaker", nullopt, "temp", 50);
  fake.AddChannel("Speaker", nullopt, "zero", 0);
  const int kicks = fake.AddChannel("Haptics", "Stats", "kicks", 10);
  RuvoReportingDriverUtility utility(fake);
  const Dictionary snapShot = utility.getSnapShot();
  fake.SetValue(temp, 51);
  fake.SetValue(kicks, 12);
  // The first difference fails (its partial result is ignored too), the second works.
  fake.FailCreateSamplesDelta(Failure{.code = 9, .withResult = true, .times = 1});
  log.Clear();
  EXPECT_EQ(Delta(utility, &snapShot),
            (Dictionary{{"Speaker_temp", 51}, {"Haptics_Stats_kicks", 2}}));
  EXPECT_EQ(log.Messages(LogLevel::kError), (Lines{"MetrionCreateSamplesDelta error 9"}));
}

TEST_F(DriverUtilityTest, SnapshotThatIsNotADictionaryCountsAsMissingKeys) {
  fake.AddChannel("Speaker", nullopt, "temp", 6);
  RuvoReportingDriverUtility utility(fake);
  const Dictionary odd = Value::array();
  EXPECT_EQ(Delta(utility, &odd), (Dictionary{{"Speaker_temp", 6}}));
  ASSERT_EQ(fake.DeltaCalls().size(), 1u);
  EXPECT_EQ(fake.DeltaCalls()[0].earlier, nullopt);
}

// (The utility against a real counters tree is checked end to end, through the service.)
TEST_F(DriverUtilityTest, NoChannelsAnywhereSubscribesAndReportsNothing) {
  RuvoReportingDriverUtility utility(fake);
  EXPECT_TRUE(utility.ioChannelSubscriptions().empty());
  EXPECT_EQ(log.Count("couldn't find any channels for driver group", LogLevel::kInfo), 4u);
  const Dictionary snapShot = utility.getSnapShot();
  EXPECT_EQ(snapShot, MakeDictionary());
  EXPECT_EQ(Delta(utility, &snapShot), nullopt);
  EXPECT_EQ(Delta(utility, nullptr), nullopt);
}

}  // namespace
}  // namespace tavrin
