#include "Statistics/RuvoReportingUtility.h"

#include <gtest/gtest.h>

#include <chrono>
#include <latch>
#include <limits>
#include <optional>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/Platform.h"
#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeDeviceInfoQuery.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using testing::FakeDeviceInfo;
using testing::FakeLogSystem;

// ---------------------------------------------------------------------------------------------
// Name tables

TEST(ServiceTypeNameTest, NamesEveryCodedTypeAndTheUnsetType) {
  const char* expected[] = {"generic",          "ondra",         "telephony",
                            "haptics",          "alarms",        "standalone",
                            "soundautoconfig",  "longformaudio", "nonlongformaudio",
                            "audiodeviceusage", "alerts",        "test",
                            "apiusage"};
  for (uint16_t code = 0; code <= 12; ++code) {
    EXPECT_EQ(ServiceTypeName(code), std::optional<std::string>(expected[code])) << code;
  }
  EXPECT_EQ(ServiceTypeName(65535), "unknown");
  EXPECT_EQ(ServiceTypeName(13), std::nullopt);
  EXPECT_EQ(ServiceTypeName(65534), std::nullopt);
}

// A group prefix only when the whole high half is one group; two group bits, a bit outside the
// groups, or every bit give a bare "_". The summary event's category has no prefix; its neighbour
// does.
TEST(CategoryAndTypeNameTest, EveryKindOfCode) {
  const std::pair<uint32_t, const char*> categories[] = {{0x80000001, "Toolbox_Generic"},
                                                         {0x80000009, "Toolbox_Metrioning"},
                                                         {0x08000005, "Session_Setup"},
                                                         {0x10000004, "DSP_PlaybackAndRecord"},
                                                         {0x4000000B, "Routing_Volume"},
                                                         {0x20000000, "HAL_Undefined"},
                                                         {0x90000001, "_Generic"},
                                                         {0x18000008, "_Error"},
                                                         {0x00010002, "_Record"},
                                                         {0xFFFF0001, "_Generic"},
                                                         {0x00010000, "_Undefined"},
                                                         {0x80010001, "_Generic"},
                                                         {0, "Undefined"},
                                                         {3, "Playback"},
                                                         {0x0A, "Performance"},
                                                         {0x0B, "Volume"},
                                                         {0x0C, "Undefined"},
                                                         {0xFFFF, "Undefined"},
                                                         {0x8000000C, "Toolbox_Undefined"},
                                                         {kSummaryEventCategory, "Undefined"},
                                                         {0xFFFFFFFE, "_Undefined"}};
  for (const auto& [code, name] : categories) EXPECT_EQ(CategoryName(code), name) << code;
  const std::pair<uint16_t, const char*> types[] = {
      {0, "Generic"},   {1, "Start"},         {2, "Stop"},
      {3, "Setup"},     {4, "Error"},         {5, "IssueDetector"},
      {6, "Undefined"}, {65534, "Undefined"}, {kSummaryEventType, "Unknown"}};
  for (const auto& [code, name] : types) EXPECT_EQ(TypeName(code), name) << code;
}

// ---------------------------------------------------------------------------------------------
// Application name

// A missing dictionary or key gives "Unknown"; a stored value comes back as it is, whatever its
// type (compared as text, so 7 is not 7.0).
TEST(ApplicationNameFromUserInfoTest, StoredValueOrUnknown) {
  EXPECT_EQ(ApplicationNameFromUserInfo(nullptr), Value("Unknown"));
  const std::pair<Value, Value> cases[] = {
      {MakeDictionary(), "Unknown"},
      {{{"HostApplication", "com.example.player"}}, "Unknown"},
      {Value::array({"HostApplicationDisplayID", "x"}), "Unknown"},
      {{{"HostApplicationDisplayID", "com.example.player"}}, "com.example.player"},
      {{{"HostApplicationDisplayID", ""}}, ""},
      {{{"HostApplicationDisplayID", 7}}, 7},
      {{{"HostApplicationDisplayID", Value::array({1, "a"})}}, Value::array({1, "a"})},
      {{{"HostApplicationDisplayID", nullptr}}, nullptr},
  };
  for (const auto& [userInfo, name] : cases) {
    EXPECT_EQ(ApplicationNameFromUserInfo(&userInfo).dump(), name.dump()) << userInfo.dump();
  }
}

// ---------------------------------------------------------------------------------------------
// Internal build flag

TEST(IsInternalBuildTest, SixteenConcurrentFirstCallsAskOnceAndAgree) {
  constexpr int kThreads = 16;
  FakeDeviceInfo device;
  device.SetBool("InternalBuild", true);
  // Holds the one query open so that the other threads reach the guard while it runs.
  device.SetQueryHook([](std::string_view) { std::this_thread::sleep_for(milliseconds(50)); });
  PlatformServices services{.deviceInfo = &device};

  std::latch start(kThreads);
  std::vector<int> answers(kThreads, -1);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      answers[i] = IsInternalBuild(services) ? 1 : 0;
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);
  for (int i = 0; i < kThreads; ++i) EXPECT_EQ(answers[i], 1) << "thread " << i;

  // Later calls keep the answer without asking again; another context asks for itself.
  device.SetBool("InternalBuild", false);
  EXPECT_TRUE(IsInternalBuild(services));
  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);
  PlatformServices other{.deviceInfo = &device};
  EXPECT_FALSE(IsInternalBuild(other));
  PlatformServices noQuery;
  EXPECT_FALSE(IsInternalBuild(noQuery));
}

// ---------------------------------------------------------------------------------------------
// Bounded wait

// A condition whose waits play scripted outcomes on the calling thread and move the fake clock
// to the moment each outcome happens, so deadlines are exact and nothing sleeps.
class ScriptedCondition final : public Condition {
 public:
  // One wait's outcome: after `after`, a signal (setting the flag or not) or the deadline.
  struct Outcome {
    enum Kind { kSignalWithFlag, kSignalWithoutFlag, kTimeOut, kThrow } kind;
    Duration after = Duration::zero();
  };
  ScriptedCondition(bool& flag, std::vector<Outcome> script) : flag_(flag), script_(script) {}

  void Lock() override { ++locks_; }
  void Unlock() override { --locks_; }
  bool WaitUntil(SteadyTime deadline) override {
    deadlines.push_back(deadline);
    if (locks_ != 1 || next_ == script_.size()) throw std::logic_error("unscripted or unlocked");
    const Outcome outcome = script_[next_++];
    if (outcome.kind == Outcome::kThrow) throw std::runtime_error("wait failed");
    if (outcome.kind == Outcome::kTimeOut) {
      clock_.Advance(deadline - clock_.Now());
      return false;
    }
    clock_.Advance(outcome.after);
    flag_ = outcome.kind == Outcome::kSignalWithFlag;
    return true;
  }
  void Signal() override {}
  Clock& GetClock() override { return clock_; }

  bool Balanced() const { return locks_ == 0 && next_ == script_.size(); }
  std::vector<SteadyTime> deadlines;
  testing::FakeClock clock_;

 private:
  bool& flag_;
  std::vector<Outcome> script_;
  size_t next_ = 0;
  int locks_ = 0;
};

// Each round's deadline counts from the moment that round began; a signal that leaves the flag
// unset starts a whole new time-out; every way out leaves the condition unlocked.
TEST(WaitTest, ScriptedOutcomesGiveTheirResultDeadlinesAndLines) {
  using O = ScriptedCondition::Outcome;
  const Duration t = milliseconds(2500);
  const SteadyTime t0 = testing::FakeClock::kStartSteadyTime;
  struct Case {
    std::vector<O> script;
    bool result;
    std::vector<SteadyTime> deadlines;
    std::vector<std::string>
        lines;  // W (waiting) and "continuing" by default, T (timed out) an error
  } cases[] = {
      {{{O::kTimeOut}}, false, {t0 + t}, {"W", "T"}},
      {{{O::kSignalWithFlag, milliseconds(300)}}, true, {t0 + t}, {"W", "continuing"}},
      {{{O::kSignalWithoutFlag, seconds(2)},
        {O::kSignalWithoutFlag, milliseconds(2400)},
        {O::kSignalWithFlag, seconds(1)}},
       true,
       {t0 + t, t0 + seconds(2) + t, t0 + milliseconds(4400) + t},
       {"W", "continuing", "W", "continuing", "W", "continuing"}},
      {{{O::kSignalWithoutFlag, seconds(2)}, {O::kTimeOut}},
       false,
       {t0 + t, t0 + seconds(2) + t},
       {"W", "continuing", "W", "T"}},
  };
  for (size_t i = 0; i < std::size(cases); ++i) {
    FakeLogSystem logs;
    bool flag = false;
    ScriptedCondition condition(flag, cases[i].script);
    EXPECT_EQ(RuvoReportingUtilityWait(condition, flag, "W", "T", nullptr, 2.5), cases[i].result)
        << i;
    EXPECT_EQ(condition.deadlines, cases[i].deadlines) << i;
    EXPECT_TRUE(condition.Balanced()) << i;
    std::vector<std::string> defaults, errors;  // the expected lines by level
    for (const auto& line : cases[i].lines) (line == "T" ? errors : defaults).push_back(line);
    EXPECT_EQ(logs.Messages(), cases[i].lines) << i;  // in this order, and nothing else
    EXPECT_EQ(logs.Messages(LogLevel::kDefault, "default"), defaults) << i;
    EXPECT_EQ(logs.Messages(LogLevel::kError, "default"), errors) << i;
    // The prefix names the operation, not a helper.
    EXPECT_EQ(logs.Count(":RuvoReportingUtilityWait: "), cases[i].lines.size()) << i;
  }
}

TEST(WaitTest, SetFlagThrowingWaitAndOddTimeouts) {
  using O = ScriptedCondition::Outcome;
  FakeLogSystem logs;
  bool flag = true;
  ScriptedCondition already(flag, {});
  EXPECT_TRUE(RuvoReportingUtilityWait(already, flag, "W", "T", nullptr, 2.5));
  EXPECT_TRUE(already.deadlines.empty());
  EXPECT_TRUE(logs.Lines().empty());

  flag = false;
  ScriptedCondition throwing(flag, {{O::kThrow}});
  EXPECT_THROW(RuvoReportingUtilityWait(throwing, flag, "W", "T", nullptr, 2.5),
               std::runtime_error);
  EXPECT_TRUE(throwing.Balanced());

  // NaN and non-positive time-outs expire at once; an infinite one still gives a valid deadline.
  for (double timeout : {-1.0, 0.0, std::numeric_limits<double>::quiet_NaN()}) {
    ScriptedCondition condition(flag, {{O::kTimeOut}});
    EXPECT_FALSE(RuvoReportingUtilityWait(condition, flag, "W", "T", nullptr, timeout));
    EXPECT_EQ(condition.deadlines, std::vector{testing::FakeClock::kStartSteadyTime}) << timeout;
  }
  ScriptedCondition huge(flag, {{O::kSignalWithFlag}});
  EXPECT_TRUE(RuvoReportingUtilityWait(huge, flag, "W", "T", nullptr,
                                       std::numeric_limits<double>::infinity()));
  EXPECT_GT(huge.deadlines.at(0),
            testing::FakeClock::kStartSteadyTime + std::chrono::hours(24 * 365));

  // Lines go to the scope given, not the default log.
  LogHandle scope = RegisterLogScope(true, FourCharCode("rvrr"), "session", "com.quorvex.tavrin",
                                     "reporting_session_verbose", 31);
  ASSERT_NE(scope, nullptr);
  logs.Clear();
  flag = false;
  ScriptedCondition scoped(flag, {{O::kTimeOut}});
  EXPECT_FALSE(RuvoReportingUtilityWait(scoped, flag, "W", "T", scope, 2.5));
  EXPECT_EQ(logs.Lines().size(), 2u);
  EXPECT_EQ(logs.Messages({}, "session"), (std::vector<std::string>{"W", "T"}));
}

}  // namespace
}  // namespace tavrin
