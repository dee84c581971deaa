#include "Statistics/Service/RuvoReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <limits>
#include <memory>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using testing::FakeLogSystem;
using testing::LoggedLine;
using Clock = std::chrono::steady_clock;
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
// Delivery on the throttle thread. Real time with generous upper bounds: a loaded machine only
// delays deliveries, and the lower bounds come from the timers themselves.

// Records each delivered callback's label, time and thread.
class Deliveries {
 public:
  struct Delivery {
    int label;
    Clock::time_point at;
    std::thread::id thread;
  };

  RuvoReportingBlockThrottle::Block Callback(int label) {
    return [this, label] { Record(label); };
  }
  void Record(int label) {
    std::lock_guard lock(mutex_);
    delivered_.push_back({label, Clock::now(), std::this_thread::get_id()});
    changed_.notify_all();
  }
  // Waits until at least `count` deliveries happened or `timeout` passed.
  bool WaitFor(size_t count, Clock::duration timeout = seconds(10)) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return delivered_.size() >= count; });
  }
  std::vector<Delivery> Get() const {
    std::lock_guard lock(mutex_);
    return delivered_;
  }
  std::vector<int> Labels() const {
    std::vector<int> labels;
    for (const auto& delivery : Get()) labels.push_back(delivery.label);
    return labels;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Delivery> delivered_;
};

// Short pauses so rounds are quick: 20 ms between rounds, waitForCompletion bound 10 x 100 ms.
const Throttle::Timing kFastTiming{milliseconds(20), milliseconds(100), 10};

template <typename Predicate>
bool WaitUntil(Predicate predicate, Clock::duration timeout = seconds(10)) {
  const auto deadline = Clock::now() + timeout;
  while (!predicate()) {
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(milliseconds(5));
  }
  return true;
}

class ThrottleDeliveryTest : public ::testing::Test {
 protected:
  Dictionary Message(double throttleSeconds, int value = 1) {
    return {{"value", value},
            {"ruvoreporting_timestamp", static_cast<double>(++stamp_)},
            {"_throttle_seconds", throttleSeconds}};
  }

  // Declared first: outlives the throttle, whose thread writes to it.
  FakeLogSystem logs_;
  Deliveries deliveries_;
  std::unique_ptr<Throttle> throttle_ = std::make_unique<Throttle>(kFastTiming);
  int stamp_ = 0;
};

TEST_F(ThrottleDeliveryTest, BurstDeliversOnlyTheNewestOneThrottleTimeAfterTheBurst) {
  constexpr int kBurst = 5;
  const Dictionary first = Message(0.2);
  const std::string key = Key(first, 7, 0x08000001, 1);
  Clock::time_point lastAdd;
  for (int i = 0; i < kBurst; ++i) {
    lastAdd = Clock::now();
    throttle_->addMessageBlock(deliveries_.Callback(i), 7, Message(0.2), 0x08000001, 1);
    std::this_thread::sleep_for(milliseconds(10));
  }
  ASSERT_TRUE(deliveries_.WaitFor(1));
  const auto delivered = deliveries_.Get()[0];
  EXPECT_EQ(delivered.label, kBurst - 1);
  EXPECT_GE(delivered.at - lastAdd, milliseconds(200));
  EXPECT_LT(delivered.at - lastAdd, seconds(3));
  EXPECT_NE(delivered.thread, std::this_thread::get_id());

  // Nothing else arrives later: the older callbacks were released, not queued.
  std::this_thread::sleep_for(milliseconds(400));
  EXPECT_EQ(deliveries_.Labels(), std::vector<int>{kBurst - 1});
  const std::vector<std::string> duplicates = Messages(logs_, "addMessageBlock", LogLevel::kDebug);
  EXPECT_EQ(duplicates,
            std::vector<std::string>(kBurst - 1, "Dropping duplicate message for " + key));
}

TEST_F(ThrottleDeliveryTest, DifferentRoutingDeliversBothOnOneThread) {
  throttle_->addMessageBlock(deliveries_.Callback(1), 1, Message(0.05), 3, 0);
  throttle_->addMessageBlock(deliveries_.Callback(2), 2, Message(0.05), 3, 0);
  throttle_->addMessageBlock(deliveries_.Callback(3), 1, Message(0.05), 3, 1);
  ASSERT_TRUE(deliveries_.WaitFor(3));
  const auto delivered = deliveries_.Get();
  EXPECT_EQ(delivered[0].thread, delivered[1].thread);
  EXPECT_EQ(delivered[1].thread, delivered[2].thread);
  std::vector<int> labels = deliveries_.Labels();
  std::sort(labels.begin(), labels.end());
  EXPECT_EQ(labels, (std::vector<int>{1, 2, 3}));
}

TEST_F(ThrottleDeliveryTest, CallbacksRunInFireDateOrderAndNegativeTimeFiresAtOnce) {
  const auto start = Clock::now();
  throttle_->addMessageBlock(deliveries_.Callback(1), 1, Message(0.4), 3, 0);
  throttle_->addMessageBlock(deliveries_.Callback(2), 2, Message(-1), 3, 0);
  ASSERT_TRUE(deliveries_.WaitFor(2));
  const auto delivered = deliveries_.Get();
  if (deliveries_.Labels() == std::vector<int>{2, 1}) {
    // Both timers attached in the same round: fire-date order, the negative one at once.
    EXPECT_LT(delivered[0].at - start, milliseconds(400));
    EXPECT_GE(delivered[1].at - start, milliseconds(400));
  } else {
    // On a slow machine the thread may start its round between the two adds; the second key then
    // waits for the round to end, and its passed fire date makes it fire as soon as it is attached
    // (the idle poll is 0.1 s).
    ASSERT_EQ(deliveries_.Labels(), (std::vector<int>{1, 2}));
    EXPECT_GE(delivered[0].at - start, milliseconds(400));
    EXPECT_LT(delivered[1].at - delivered[0].at, milliseconds(1000));
  }
}

TEST_F(ThrottleDeliveryTest, DuplicateWithShorterTimeMovesTheFireDateEarlier) {
  const auto start = Clock::now();
  throttle_->addMessageBlock(deliveries_.Callback(1), 1, Message(4.5), 3, 0);
  // Long enough for the first timer to be attached to the throttle thread.
  std::this_thread::sleep_for(milliseconds(150));
  throttle_->addMessageBlock(deliveries_.Callback(2), 1, Message(0.05), 3, 0);
  ASSERT_TRUE(deliveries_.WaitFor(1, seconds(10)));
  EXPECT_EQ(deliveries_.Labels(), std::vector<int>{2});
  EXPECT_LT(deliveries_.Get()[0].at - start, seconds(4));
}

// Each callback may run only once a full throttle time has passed since it was added; an expiry
// that was already queued when a duplicate moved the fire date must not deliver early.
TEST_F(ThrottleDeliveryTest, StreamOfDuplicatesNeverDeliversBeforeTheThrottleTime) {
  constexpr int kMessages = 60;
  // 0.03 read as a float is a hair under 30 ms.
  constexpr auto kThrottle = milliseconds(29);
  std::vector<Clock::time_point> added(kMessages);
  for (int i = 0; i < kMessages; ++i) {
    added[i] = Clock::now();
    throttle_->addMessageBlock(deliveries_.Callback(i), 9, Message(0.03), 3, 0);
    std::this_thread::sleep_for(milliseconds(i % 3 == 0 ? 25 : 5));
  }
  std::this_thread::sleep_for(milliseconds(300));
  throttle_->waitForCompletion();
  const auto delivered = deliveries_.Get();
  ASSERT_FALSE(delivered.empty());
  int previous = -1;
  for (const auto& delivery : delivered) {
    EXPECT_GT(delivery.label, previous);
    previous = delivery.label;
    EXPECT_GE(delivery.at - added[delivery.label], kThrottle) << "label " << delivery.label;
  }
}

// Two keys due at once have both expiries queued before either callback runs. While the first
// callback holds the thread, a duplicate moves the second key's fire date: the expiry already
// queued for it must not deliver the new callback early.
TEST_F(ThrottleDeliveryTest, DuplicateArrivingWhileItsExpiryIsQueuedDoesNotDeliverEarly) {
  std::mutex mutex;
  std::condition_variable changed;
  bool firstRunning = false;
  bool release = false;
  throttle_->addMessageBlock(
      [&] {
        std::unique_lock lock(mutex);
        firstRunning = true;
        changed.notify_all();
        changed.wait_for(lock, seconds(10), [&] { return release; });
        deliveries_.Record(1);
      },
      1, Message(-1), 3, 0);
  throttle_->addMessageBlock(deliveries_.Callback(2), 2, Message(-1), 3, 0);
  {
    std::unique_lock lock(mutex);
    ASSERT_TRUE(changed.wait_for(lock, seconds(10), [&] { return firstRunning; }));
  }
  const auto duplicateAdded = Clock::now();
  throttle_->addMessageBlock(deliveries_.Callback(3), 2, Message(0.3), 3, 0);
  {
    std::lock_guard lock(mutex);
    release = true;
  }
  changed.notify_all();

  ASSERT_TRUE(deliveries_.WaitFor(2));
  const auto delivered = deliveries_.Get();
  EXPECT_EQ(deliveries_.Labels(), (std::vector<int>{1, 3}));
  EXPECT_GE(delivered[1].at - duplicateAdded, milliseconds(300));
}

TEST_F(ThrottleDeliveryTest, ThrowingCallbackLeavesNoStaleEntry) {
  const Dictionary message = Message(0.05);
  throttle_->addMessageBlock(
      [this] {
        deliveries_.Record(1);
        throw std::runtime_error("boom");
      },
      1, message, 3, 0);
  // The error line is written after the entry was removed; a message added before that would
  // be an accepted late duplicate of the failing one.
  ASSERT_TRUE(WaitUntil([&] { return logs_.Count("raised an exception") == 1; }));

  // The same key again is a new entry, not a duplicate of a stale one, and it is delivered.
  throttle_->addMessageBlock(deliveries_.Callback(2), 1, message, 3, 0);
  ASSERT_TRUE(deliveries_.WaitFor(2));
  EXPECT_EQ(deliveries_.Labels(), (std::vector<int>{1, 2}));
  EXPECT_TRUE(Messages(logs_, "addMessageBlock", LogLevel::kDebug).empty());

  // The failure is logged once on the throttle thread, which keeps running.
  EXPECT_EQ(Messages(logs_, "runUntilNoTimersLeft", LogLevel::kError),
            std::vector<std::string>{"Throttled delivery raised an exception: boom (1 so far)"});
  throttle_->addMessageBlock(deliveries_.Callback(3), 2, message, 3, 0);
  ASSERT_TRUE(deliveries_.WaitFor(3));
}

TEST_F(ThrottleDeliveryTest, WaitForCompletionWhenIdleLogsOneLineAndReturns) {
  const auto start = Clock::now();
  throttle_->waitForCompletion();
  EXPECT_LT(Clock::now() - start, milliseconds(500));
  EXPECT_EQ(Messages(logs_, "waitForCompletion", LogLevel::kInfo),
            std::vector<std::string>{"waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"});
  EXPECT_TRUE(Messages(logs_, "waitForCompletion", LogLevel::kDebug).empty());
  EXPECT_TRUE(Messages(logs_, "waitForCompletion", LogLevel::kDefault).empty());
}

TEST_F(ThrottleDeliveryTest, WaitForCompletionReturnsOnceThePendingDeliveryRan) {
  // The standard 5 s bound, so that a slow machine cannot make the wait give up.
  throttle_ = std::make_unique<Throttle>(Throttle::Timing{milliseconds(20)});
  throttle_->addMessageBlock(deliveries_.Callback(1), 1, Message(0.05), 3, 0);
  throttle_->waitForCompletion();
  EXPECT_EQ(deliveries_.Labels(), std::vector<int>{1});
  EXPECT_EQ(
      Messages(logs_, "waitForCompletion", LogLevel::kDebug),
      std::vector<std::string>{"Waiting up to 5 seconds for blockThrottle queue to be empty."});
  EXPECT_TRUE(Messages(logs_, "waitForCompletion", LogLevel::kDefault).empty());
}

TEST_F(ThrottleDeliveryTest, WaitForCompletionGivesUpAfterItsBoundAndDeliveryStaysPending) {
  throttle_->addMessageBlock(deliveries_.Callback(1), 1, Message(4.9), 3, 0);
  const auto start = Clock::now();
  throttle_->waitForCompletion();
  const auto waited = Clock::now() - start;
  EXPECT_GE(waited, seconds(1));
  EXPECT_LT(waited, milliseconds(4500));
  EXPECT_TRUE(deliveries_.Get().empty());

  const auto info = Messages(logs_, "waitForCompletion", LogLevel::kInfo);
  ASSERT_EQ(info.size(), 1u);
  EXPECT_TRUE(info[0].starts_with("waitForCompletion. timersInFlight=1 unscheduledTimerKeys="))
      << info[0];
  EXPECT_EQ(Messages(logs_, "waitForCompletion", LogLevel::kDefault),
            std::vector<std::string>{
                "Giving up on waiting for completion after 1 seconds. timersInFlight=1"});

  // Tearing down does not wait for the pending delivery, and never runs it.
  const auto stopping = Clock::now();
  throttle_.reset();
  EXPECT_LT(Clock::now() - stopping, seconds(2));
  EXPECT_TRUE(deliveries_.Get().empty());
}

TEST(ThrottleStandardTimingTest, IdleThrottleStopsPromptly) {
  FakeLogSystem logs;
  auto throttle = std::make_unique<Throttle>();
  std::this_thread::sleep_for(milliseconds(50));
  const auto start = Clock::now();
  throttle.reset();
  EXPECT_LT(Clock::now() - start, seconds(2));
  // The idle thread polls: it logged its pause at least once and attached nothing.
  EXPECT_GE(Messages(logs, "threadLoop", LogLevel::kDebug).size(), 1u);
  for (const auto& message : Messages(logs, "threadLoop", LogLevel::kDebug)) {
    EXPECT_EQ(message, "sleeping in thread");
  }
}

}  // namespace
}  // namespace tavrin
