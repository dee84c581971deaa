#include "Statistics/Service/RuvoReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <chrono>
#include <limits>
#include <memory>
#include <regex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using testing::FakeLogSystem;
using Throttle = RuvoReportingBlockThrottle;

std::string Key(const Dictionary& message, int64_t reporterID = 42, uint32_t category = 0x80000001,
                uint16_t type = 0) {
  return Throttle::buildMessageKey(message, reporterID, category, type);
}

// Messages of the lines `function` in RuvoReportingBlockThrottle.cpp wrote at `level`; the prefix
// must name that file, a line number and that function.
std::vector<std::string> Messages(const FakeLogSystem& logs, const std::string& function,
                                  LogLevel level) {
  const std::regex prefix("^RuvoReportingBlockThrottle\\.cpp:[0-9]+:" + function + ": (.*)$");
  std::vector<std::string> found;
  std::smatch match;
  for (const auto& line : logs.Lines()) {
    if (line.level == level && std::regex_match(line.text, match, prefix))
      found.push_back(match[1]);
  }
  return found;
}

// ---------------------------------------------------------------------------------------------
// Message key

TEST(BlockThrottleKeyTest, KeysListSortedFieldsWithExcludedValuesMaskedThenTheRouting) {
  const struct {
    Dictionary message;
    std::string key;
    int64_t reporter = 42;
    uint32_t category = 0x80000001;
    uint16_t type = 0;
  } cases[] = {
      {{{"b", 2}, {"a", "x"}, {"ruvoreporting_timestamp", 123.4}},
       "a|x|b|2|ruvoreporting_timestamp|^|reporterID|42|Toolbox_Generic|Generic"},
      {{{"level", 3},
        {"ruvoreporting_timestamp", 1.5},
        {"systemuptime_sec", 100},
        {"processuptime_ms", 7},
        {"_throttle_seconds", 0.2},
        {"_comparison_field_blacklist", Value::array()}},
       "_comparison_field_blacklist|^|_throttle_seconds|^|level|3|processuptime_ms|^|"
       "ruvoreporting_timestamp|^|systemuptime_sec|^|reporterID|42|Toolbox_Generic|Generic"},
      {{{"level", 3}}, "level|3|reporterID|-5|Undefined|Unknown", -5, 0xFFFFFFFF, 0xFFFF},
      {{{"level", 3}},
       "level|3|reporterID|-9223372036854775808|Playback|Undefined",
       std::numeric_limits<int64_t>::min(),
       3,
       6},
      {{{"Volume", 0.5}, {"VolumeOperationTime", 10}},
       "Volume|^|VolumeOperationTime|^|reporterID|42|Toolbox_Generic|Generic"},
      // By character code, whatever the insertion order.
      {{{"a", 1}, {"_", 2}, {"Z", 3}, {"\xC3\xA9", 4}, {"B", 5}},
       "B|5|Z|3|_|2|a|1|\xC3\xA9|4|reporterID|42|Toolbox_Generic|Generic"},
      {{{"f", 4.9}, {"neg", -1}, {"no", false}, {"s", "a b"}},
       "f|4.9|neg|-1|no|0|s|a b|reporterID|1|Undefined|Generic",
       1,
       0},
      {{{"list", Value::array({1, "two", Value::array({3.5, false})})},
        {"dict", {{"y", 1}, {"x", {{"deep", "v"}, {"b", 2}}}}}},
       R"(dict|{"x":{"b":2,"deep":"v"},"y":1}|list|[1,"two",[3.5,false]]|reporterID|42|)"
       "Toolbox_Generic|Generic"},
      {{{"route", "speaker"}, {"gain", 1}, {"_comparison_field_blacklist", {"gain", 7}}},
       "_comparison_field_blacklist|^|gain|^|route|speaker|reporterID|42|Toolbox_Generic|Generic"},
      // A blacklist that is not an array excludes nothing but itself.
      {{{"gain", 1}, {"_comparison_field_blacklist", "gain"}},
       "_comparison_field_blacklist|^|gain|1|reporterID|42|Toolbox_Generic|Generic"},
      {{{"Volume", 0.5}}, "Volume|0.5|reporterID|42|Toolbox_Generic|Generic"},
      {{{"VolumeOperationTime", 10}},
       "VolumeOperationTime|10|reporterID|42|Toolbox_Generic|Generic"},
      {{{"n", 2.0}, {"t", true}}, "n|2|t|1|reporterID|42|Toolbox_Generic|Generic"},
      // Not a dictionary: the routing only.
      {Value::array({1, 2}), "reporterID|42|Toolbox_Generic|Generic"},
      {Value(), "reporterID|42|Toolbox_Generic|Generic"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(Key(c.message, c.reporter, c.category, c.type), c.key) << c.message.dump();
  }
}

// ---------------------------------------------------------------------------------------------
// Throttle time

TEST(SleepTimeTest, BelowFiveIsKeptToSinglePrecisionAndAnythingElseGivesHalfASecond) {
  FakeLogSystem logs;
  EXPECT_EQ(Throttle::determineSleepTime({{"x", 1}}), 0.5);
  EXPECT_EQ(Throttle::determineSleepTime(Value::array({"_throttle_seconds", 1})), 0.5);
  EXPECT_TRUE(logs.Lines().empty());

  constexpr double kLowest = std::numeric_limits<float>::lowest();
  const std::string large = "Rejecting large throttle time. {time=";
  const std::string nonNumber = "Rejecting non-number value of throttle time. {time=";
  const struct {
    Value seconds;
    double expected;
    std::string rejection;
  } cases[] = {
      {4.9, static_cast<double>(4.9f), ""},
      {4, 4.0, ""},
      {4u, 4.0, ""},
      {0.2, static_cast<double>(0.2f), ""},
      {0, 0.0, ""},
      {-1, -1.0, ""},
      {-7.5, -7.5, ""},
      {true, 1.0, ""},
      {-1e300, kLowest, ""},
      {-std::numeric_limits<double>::infinity(), kLowest, ""},
      {std::numeric_limits<int64_t>::min(), -0x1p63, ""},
      {5, 0.5, large + "5, max=5.000000}"},
      {5.0, 0.5, large + "5, max=5.000000}"},
      {std::numeric_limits<uint64_t>::max(), 0.5, large + "18446744073709551615, max=5.000000}"},
      {std::numeric_limits<double>::infinity(), 0.5, large + "inf, max=5.000000}"},
      {std::numeric_limits<double>::quiet_NaN(), 0.5, large + "nan, max=5.000000}"},
      {"3", 0.5, nonNumber + "3}"},
      {Value::array({1}), 0.5, nonNumber + "[1]}"},
      {Value(), 0.5, nonNumber + "(null)}"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.seconds.dump());
    logs.Clear();
    EXPECT_EQ(Throttle::determineSleepTime({{"x", 1}, {"_throttle_seconds", c.seconds}}),
              c.expected);
    const auto rejections = Messages(logs, "determineSleepTime", LogLevel::kInfo);
    EXPECT_EQ(rejections, c.rejection.empty() ? std::vector<std::string>{}
                                              : std::vector<std::string>{c.rejection});
  }
}

// ---------------------------------------------------------------------------------------------
// Delivery, on the fake dispatcher's clock: every time below is exact.

class ThrottleDeliveryTest : public ::testing::Test {
 protected:
  Dictionary Message(double throttleSeconds, int value = 1) {
    return {{"value", value},
            {"ruvoreporting_timestamp", static_cast<double>(++stamp_)},
            {"_throttle_seconds", throttleSeconds}};
  }
  // Adds a callback that records `label` with the time since the start, and whether it ran on
  // the throttle's own queue.
  void Add(int label, int64_t reporterID, double seconds, uint16_t type = 0) {
    throttle_->addMessageBlock([this, label] { Record(label); }, reporterID, Message(seconds), 3,
                               type);
  }
  void Record(int label) {
    labels_.push_back(label);
    at_.push_back(dispatcher_.GetClock().Now() - start_);
    SerialQueuePtr queue = dispatcher_.FindQueue(Throttle::kQueueLabel);
    onQueue_ = onQueue_ && queue && queue->IsCurrent();
  }

  FakeLogSystem logs_;
  testing::FakeDispatcher dispatcher_;
  const SteadyTime start_ = dispatcher_.GetClock().Now();
  std::unique_ptr<Throttle> throttle_ =
      std::make_unique<Throttle>(dispatcher_, Throttle::Timing{milliseconds(1), 3});
  std::vector<int> labels_;
  std::vector<Duration> at_;
  bool onQueue_ = true;
  int stamp_ = 0;
};

TEST_F(ThrottleDeliveryTest, BurstDeliversOnlyTheNewestOneThrottleTimeAfterTheBurst) {
  const std::string key = Key(Message(0.2), 7, 3, 0);
  for (int i = 0; i < 5; ++i) {
    Add(i, 7, 0.2);
    dispatcher_.AdvanceBy(milliseconds(10));
  }
  // The last add was at 40 ms, so it is due at 240 ms (0.2 read as a float, a hair over).
  dispatcher_.AdvanceBy(milliseconds(189));
  EXPECT_TRUE(labels_.empty());
  dispatcher_.AdvanceBy(milliseconds(2));
  EXPECT_EQ(labels_, std::vector<int>{4});
  dispatcher_.AdvanceBy(seconds(10));
  EXPECT_EQ(labels_, std::vector<int>{4}) << "an older callback was queued, not released";
  EXPECT_TRUE(onQueue_);
  EXPECT_EQ(Messages(logs_, "addMessageBlock", LogLevel::kDebug),
            std::vector<std::string>(4, "Dropping duplicate message for " + key));
}

TEST_F(ThrottleDeliveryTest, KeysFireInFireDateOrderAndAShorterDuplicateMovesTheDateEarlier) {
  Add(1, 1, 0.4);
  Add(2, 2, -1);      // other routing: fires at once
  Add(3, 1, 0.4, 1);  // other type
  Add(4, 5, 4.5);
  dispatcher_.RunUntilIdle();
  EXPECT_EQ(labels_, std::vector<int>{2});
  dispatcher_.AdvanceBy(milliseconds(150));
  Add(5, 5, 0.05);  // the duplicate of 4, due long before it
  dispatcher_.AdvanceBy(seconds(10));
  EXPECT_EQ(labels_, (std::vector<int>{2, 5, 1, 3}));
  EXPECT_EQ(at_[1], milliseconds(200));
  EXPECT_TRUE(onQueue_);
}

// Two keys are due at once, so both expiries are queued before either callback runs. While the
// first runs, a duplicate moves the second key's date: the expiry already queued for it must not
// deliver the new callback early.
TEST_F(ThrottleDeliveryTest, DuplicateArrivingWhileItsExpiryIsQueuedDoesNotDeliverEarly) {
  throttle_->addMessageBlock(
      [this] {
        Record(1);
        Add(3, 2, 0.3);
      },
      1, Message(-1), 3, 0);
  Add(2, 2, -1);
  dispatcher_.RunUntilIdle();
  EXPECT_EQ(labels_, std::vector<int>{1});
  dispatcher_.AdvanceBy(seconds(1));
  EXPECT_EQ(labels_, (std::vector<int>{1, 3}));
  EXPECT_GE(at_[1], milliseconds(299));
}

TEST_F(ThrottleDeliveryTest, ThrowingCallbackLeavesNoStaleEntryAndTheQueueGoesOn) {
  const Dictionary message = Message(0.05);
  throttle_->addMessageBlock(
      [this] {
        Record(1);
        throw std::runtime_error("boom");
      },
      1, message, 3, 0);
  dispatcher_.AdvanceBy(seconds(1));
  // The same key again is a new entry, not a duplicate of a stale one, and it is delivered.
  throttle_->addMessageBlock([this] { Record(2); }, 1, message, 3, 0);
  dispatcher_.AdvanceBy(seconds(1));
  EXPECT_EQ(labels_, (std::vector<int>{1, 2}));
  EXPECT_TRUE(Messages(logs_, "addMessageBlock", LogLevel::kDebug).empty());
  EXPECT_EQ(Messages(logs_, "deliver", LogLevel::kError),
            std::vector<std::string>{"Throttled delivery raised an exception: boom (1 so far)"});
}

TEST_F(ThrottleDeliveryTest, WaitForCompletionReturnsWhenIdleOrDeliveredAndGivesUpAtItsBound) {
  throttle_->waitForCompletion();
  EXPECT_EQ(Messages(logs_, "waitForCompletion", LogLevel::kInfo),
            std::vector<std::string>{"waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"});
  EXPECT_TRUE(Messages(logs_, "waitForCompletion", LogLevel::kDebug).empty());

  // Nothing delivers: the wait gives up after its bound (3 x 1 ms here) and the key stays.
  Add(1, 1, 0.05);
  throttle_->waitForCompletion();
  EXPECT_EQ(Messages(logs_, "waitForCompletion", LogLevel::kDefault),
            std::vector<std::string>{
                "Giving up on waiting for completion after 0 seconds. timersInFlight=1"});
  EXPECT_TRUE(labels_.empty());

  // Delivered meanwhile on another thread: the wait (with the standard 5 s bound) ends then.
  throttle_ = std::make_unique<Throttle>(dispatcher_);
  Add(2, 2, 0.05);
  std::thread driver([this] { dispatcher_.AdvanceBy(seconds(1)); });
  throttle_->waitForCompletion();
  driver.join();
  EXPECT_EQ(labels_, std::vector<int>{2}) << "the first throttle's key ran after it was gone";
  EXPECT_EQ(Messages(logs_, "waitForCompletion", LogLevel::kDefault).size(), 1u);
}

TEST_F(ThrottleDeliveryTest, PendingCallbacksNeverRunOnceTheThrottleIsGone) {
  Add(1, 1, 0.05);
  Add(2, 2, -1);
  throttle_.reset();
  dispatcher_.AdvanceBy(seconds(1));
  EXPECT_TRUE(labels_.empty());
}

}  // namespace
}  // namespace tavrin
