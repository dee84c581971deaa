#include "Statistics/RuvoReportingUtility.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <future>
#include <latch>
#include <limits>
#include <optional>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/Platform.h"
#include "platform/linux/dispatch/StdCondition.h"
#include "tests/fakes/FakeCondition.h"
#include "tests/fakes/FakeDeviceInfoQuery.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using testing::FakeCondition;
using testing::FakeDeviceInfo;
using testing::FakeLogSystem;
using testing::LoggedLine;

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
  EXPECT_EQ(ServiceTypeName(service_type::kApiUsage), "apiusage");
  EXPECT_EQ(ServiceTypeName(65535), "unknown");
}

TEST(ServiceTypeNameTest, CodesBetweenTheTableAndUnknownHaveNoName) {
  EXPECT_EQ(ServiceTypeName(13), std::nullopt);
  EXPECT_EQ(ServiceTypeName(65534), std::nullopt);
  for (uint32_t code = 13; code < 65535; ++code) {
    ASSERT_FALSE(ServiceTypeName(static_cast<uint16_t>(code)).has_value()) << code;
  }
}

TEST(CategoryNameTest, GroupPrefixOnlyWhenTheWholeHighHalfIsOneGroup) {
  EXPECT_EQ(CategoryName(0x80000001), "Toolbox_Generic");
  EXPECT_EQ(CategoryName(0x80000009), "Toolbox_Metrioning");
  EXPECT_EQ(CategoryName(0x08000005), "Session_Setup");
  EXPECT_EQ(CategoryName(0x10000004), "DSP_PlaybackAndRecord");
  EXPECT_EQ(CategoryName(0x4000000B), "Routing_Volume");
  EXPECT_EQ(CategoryName(0x20000000), "HAL_Undefined");
  // Two group bits, a bit outside the groups, or every bit: a bare "_".
  EXPECT_EQ(CategoryName(0x90000001), "_Generic");
  EXPECT_EQ(CategoryName(0x18000008), "_Error");
  EXPECT_EQ(CategoryName(0x00010002), "_Record");
  EXPECT_EQ(CategoryName(0xFFFF0001), "_Generic");
  EXPECT_EQ(CategoryName(0x00010000), "_Undefined");
  EXPECT_EQ(CategoryName(0x80010001), "_Generic");
}

TEST(CategoryNameTest, UngroupedAndOutOfTableKinds) {
  EXPECT_EQ(CategoryName(0), "Undefined");
  EXPECT_EQ(CategoryName(0x00000003), "Playback");
  EXPECT_EQ(CategoryName(0x0000000A), "Performance");
  EXPECT_EQ(CategoryName(0x0000000B), "Volume");
  EXPECT_EQ(CategoryName(0x0000000C), "Undefined");
  EXPECT_EQ(CategoryName(0x0000FFFF), "Undefined");
  EXPECT_EQ(CategoryName(0x8000000C), "Toolbox_Undefined");
  // The summary event's category has no prefix at all; its neighbour does.
  EXPECT_EQ(CategoryName(kSummaryEventCategory), "Undefined");
  EXPECT_EQ(CategoryName(0xFFFFFFFE), "_Undefined");
}

TEST(TypeNameTest, UnknownOnlyFor65535AndUndefinedElsewhere) {
  EXPECT_EQ(TypeName(0), "Generic");
  EXPECT_EQ(TypeName(1), "Start");
  EXPECT_EQ(TypeName(2), "Stop");
  EXPECT_EQ(TypeName(3), "Setup");
  EXPECT_EQ(TypeName(4), "Error");
  EXPECT_EQ(TypeName(5), "IssueDetector");
  EXPECT_EQ(TypeName(6), "Undefined");
  EXPECT_EQ(TypeName(65534), "Undefined");
  EXPECT_EQ(TypeName(kSummaryEventType), "Unknown");
}

// ---------------------------------------------------------------------------------------------
// Application name

TEST(ApplicationNameFromUserInfoTest, MissingDictionaryOrKeyGivesUnknown) {
  EXPECT_EQ(ApplicationNameFromUserInfo(nullptr), Value("Unknown"));
  const Dictionary empty = MakeDictionary();
  EXPECT_EQ(ApplicationNameFromUserInfo(&empty), Value("Unknown"));
  const Dictionary other = {{"HostApplication", "com.example.player"}};
  EXPECT_EQ(ApplicationNameFromUserInfo(&other), Value("Unknown"));
  // A value that is not a dictionary at all holds no key.
  const Value notADictionary = Value::array({"HostApplicationDisplayID", "x"});
  EXPECT_EQ(ApplicationNameFromUserInfo(&notADictionary), Value("Unknown"));
}

TEST(ApplicationNameFromUserInfoTest, StoredValueComesBackAsItIsWhateverItsType) {
  const Dictionary named = {{"HostApplicationDisplayID", "com.example.player"}};
  EXPECT_EQ(ApplicationNameFromUserInfo(&named), Value("com.example.player"));

  const Dictionary emptyName = {{"HostApplicationDisplayID", ""}};
  EXPECT_EQ(ApplicationNameFromUserInfo(&emptyName), Value(""));

  const Dictionary number = {{"HostApplicationDisplayID", 7}};
  const Value numberName = ApplicationNameFromUserInfo(&number);
  EXPECT_TRUE(numberName.is_number_integer());
  EXPECT_EQ(numberName, Value(7));

  const Dictionary list = {{"HostApplicationDisplayID", Value::array({1, "a"})}};
  EXPECT_EQ(ApplicationNameFromUserInfo(&list), Value::array({1, "a"}));

  const Dictionary null = {{"HostApplicationDisplayID", nullptr}};
  EXPECT_TRUE(ApplicationNameFromUserInfo(&null).is_null());
}

// ---------------------------------------------------------------------------------------------
// Internal build flag

TEST(InternalBuildFlagTest, AsksForInternalBuildOnceAndKeepsTheFirstAnswer) {
  FakeDeviceInfo device;
  device.SetBool("InternalBuild", true);
  InternalBuildFlag flag;
  EXPECT_TRUE(flag.Get(device));
  device.SetBool("InternalBuild", false);
  EXPECT_TRUE(flag.Get(device));
  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);
}

TEST(InternalBuildFlagTest, MissingFactOrMissingQueryMeansNotInternal) {
  FakeDeviceInfo device;
  InternalBuildFlag flag;
  EXPECT_FALSE(flag.Get(device));
  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);

  InternalBuildFlag noQuery;
  EXPECT_FALSE(noQuery.Get([]() -> DeviceInfoQuery* { return nullptr; }));
}

// The process-wide flag: the only test in this binary that calls IsInternalBuild.
TEST(IsInternalBuildTest, SixteenConcurrentFirstCallsAskOnceAndAgree) {
  constexpr int kThreads = 16;
  FakeDeviceInfo device;
  device.SetBool("InternalBuild", true);
  // Holds the one query open so that the other threads reach the guard while it runs.
  device.SetQueryHook([](std::string_view) { std::this_thread::sleep_for(milliseconds(50)); });
  PlatformServices services;
  services.deviceInfo = &device;
  PlatformServices* previous = InstallPlatform(&services);

  std::latch start(kThreads);
  std::vector<int> answers(kThreads, -1);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      answers[i] = IsInternalBuild() ? 1 : 0;
    });
  }
  for (auto& thread : threads) thread.join();

  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);
  for (int i = 0; i < kThreads; ++i) EXPECT_EQ(answers[i], 1) << "thread " << i;

  // Later calls neither change their answer nor consult the platform again.
  device.SetBool("InternalBuild", false);
  InstallPlatform(nullptr);
  EXPECT_TRUE(IsInternalBuild());
  InstallPlatform(previous);
  EXPECT_EQ(device.QueryCount("InternalBuild"), 1u);
}

// ---------------------------------------------------------------------------------------------
// Bounded wait

constexpr double kTimeoutSeconds = 2.5;
constexpr Duration kTimeout = std::chrono::milliseconds(2500);

// Splits "RuvoReportingUtility.cpp:<digits>:RuvoReportingUtilityWait: <message>" into the message;
// nothing when the prefix has another shape. (Hand-written: std::regex trips a false
// maybe-uninitialized warning of g++ 12 under the sanitizers.)
std::optional<std::string> WaitLineMessage(const std::string& text) {
  constexpr std::string_view kFile = "RuvoReportingUtility.cpp:";
  constexpr std::string_view kFunction = ":RuvoReportingUtilityWait: ";
  if (!text.starts_with(kFile)) return std::nullopt;
  size_t position = kFile.size();
  const size_t digitsStart = position;
  while (position < text.size() && text[position] >= '0' && text[position] <= '9') ++position;
  if (position == digitsStart) return std::nullopt;
  if (text.compare(position, kFunction.size(), kFunction) != 0) return std::nullopt;
  return text.substr(position + kFunction.size());
}

::testing::AssertionResult IsWaitLine(const LoggedLine& line, LogLevel level,
                                      const std::string& message) {
  const std::optional<std::string> logged = WaitLineMessage(line.text);
  if (!logged) return ::testing::AssertionFailure() << "bad prefix: \"" << line.text << "\"";
  if (*logged != message) {
    return ::testing::AssertionFailure()
           << "message \"" << *logged << "\", want \"" << message << "\"";
  }
  if (line.level != level) {
    return ::testing::AssertionFailure()
           << "level " << LogLevelName(line.level) << ", want " << LogLevelName(level);
  }
  return ::testing::AssertionSuccess();
}

class WaitTest : public ::testing::Test {
 protected:
  WaitTest() { condition_.SetFlag(&flag_); }

  bool Wait(const LogHandle& log = nullptr, double timeout = kTimeoutSeconds) {
    return RuvoReportingUtilityWait(condition_, flag_, "Waiting for back-ends",
                                    "Timed out waiting for back-ends", log, timeout);
  }

  void ExpectUnlockedAndBalanced() {
    EXPECT_FALSE(condition_.IsLocked());
    EXPECT_EQ(condition_.LockCount(), condition_.UnlockCount());
    EXPECT_TRUE(condition_.Violations().empty())
        << ::testing::PrintToString(condition_.Violations());
    EXPECT_EQ(condition_.UnscriptedWaits(), 0u);
    EXPECT_EQ(condition_.StepsLeft(), 0u);
  }

  FakeLogSystem logs_;
  FakeCondition condition_;
  bool flag_ = false;
};

TEST_F(WaitTest, FlagAlreadySetReturnsAtOnceWithoutLoggingOrWaiting) {
  flag_ = true;
  EXPECT_TRUE(Wait());
  EXPECT_TRUE(logs_.Lines().empty());
  EXPECT_TRUE(condition_.Deadlines().empty());
  EXPECT_EQ(condition_.LockCount(), 1u);
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, NeverSignalledTimesOutOnceWithWaitingAndErrorLines) {
  const SteadyTime start = condition_.Now();
  condition_.ScriptTimeOut();
  EXPECT_FALSE(Wait());

  ASSERT_EQ(condition_.Deadlines().size(), 1u);
  EXPECT_EQ(condition_.Deadlines()[0], start + kTimeout);
  EXPECT_EQ(condition_.Now(), start + kTimeout);
  const auto lines = logs_.Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].scope, "default");
  EXPECT_TRUE(IsWaitLine(lines[0], LogLevel::kDefault, "Waiting for back-ends"));
  EXPECT_TRUE(IsWaitLine(lines[1], LogLevel::kError, "Timed out waiting for back-ends"));
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, SignalWithFlagReturnsTrueAfterContinuing) {
  condition_.ScriptSignalWithFlag(milliseconds(300));
  EXPECT_TRUE(Wait());
  const auto lines = logs_.Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_TRUE(IsWaitLine(lines[0], LogLevel::kDefault, "Waiting for back-ends"));
  EXPECT_TRUE(IsWaitLine(lines[1], LogLevel::kDefault, "continuing"));
  EXPECT_EQ(condition_.SignalCount(), 1u);
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, SignalWithoutFlagGrantsAWholeNewTimeout) {
  const SteadyTime start = condition_.Now();
  condition_.ScriptSignalWithoutFlag(seconds(2));
  condition_.ScriptSignalWithoutFlag(milliseconds(2400));
  condition_.ScriptSignalWithFlag(seconds(1));
  EXPECT_TRUE(Wait());

  // Each round's deadline is counted from the moment that round began, not from the first.
  const std::vector<SteadyTime> expected = {start + kTimeout, start + seconds(2) + kTimeout,
                                            start + milliseconds(4400) + kTimeout};
  EXPECT_EQ(condition_.Deadlines(), expected);
  const auto lines = logs_.Lines();
  ASSERT_EQ(lines.size(), 6u);
  for (size_t i = 0; i < lines.size(); i += 2) {
    EXPECT_TRUE(IsWaitLine(lines[i], LogLevel::kDefault, "Waiting for back-ends")) << i;
    EXPECT_TRUE(IsWaitLine(lines[i + 1], LogLevel::kDefault, "continuing")) << i;
  }
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, SignalWithoutFlagThenSilenceTimesOutLaterThanOneTimeout) {
  const SteadyTime start = condition_.Now();
  condition_.ScriptSignalWithoutFlag(seconds(2));
  condition_.ScriptTimeOut();
  EXPECT_FALSE(Wait());

  EXPECT_EQ(condition_.Now(), start + seconds(2) + kTimeout);
  const auto lines = logs_.Lines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_TRUE(IsWaitLine(lines[0], LogLevel::kDefault, "Waiting for back-ends"));
  EXPECT_TRUE(IsWaitLine(lines[1], LogLevel::kDefault, "continuing"));
  EXPECT_TRUE(IsWaitLine(lines[2], LogLevel::kDefault, "Waiting for back-ends"));
  EXPECT_TRUE(IsWaitLine(lines[3], LogLevel::kError, "Timed out waiting for back-ends"));
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, LinesGoToTheGivenScopeNotTheDefaultLog) {
  LogHandle scope = RegisterLogScope(true, FourCharCode("rvrr"), "session", "com.quorvex.tavrin",
                                     "reporting_session_verbose", 31);
  ASSERT_NE(scope, nullptr);
  condition_.ScriptTimeOut();
  EXPECT_FALSE(Wait(scope));
  const auto lines = logs_.Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].scope, "session");
  EXPECT_EQ(lines[1].scope, "session");
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, NegativeOrNanTimeoutTimesOutAtOnce) {
  for (double timeout : {-1.0, 0.0, std::numeric_limits<double>::quiet_NaN()}) {
    const SteadyTime now = condition_.Now();
    condition_.ScriptTimeOut();
    EXPECT_FALSE(Wait(nullptr, timeout)) << timeout;
    EXPECT_EQ(condition_.Deadlines().back(), now) << timeout;
  }
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, HugeTimeoutGivesAValidLaterDeadline) {
  const SteadyTime start = condition_.Now();
  condition_.ScriptSignalWithFlag();
  EXPECT_TRUE(Wait(nullptr, std::numeric_limits<double>::infinity()));
  ASSERT_EQ(condition_.Deadlines().size(), 1u);
  EXPECT_GT(condition_.Deadlines()[0], start + std::chrono::hours(24 * 365));
  ExpectUnlockedAndBalanced();
}

TEST_F(WaitTest, ConditionIsUnlockedWhenTheWaitThrows) {
  condition_.Script([](SteadyTime) -> bool { throw std::runtime_error("wait failed"); });
  EXPECT_THROW(Wait(), std::runtime_error);
  ExpectUnlockedAndBalanced();
}

// ---------------------------------------------------------------------------------------------
// Bounded wait on the real condition and clock. Bounds are generous: a loaded machine only
// makes the signal later, never the wait shorter.

// A lock left held would block the other thread; it is detached (and owns the condition) so that
// such a failure reports instead of hanging the test.
bool CanBeLockedFromAnotherThread(std::shared_ptr<Condition> condition) {
  auto locked = std::make_shared<std::promise<void>>();
  auto done = locked->get_future();
  std::thread([condition, locked] {
    condition->Lock();
    condition->Unlock();
    locked->set_value();
  }).detach();
  return done.wait_for(seconds(30)) == std::future_status::ready;
}

TEST(RealConditionWaitTest, FlagSetByAnotherThreadEndsTheWait) {
  FakeLogSystem logs;
  std::shared_ptr<Condition> condition = MakeCondition();
  bool flag = false;
  std::thread setter([&] {
    std::this_thread::sleep_for(milliseconds(50));
    condition->Lock();
    flag = true;
    condition->Signal();
    condition->Unlock();
  });
  const auto start = std::chrono::steady_clock::now();
  const bool seen = RuvoReportingUtilityWait(*condition, flag, "waiting", "timed out", nullptr,
                                             /*timeoutSeconds=*/60.0);
  const auto elapsed = std::chrono::steady_clock::now() - start;
  setter.join();
  EXPECT_TRUE(seen);
  EXPECT_LT(elapsed, seconds(30));
  EXPECT_EQ(logs.Count("timed out"), 0u);

  EXPECT_TRUE(CanBeLockedFromAnotherThread(condition));
}

TEST(RealConditionWaitTest, NoSignalTimesOutAfterTheTimeout) {
  FakeLogSystem logs;
  std::shared_ptr<Condition> condition = MakeCondition();
  bool flag = false;
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(RuvoReportingUtilityWait(*condition, flag, "waiting", "timed out", nullptr, 0.05));
  EXPECT_GE(std::chrono::steady_clock::now() - start, milliseconds(50));
  EXPECT_EQ(logs.Count("timed out", LogLevel::kError), 1u);
  EXPECT_EQ(logs.Count("waiting", LogLevel::kDefault), 1u);

  EXPECT_TRUE(CanBeLockedFromAnotherThread(condition));
}

}  // namespace
}  // namespace tavrin
