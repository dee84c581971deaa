#include "Statistics/Service/RuvoReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <chrono>
#include <limits>
#include <memory>
#include <optional>
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
using testing::LoggedLine;
using Throttle = RuvoReportingBlockThrottle;

std::string Key(const Dictionary& message, int64_t reporterID = 42, uint32_t category = 0x80000001,
                uint16_t type = 0) {
  return Throttle::buildMessageKey(message, reporterID, category, type);
}

// The message of a line written by `function` in RuvoReportingBlockThrottle.cpp, when the line
// has the "RuvoReportingBlockThrottle.cpp:<digits>:<function>: " prefix.
std::optional<std::string> ThrottleLineMessage(const std::string& text, std::string_view function) {
  constexpr std::string_view kFile = "RuvoReportingBlockThrottle.cpp:";
  if (!text.starts_with(kFile)) return std::nullopt;
  size_t position = kFile.size();
  const size_t digits = position;
  while (position < text.size() && text[position] >= '0' && text[position] <= '9') ++position;
  if (position == digits) return std::nullopt;
  const std::string tail = ":" + std::string(function) + ": ";
  if (text.compare(position, tail.size(), tail) != 0) return std::nullopt;
  return text.substr(position + tail.size());
}

// Lines of `function` at `level`, as their messages.
std::vector<std::string> Messages(const FakeLogSystem& logs, std::string_view function,
                                  LogLevel level) {
  std::vector<std::string> found;
  for (const LoggedLine& line : logs.Lines()) {
    if (line.level != level) continue;
    if (auto message = ThrottleLineMessage(line.text, function)) found.push_back(*message);
  }
  return found;
}

// ---------------------------------------------------------------------------------------------
// Message key

TEST(BlockThrottleKeyTest, ExampleMessageGivesTheDocumentedKey) {
  Dictionary message = MakeDictionary();
  message["b"] = 2;
  message["a"] = "x";
  message["ruvoreporting_timestamp"] = 123.4;
  EXPECT_EQ(Key(message, 42, 0x80000001, 0),
            "a|x|b|2|ruvoreporting_timestamp|^|reporterID|42|Toolbox_Generic|Generic");
}

TEST(BlockThrottleKeyTest, DefaultBlacklistedFieldsKeepTheirNameButNotTheirValue) {
  const Dictionary first = {{"level", 3},
                            {"ruvoreporting_timestamp", 1.5},
                            {"systemuptime_sec", 100},
                            {"processuptime_ms", 7},
                            {"_throttle_seconds", 0.2},
                            {"_comparison_field_blacklist", Value::array()}};
  const Dictionary second = {{"level", 3},
                             {"ruvoreporting_timestamp", 99.25},
                             {"systemuptime_sec", 250},
                             {"processuptime_ms", 9000},
                             {"_throttle_seconds", 1},
                             {"_comparison_field_blacklist", Value::array({"other"})}};
  EXPECT_EQ(Key(first), Key(second));
  EXPECT_EQ(Key(first),
            "_comparison_field_blacklist|^|_throttle_seconds|^|level|3|processuptime_ms|^|"
            "ruvoreporting_timestamp|^|systemuptime_sec|^|reporterID|42|Toolbox_Generic|Generic");
  // An excluded field that is absent from one message still tells the two apart.
  const Dictionary withoutTimestamp = {{"level", 3}};
  const Dictionary withTimestamp = {{"level", 3}, {"ruvoreporting_timestamp", 1.0}};
  EXPECT_NE(Key(withoutTimestamp), Key(withTimestamp));
  // A field that is not excluded still counts.
  EXPECT_NE(Key({{"level", 3}}), Key({{"level", 4}}));
}

TEST(BlockThrottleKeyTest, RoutingTellsEqualMessagesApart) {
  const Dictionary message = {{"level", 3}};
  const std::string base = Key(message, 42, 0x80000001, 0);
  EXPECT_NE(base, Key(message, 43, 0x80000001, 0));
  EXPECT_NE(base, Key(message, 42, 0x80000002, 0));
  EXPECT_NE(base, Key(message, 42, 0x90000001, 0));  // "_Generic"
  EXPECT_NE(base, Key(message, 42, 0x80000001, 1));
  EXPECT_EQ(Key(message, -5, 0xFFFFFFFF, 0xFFFF), "level|3|reporterID|-5|Undefined|Unknown");
  EXPECT_EQ(Key(message, std::numeric_limits<int64_t>::min(), 3, 6),
            "level|3|reporterID|-9223372036854775808|Playback|Undefined");
}

TEST(BlockThrottleKeyTest, MessageBlacklistExcludesItsFieldsOnly) {
  const Dictionary first = {
      {"route", "speaker"}, {"gain", 1}, {"_comparison_field_blacklist", {"gain", 7}}};
  Dictionary second = first;
  second["gain"] = 2;
  EXPECT_EQ(Key(first), Key(second));
  // Lacking the field is not the same as an ignored value.
  Dictionary lacking = first;
  lacking.erase("gain");
  EXPECT_NE(Key(first), Key(lacking));
  // Other fields still count.
  Dictionary otherRoute = first;
  otherRoute["route"] = "receiver";
  EXPECT_NE(Key(first), Key(otherRoute));
}

TEST(BlockThrottleKeyTest, BlacklistThatIsNotAnArrayIsIgnored) {
  const Dictionary first = {{"gain", 1}, {"_comparison_field_blacklist", "gain"}};
  const Dictionary second = {{"gain", 2}, {"_comparison_field_blacklist", "gain"}};
  EXPECT_NE(Key(first), Key(second));
  const Dictionary asDictionary = {{"gain", 1}, {"_comparison_field_blacklist", {{"gain", 1}}}};
  EXPECT_EQ(Key(asDictionary),
            "_comparison_field_blacklist|^|gain|1|reporterID|42|"
            "Toolbox_Generic|Generic");
}

TEST(BlockThrottleKeyTest, VolumeCollapsesOnlyWithItsOperationTime) {
  const Dictionary paired = {{"Volume", 0.5}, {"VolumeOperationTime", 10}};
  const Dictionary pairedOther = {{"Volume", 0.75}, {"VolumeOperationTime", 11}};
  EXPECT_EQ(Key(paired), Key(pairedOther));
  EXPECT_EQ(Key(paired), "Volume|^|VolumeOperationTime|^|reporterID|42|Toolbox_Generic|Generic");

  EXPECT_NE(Key({{"Volume", 0.5}}), Key({{"Volume", 0.75}}));
  EXPECT_EQ(Key({{"Volume", 0.5}}), Key({{"Volume", 0.5}}));
  EXPECT_NE(Key({{"VolumeOperationTime", 10}}), Key({{"VolumeOperationTime", 11}}));
}

TEST(BlockThrottleKeyTest, FieldsSortByCharacterCodeWhateverTheirOrder) {
  const Dictionary message = {{"a", 1}, {"_", 2}, {"Z", 3}, {"\xC3\xA9", 4}, {"B", 5}};
  EXPECT_EQ(Key(message), "B|5|Z|3|_|2|a|1|\xC3\xA9|4|reporterID|42|Toolbox_Generic|Generic");
  const Dictionary reordered = {{"\xC3\xA9", 4}, {"B", 5}, {"Z", 3}, {"a", 1}, {"_", 2}};
  EXPECT_EQ(Key(message), Key(reordered));
}

TEST(BlockThrottleKeyTest, ValueTextForms) {
  EXPECT_EQ(Key({{"n", 2.0}}), Key({{"n", 2}}));
  EXPECT_EQ(Key({{"n", true}}), Key({{"n", 1}}));
  EXPECT_EQ(Key({{"f", 4.9}, {"neg", -1}, {"no", false}, {"s", "a b"}}, 1, 0, 0),
            "f|4.9|neg|-1|no|0|s|a b|reporterID|1|Undefined|Generic");
}

// Equal nested dictionaries built in different orders are duplicates of one message.
TEST(BlockThrottleKeyTest, NestedValuesGiveTheSameKeyWhateverTheirKeyOrder) {
  auto build = [] {
    return Dictionary{{"list", Value::array({1, "two", Value::array({3.5, false})})},
                      {"dict", {{"y", 1}, {"x", {{"deep", "v"}, {"b", 2}}}}}};
  };
  const std::string key = Key(build());
  EXPECT_EQ(key, Key(Dictionary{{"dict", {{"x", {{"b", 2}, {"deep", "v"}}}, {"y", 1}}},
                                {"list", Value::array({1, "two", Value::array({3.5, false})})}}));
  EXPECT_EQ(key, R"(dict|{"x":{"b":2,"deep":"v"},"y":1}|list|[1,"two",[3.5,false]]|reporterID|42|)"
                 "Toolbox_Generic|Generic");
  Dictionary changed = build();
  changed["dict"]["x"]["deep"] = "w";
  EXPECT_NE(key, Key(changed));
}

TEST(BlockThrottleKeyTest, NonDictionaryMessageGivesRoutingOnly) {
  EXPECT_EQ(Key(Value::array({1, 2})), "reporterID|42|Toolbox_Generic|Generic");
  EXPECT_EQ(Key(Value()), "reporterID|42|Toolbox_Generic|Generic");
}

// ---------------------------------------------------------------------------------------------
// Throttle time

class SleepTimeTest : public ::testing::Test {
 protected:
  double SleepTime(const Value& seconds) {
    return Throttle::determineSleepTime({{"x", 1}, {"_throttle_seconds", seconds}});
  }
  std::vector<std::string> Rejections() {
    return Messages(logs_, "determineSleepTime", LogLevel::kInfo);
  }
  FakeLogSystem logs_;
};

TEST_F(SleepTimeTest, MissingValueGivesHalfASecondSilently) {
  EXPECT_EQ(Throttle::determineSleepTime({{"x", 1}}), 0.5);
  EXPECT_EQ(Throttle::determineSleepTime(MakeDictionary()), 0.5);
  EXPECT_TRUE(logs_.Lines().empty());
}

TEST_F(SleepTimeTest, ValuesBelowFiveAreKeptToSinglePrecision) {
  EXPECT_EQ(SleepTime(4.9), static_cast<double>(4.9f));
  EXPECT_NE(SleepTime(4.9), 4.9);
  EXPECT_EQ(SleepTime(4.999), static_cast<double>(4.999f));
  EXPECT_EQ(SleepTime(4), 4.0);
  EXPECT_EQ(SleepTime(0.2), static_cast<double>(0.2f));
  EXPECT_EQ(SleepTime(0), 0.0);
  EXPECT_EQ(SleepTime(-1), -1.0);
  EXPECT_EQ(SleepTime(-7.5), -7.5);
  EXPECT_EQ(SleepTime(true), 1.0);
  EXPECT_TRUE(Rejections().empty());
}

TEST_F(SleepTimeTest, FiveOrMoreIsRejectedWithTheLargeLine) {
  EXPECT_EQ(SleepTime(5), 0.5);
  EXPECT_EQ(SleepTime(12), 0.5);
  EXPECT_EQ(SleepTime(5.5), 0.5);
  EXPECT_EQ(SleepTime(std::numeric_limits<uint64_t>::max()), 0.5);
  EXPECT_EQ(SleepTime(std::numeric_limits<double>::infinity()), 0.5);
  const std::vector<std::string> expected = {
      "Rejecting large throttle time. {time=5, max=5.000000}",
      "Rejecting large throttle time. {time=12, max=5.000000}",
      "Rejecting large throttle time. {time=5.5, max=5.000000}",
      "Rejecting large throttle time. {time=18446744073709551615, max=5.000000}",
      "Rejecting large throttle time. {time=inf, max=5.000000}",
  };
  EXPECT_EQ(Rejections(), expected);
}

TEST_F(SleepTimeTest, NonNumbersAreRejectedWithTheNonNumberLine) {
  EXPECT_EQ(SleepTime("3"), 0.5);
  EXPECT_EQ(SleepTime(Value::array({1})), 0.5);
  EXPECT_EQ(SleepTime(Value()), 0.5);
  const std::vector<std::string> expected = {
      "Rejecting non-number value of throttle time. {time=3}",
      "Rejecting non-number value of throttle time. {time=[1]}",
      "Rejecting non-number value of throttle time. {time=(null)}",
  };
  EXPECT_EQ(Rejections(), expected);
}

TEST_F(SleepTimeTest, ExtremeNegativesAndNanNeverMisbehave) {
  EXPECT_LT(SleepTime(-1e300), 0.0);
  EXPECT_LT(SleepTime(-std::numeric_limits<double>::infinity()), 0.0);
  EXPECT_LT(SleepTime(std::numeric_limits<int64_t>::min()), 0.0);
  EXPECT_EQ(SleepTime(std::numeric_limits<double>::quiet_NaN()), 0.5);
  EXPECT_EQ(Rejections().size(), 1u);
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
    at_.push_back(dispatcher_.Time().Now() - start_);
    SerialQueuePtr queue = dispatcher_.FindQueue(Throttle::kQueueLabel);
    onQueue_ = onQueue_ && queue && queue->IsCurrent();
  }

  FakeLogSystem logs_;
  testing::FakeDispatcher dispatcher_;
  const SteadyTime start_ = dispatcher_.Time().Now();
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

// Each callback runs only once a full throttle time has passed since it was added.
TEST_F(ThrottleDeliveryTest, StreamOfDuplicatesNeverDeliversBeforeTheThrottleTime) {
  std::vector<Duration> added;
  for (int i = 0; i < 60; ++i) {
    added.push_back(dispatcher_.Time().Now() - start_);
    Add(i, 9, 0.03);
    dispatcher_.AdvanceBy(milliseconds(i % 3 == 0 ? 35 : 5));
  }
  dispatcher_.AdvanceBy(seconds(1));
  ASSERT_GT(labels_.size(), 1u);
  EXPECT_EQ(labels_.back(), 59);
  for (size_t i = 0; i < labels_.size(); ++i) {
    if (i > 0) {
      EXPECT_GT(labels_[i], labels_[i - 1]);
    }
    EXPECT_GE(at_[i] - added[labels_[i]], milliseconds(29)) << labels_[i];
  }
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
