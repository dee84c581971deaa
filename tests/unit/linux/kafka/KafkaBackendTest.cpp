#include "platform/linux/kafka/KafkaBackend.h"

#include <librdkafka/rdkafka.h>
#include <librdkafka/rdkafka_mock.h>
#include <pthread.h>

#include <future>
#include <map>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/backend/BackendTestSupport.h"
#include "tests/unit/linux/kafka/LibrdkafkaTsanSupport.h"

namespace tavrin {
namespace {

using testing::FakeClock;
using testing::FakeLogSystem;
using testing::FlushAndWait;

const char* const kTables[] = {"sessions", "session_messages", "single_messages",
                               "analytics_events", "power_events"};

struct Consumed {
  std::optional<std::string> key;
  Value value;
};

ReportRecordPtr Analytics(const std::string& name, Dictionary payload) {
  return std::make_shared<const ReportRecord>(AnalyticsEventRecord{name, std::move(payload), 2.5});
}

// A one-broker mock cluster (librdkafka's own, in process; no broker to install), shared by the
// tests because taking one down costs a second. Requests that change the mock cluster sometimes
// take a second to be served, so the tests make few of them: topics are created on first use
// (with kMockPartitions partitions), and each test has its own topic prefix.
class KafkaBackendTest : public ::testing::Test {
 protected:
  static constexpr int kMockPartitions = 4;

  static void SetUpTestSuite() {
    char error[512];
    rd_kafka_conf_t* conf = rd_kafka_conf_new();
    rd_kafka_conf_set(conf, "log_level", "3", error, sizeof error);
    host_ = rd_kafka_new(RD_KAFKA_PRODUCER, conf, error, sizeof error);
    ASSERT_NE(host_, nullptr) << error;
    cluster_ = rd_kafka_mock_cluster_new(host_, 1);
    ASSERT_NE(cluster_, nullptr);
  }
  static void TearDownTestSuite() {
    if (cluster_) rd_kafka_mock_cluster_destroy(cluster_);
    if (host_) rd_kafka_destroy(host_);
    cluster_ = nullptr;
    host_ = nullptr;
  }

  void SetUp() override {
    ASSERT_NE(cluster_, nullptr);
    bootstrap_ = rd_kafka_mock_cluster_bootstraps(cluster_);
    static int testNumber = 0;
    prefix_ = "t" + std::to_string(++testNumber) + ".";
  }
  void SetBrokerDown() {
    ASSERT_EQ(rd_kafka_mock_broker_set_down(cluster_, 1), RD_KAFKA_RESP_ERR_NO_ERROR);
    brokerDown_ = true;
  }
  void SetBrokerUp() {
    ASSERT_EQ(rd_kafka_mock_broker_set_up(cluster_, 1), RD_KAFKA_RESP_ERR_NO_ERROR);
    brokerDown_ = false;
  }
  void TearDown() override {
    if (brokerDown_) SetBrokerUp();
  }
  std::string Topic(const std::string& table) const { return prefix_ + table; }

  KafkaBackendOptions Options() {
    KafkaBackendOptions options;
    options.bootstrap = bootstrap_;
    options.topicPrefix = prefix_;
    options.clock = &clock_;
    options.messageTimeout = std::chrono::seconds(20);
    options.shutdownTimeout = std::chrono::seconds(2);
    // Reconnect quickly once a broker is back, so the tests take seconds.
    options.extraConfig = {{"reconnect.backoff.ms", "20"}, {"reconnect.backoff.max.ms", "100"}};
    return options;
  }

  // Reads the records of `topics` from their start until `count` arrived in all, or the time-out.
  std::map<std::string, std::vector<Consumed>> ConsumeAll(const std::vector<std::string>& topics,
                                                          size_t count) {
    char error[512];
    rd_kafka_conf_t* conf = rd_kafka_conf_new();
    rd_kafka_conf_set(conf, "bootstrap.servers", bootstrap_.c_str(), error, sizeof error);
    rd_kafka_conf_set(conf, "group.id", "tavrin-test", error, sizeof error);
    rd_kafka_conf_set(conf, "enable.auto.commit", "false", error, sizeof error);
    rd_kafka_conf_set(conf, "log_level", "3", error, sizeof error);
    rd_kafka_t* consumer = rd_kafka_new(RD_KAFKA_CONSUMER, conf, error, sizeof error);
    EXPECT_NE(consumer, nullptr) << error;
    std::map<std::string, std::vector<Consumed>> got;
    if (!consumer) return got;
    rd_kafka_topic_partition_list_t* partitions =
        rd_kafka_topic_partition_list_new(static_cast<int>(topics.size()) * kMockPartitions);
    for (const std::string& topic : topics) {
      for (int partition = 0; partition < kMockPartitions; ++partition) {
        rd_kafka_topic_partition_list_add(partitions, topic.c_str(), partition)->offset =
            RD_KAFKA_OFFSET_BEGINNING;
      }
    }
    rd_kafka_assign(consumer, partitions);
    rd_kafka_topic_partition_list_destroy(partitions);
    const auto deadline = std::chrono::steady_clock::now() + testing::kAnswerTimeout;
    size_t received = 0;
    while (received < count && std::chrono::steady_clock::now() < deadline) {
      rd_kafka_message_t* message = rd_kafka_consumer_poll(consumer, 100);
      if (!message) continue;
      if (message->err == RD_KAFKA_RESP_ERR_NO_ERROR) {
        Consumed consumed;
        if (message->key) {
          consumed.key = std::string(static_cast<const char*>(message->key), message->key_len);
        }
        consumed.value = Value::parse(
            std::string_view(static_cast<const char*>(message->payload), message->len));
        got[rd_kafka_topic_name(message->rkt)].push_back(std::move(consumed));
        ++received;
      }
      rd_kafka_message_destroy(message);
    }
    rd_kafka_consumer_close(consumer);
    rd_kafka_destroy(consumer);
    return got;
  }
  std::vector<Consumed> Consume(const std::string& topic, size_t count) {
    return ConsumeAll({topic}, count)[topic];
  }

  static inline rd_kafka_t* host_ = nullptr;
  static inline rd_kafka_mock_cluster_t* cluster_ = nullptr;
  FakeLogSystem logs_;
  FakeClock clock_;
  std::string bootstrap_;
  std::string prefix_;
  bool brokerDown_ = false;
};

TEST_F(KafkaBackendTest, RecordsArriveAsJsonOnTheirTopicsKeyedByReporter) {
  KafkaProducerBackend backend(Options());
  ASSERT_TRUE(backend.IsUp());
  EXPECT_EQ(backend.Name(), "kafka:" + bootstrap_);

  const Dictionary info = {{"SessionID", -7}, {"HierarchyToken", 18446744073709551615ull}};
  const Dictionary payload = {{"engine on time", 4.5}, {"list", {1, "two"}}};
  ASSERT_TRUE(backend.Append(std::make_shared<const ReportRecord>(
      SessionRecord{3, -7, info, {{"ClientName", "c"}}, 100.5, std::nullopt})));
  ASSERT_TRUE(backend.Append(
      std::make_shared<const ReportRecord>(SessionMessageRecord{3, -7, 258, 9, payload, 101.25})));
  ASSERT_TRUE(backend.Append(std::make_shared<const ReportRecord>(
      SingleMessageRecord{{{"SessionID", -1}}, {{"ServiceName", "alarms"}}, 1, 2, payload, 102})));
  ASSERT_TRUE(backend.Append(Analytics("com.quorvex.tavrin.DSP.Stop", payload)));
  ASSERT_TRUE(backend.Append(std::make_shared<const ReportRecord>(
      PowerEventRecord{28, "Mediane_Haptics", {{"EngineOnDuration", 3}}, 104})));
  const auto answer = FlushAndWait(backend);
  ASSERT_TRUE(answer.answered);
  EXPECT_FALSE(answer.error) << answer.error->description;
  EXPECT_EQ(backend.Stats().accepted, 5u);
  EXPECT_EQ(backend.Stats().committed, 5u);

  std::vector<std::string> topics;
  for (const char* table : kTables) topics.push_back(Topic(table));
  auto all = ConsumeAll(topics, 5);
  auto got = all[Topic("sessions")];
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].key, "-7");
  EXPECT_EQ(got[0].value, (Value{{"row", 3},
                                 {"reporter_id", -7},
                                 {"session_info", info},
                                 {"user_info", {{"ClientName", "c"}}},
                                 {"created_at", 100.5},
                                 {"flushed_at", nullptr}}));
  got = all[Topic("session_messages")];
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].key, "-7");
  EXPECT_EQ(got[0].value, (Value{{"session_row", 3},
                                 {"reporter_id", -7},
                                 {"category", 258},
                                 {"type", 9},
                                 {"payload", payload},
                                 {"received_at", 101.25}}));
  got = all[Topic("single_messages")];
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].key, std::nullopt) << "single messages belong to no reporter";
  EXPECT_EQ(got[0].value["user_info"], (Value{{"ServiceName", "alarms"}}));
  EXPECT_EQ(got[0].value["payload"], payload);
  got = all[Topic("analytics_events")];
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].key, std::nullopt);
  EXPECT_EQ(
      got[0].value,
      (Value{{"name", "com.quorvex.tavrin.DSP.Stop"}, {"payload", payload}, {"received_at", 2.5}}));
  got = all[Topic("power_events")];
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].value, (Value{{"agent", 28},
                                 {"name", "Mediane_Haptics"},
                                 {"payload", {{"EngineOnDuration", 3}}},
                                 {"received_at", 104}}));
}

TEST_F(KafkaBackendTest, FlushAnswersFromThePollThreadAfterEveryEarlierRecordIsAcknowledged) {
  KafkaProducerBackend backend(Options());
  constexpr int kRecords = 300;
  for (int i = 0; i < kRecords; ++i) ASSERT_TRUE(backend.Append(Analytics("e", {{"i", i}})));
  std::promise<std::pair<uint64_t, std::string>> seen;
  backend.Flush([&](const OptionalError& error) {
    EXPECT_FALSE(error);
    char name[16] = {};
    pthread_getname_np(pthread_self(), name, sizeof name);
    seen.set_value({backend.Stats().committed, name});
  });
  auto future = seen.get_future();
  ASSERT_EQ(future.wait_for(testing::kAnswerTimeout), std::future_status::ready);
  const auto [acknowledged, thread] = future.get();
  EXPECT_EQ(acknowledged, uint64_t(kRecords));
  EXPECT_EQ(thread, "tavrin-kafka");

  std::set<int> numbers;
  for (const auto& consumed : Consume(Topic("analytics_events"), kRecords)) {
    numbers.insert(consumed.value["payload"]["i"].get<int>());
  }
  EXPECT_EQ(numbers.size(), size_t(kRecords));
}

TEST_F(KafkaBackendTest, WhileTheBrokerIsDownRecordsWaitAndArriveWhenItReturns) {
  KafkaProducerBackend backend(Options());
  ASSERT_FALSE(FlushAndWait(backend).error);  // connected
  SetBrokerDown();

  for (int i = 0; i < 10; ++i) ASSERT_TRUE(backend.Append(Analytics("down", {{"i", i}})));
  auto answered = std::make_shared<std::promise<OptionalError>>();
  backend.Flush([answered](const OptionalError& error) { answered->set_value(error); });
  auto future = answered->get_future();
  EXPECT_EQ(future.wait_for(std::chrono::milliseconds(500)), std::future_status::timeout)
      << "a flush must wait for the acknowledgements";
  EXPECT_EQ(backend.Stats().committed, 0u);
  EXPECT_TRUE(backend.IsUp()) << "unreachable brokers make records wait, not the back-end down";

  SetBrokerUp();
  ASSERT_EQ(future.wait_for(testing::kAnswerTimeout), std::future_status::ready);
  EXPECT_FALSE(future.get());
  EXPECT_EQ(backend.Stats().committed, 10u);
  EXPECT_EQ(backend.DroppedRecords(), 0u);
  EXPECT_EQ(Consume(Topic("analytics_events"), 10).size(), 10u);
}

TEST_F(KafkaBackendTest, RecordsWhoseTimeRunsOutAreCountedAsDroppedAndTheFlushSaysSo) {
  KafkaBackendOptions options = Options();
  options.messageTimeout = std::chrono::milliseconds(300);
  KafkaProducerBackend backend(options);
  ASSERT_FALSE(FlushAndWait(backend).error);
  SetBrokerDown();

  for (int i = 0; i < 5; ++i) ASSERT_TRUE(backend.Append(Analytics("lost", {})));
  const auto answer = FlushAndWait(backend);
  ASSERT_TRUE(answer.answered);
  ASSERT_TRUE(answer.error);
  EXPECT_NE(answer.error->description.find("dropped 5 record(s)"), std::string::npos)
      << answer.error->description;
  EXPECT_EQ(backend.FailedDeliveries(), 5u);
  EXPECT_EQ(backend.DroppedRecords(), 5u);
  EXPECT_EQ(backend.Stats().committed, 0u);
  EXPECT_EQ(logs_.Count("delivery failed", LogLevel::kError), 1u) << "one line for the burst";

  // The loss is reported once: the next flush has nothing new to report.
  EXPECT_FALSE(FlushAndWait(backend).error);
}

TEST_F(KafkaBackendTest, FullProducerQueueDropsAreCountedAndLoggedOnce) {
  KafkaBackendOptions options = Options();
  options.maxQueuedMessages = 5;
  KafkaProducerBackend backend(options);
  ASSERT_FALSE(FlushAndWait(backend).error);
  SetBrokerDown();

  int accepted = 0;
  for (int i = 0; i < 12; ++i) accepted += backend.Append(Analytics("q", {{"i", i}})) ? 1 : 0;
  EXPECT_EQ(accepted, 5);
  EXPECT_EQ(backend.DroppedRecords(), 7u);
  EXPECT_EQ(backend.Stats().dropped, 7u);
  EXPECT_EQ(logs_.Count("producer queue is full (5 records)", LogLevel::kError), 1u);

  SetBrokerUp();
  const auto answer = FlushAndWait(backend);
  ASSERT_TRUE(answer.error) << "records were dropped since the previous answer";
  EXPECT_EQ(backend.Stats().committed, 5u);
  std::set<int> numbers;
  for (const auto& consumed : Consume(Topic("analytics_events"), 5)) {
    numbers.insert(consumed.value["payload"]["i"].get<int>());
  }
  EXPECT_EQ(numbers, (std::set<int>{0, 1, 2, 3, 4})) << "the first five were kept";
}

TEST_F(KafkaBackendTest, BadSettingLeavesTheBackendDownAndItStillAnswersFlushes) {
  KafkaBackendOptions options = Options();
  options.extraConfig.push_back({"no.such.setting", "1"});
  KafkaProducerBackend backend(options);
  EXPECT_FALSE(backend.IsUp());
  EXPECT_EQ(logs_.Count("no.such.setting", LogLevel::kError), 1u);
  EXPECT_FALSE(backend.Append(Analytics("e", {})));
  EXPECT_EQ(backend.DroppedRecords(), 1u);

  std::promise<std::pair<OptionalError, std::thread::id>> answered;
  backend.Flush([&](const OptionalError& error) {
    answered.set_value({error, std::this_thread::get_id()});
  });
  auto future = answered.get_future();
  ASSERT_EQ(future.wait_for(testing::kAnswerTimeout), std::future_status::ready);
  const auto [error, thread] = future.get();
  ASSERT_TRUE(error);
  EXPECT_NE(error->description.find("not up"), std::string::npos);
  EXPECT_NE(thread, std::this_thread::get_id());
}

TEST_F(KafkaBackendTest, ShutdownWithTheBrokerDownGivesUpAfterItsBoundAndCountsTheRest) {
  KafkaBackendOptions options = Options();
  options.shutdownTimeout = std::chrono::milliseconds(300);
  KafkaProducerBackend backend(options);
  ASSERT_FALSE(FlushAndWait(backend).error);
  SetBrokerDown();
  for (int i = 0; i < 4; ++i) ASSERT_TRUE(backend.Append(Analytics("stuck", {})));
  std::promise<OptionalError> pending;
  backend.Flush([&](const OptionalError& error) { pending.set_value(error); });

  const auto started = std::chrono::steady_clock::now();
  backend.Shutdown();
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
  auto future = pending.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  EXPECT_TRUE(future.get());
  EXPECT_EQ(backend.DroppedRecords(), 4u);
  EXPECT_FALSE(backend.IsUp());
  EXPECT_FALSE(backend.Append(Analytics("late", {})));
  EXPECT_EQ(backend.DroppedRecords(), 5u);
}

}  // namespace
}  // namespace tavrin
