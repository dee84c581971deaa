#include "platform/linux/reporting/ReportingBackends.h"

#include <librdkafka/rdkafka.h>
#include <librdkafka/rdkafka_mock.h>

#include <future>
#include <limits>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "platform/linux/kafka/KafkaBackend.h"
#include "platform/linux/store/SqliteStore.h"
#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/fakes/FakeRandomSource.h"
#include "tests/unit/linux/backend/BackendTestSupport.h"
#include "tests/unit/linux/kafka/LibrdkafkaTsanSupport.h"

namespace tavrin {
namespace {

using testing::FakeClock;
using testing::FakeLogSystem;
using testing::FakeRandom;
using testing::Reader;
using testing::TempDir;
using testing::WriteBytes;
using Rows = std::vector<std::vector<std::string>>;

// ---- --backend values ---------------------------------------------------------------------------

TEST(ParseBackendSpec, AcceptsTheThreeKinds) {
  std::string error;
  auto choice = ParseBackendSpec("sqlite", &error);
  ASSERT_TRUE(choice);
  EXPECT_EQ(choice->kind, BackendSpec::Kind::kSqlite);
  choice = ParseBackendSpec("none", &error);
  ASSERT_TRUE(choice);
  EXPECT_EQ(choice->kind, BackendSpec::Kind::kNone);
  choice = ParseBackendSpec("kafka:broker:9092", &error);
  ASSERT_TRUE(choice);
  EXPECT_EQ(choice->kind, BackendSpec::Kind::kKafka);
  EXPECT_EQ(choice->bootstrap, "broker:9092");
  EXPECT_EQ(choice->topicPrefix, "");
  choice = ParseBackendSpec("kafka:a:9092,b:9093,topic-prefix=fleet.", &error);
  ASSERT_TRUE(choice);
  EXPECT_EQ(choice->bootstrap, "a:9092,b:9093");
  EXPECT_EQ(choice->topicPrefix, "fleet.");
  choice = ParseBackendSpec("kafka:topic-prefix=p,a:1", &error);  // options in any place
  ASSERT_TRUE(choice);
  EXPECT_EQ(choice->bootstrap, "a:1");
  EXPECT_EQ(choice->topicPrefix, "p");
}

TEST(ParseBackendSpec, RefusesBadValuesWithAReasonNamingThem) {
  const std::pair<const char*, const char*> bad[] = {
      {"", "unknown back-end"},
      {"SQLite", "unknown back-end"},
      {"postgres:db", "unknown back-end"},
      {"kafka", "unknown back-end"},
      {"kafka:", "empty broker address"},
      {"kafka:topic-prefix=x", "no broker address"},
      {"kafka:a:1,,b:2", "empty broker address"},
      {"kafka:a:1,acks=all", "unknown option \"acks=all\""},
      {"kafka:a:1,topic-prefix=x,topic-prefix=y", "topic-prefix given twice"},
      {"kafka:a 1", "holds a blank"},
  };
  for (const auto& [text, why] : bad) {
    std::string error;
    EXPECT_FALSE(ParseBackendSpec(text, &error)) << text;
    EXPECT_NE(error.find(std::string("\"") + text + "\""), std::string::npos) << error;
    EXPECT_NE(error.find(why), std::string::npos) << error;
  }
}

TEST(ParseBackendSpecs, DefaultIsSqliteAndCombinationsAreChecked) {
  std::string error;
  auto choices = ParseBackendSpecs({}, &error);
  ASSERT_TRUE(choices);
  ASSERT_EQ(choices->size(), 1u);
  EXPECT_EQ((*choices)[0].kind, BackendSpec::Kind::kSqlite);

  choices = ParseBackendSpecs({"none"}, &error);
  ASSERT_TRUE(choices);
  EXPECT_TRUE(choices->empty());

  choices = ParseBackendSpecs({"sqlite", "kafka:a:1", "kafka:b:1,topic-prefix=x"}, &error);
  ASSERT_TRUE(choices);
  EXPECT_EQ(choices->size(), 3u);

  EXPECT_FALSE(ParseBackendSpecs({"none", "sqlite"}, &error));
  EXPECT_NE(error.find("cannot be combined"), std::string::npos) << error;
  EXPECT_FALSE(ParseBackendSpecs({"sqlite", "sqlite"}, &error));
  EXPECT_NE(error.find("given twice"), std::string::npos) << error;
  EXPECT_FALSE(ParseBackendSpecs({"kafka:a:1", "kafka:a:1,topic-prefix=y"}, &error));
  EXPECT_NE(error.find("given twice"), std::string::npos) << error;
  EXPECT_FALSE(ParseBackendSpecs({"sqlite", "bogus"}, &error));
  EXPECT_NE(error.find("\"bogus\""), std::string::npos) << error;
}

// ---- The service over real back-ends
// -------------------------------------------------------------

class ReportingBackendsTest : public ::testing::Test {
 protected:
  std::unique_ptr<BackendReportingService> MakeService(std::vector<ReportingBackendPtr> backends) {
    return std::make_unique<BackendReportingService>(std::move(backends), clock_, random_);
  }
  std::unique_ptr<BackendReportingService> MakeSqliteService() {
    BackendEnvironment environment;
    environment.stateDirectory = dir_.path().string();
    environment.clock = &clock_;
    std::string error;
    return MakeService(CreateBackends(*ParseBackendSpecs({}, &error), environment));
  }
  std::unique_ptr<SqliteStore> BrokenStore() {
    WriteBytes(dir_.path() / "file", "x");
    SqliteStoreOptions options;
    options.stateDirectory = (dir_.path() / "file" / "state").string();
    options.clock = &clock_;
    return std::make_unique<SqliteStore>(options);
  }
  std::unique_ptr<SqliteStore> Store(const std::string& subdirectory) {
    SqliteStoreOptions options;
    options.stateDirectory = (dir_.path() / subdirectory).string();
    options.clock = &clock_;
    return std::make_unique<SqliteStore>(options);
  }
  std::filesystem::path DbPath() const { return dir_.path() / "tavrin.db"; }
  double Now() const { return SecondsSinceEpoch(clock_.WallNow()); }

  static BackendList Discover(TelvoroSession& session, std::thread::id* thread = nullptr) {
    std::promise<std::pair<BackendList, std::thread::id>> answered;
    session.StartConfiguration([&](const BackendList& list) {
      answered.set_value({list, std::this_thread::get_id()});
    });
    auto future = answered.get_future();
    if (future.wait_for(testing::kAnswerTimeout) != std::future_status::ready) {
      ADD_FAILURE() << "no discovery answer";
      return std::nullopt;
    }
    auto [list, answeredOn] = future.get();
    if (thread) *thread = answeredOn;
    return list;
  }
  static testing::FlushAnswer Flush(TelvoroSession& session, std::function<void()> inside = {}) {
    std::promise<OptionalError> answered;
    int calls = 0;
    session.FlushMessages([&](const OptionalError& error) {
      if (++calls > 1) ADD_FAILURE() << "flush answered twice";
      if (inside) inside();
      answered.set_value(error);
    });
    auto future = answered.get_future();
    if (future.wait_for(testing::kAnswerTimeout) != std::future_status::ready) {
      ADD_FAILURE() << "no flush answer";
      return {};
    }
    return {true, future.get()};
  }
  Dictionary SessionInfo(int64_t reporter) {
    return {{kTelvoroSessionInfoClientType, 19},
            {kTelvoroSessionInfoClientVersion, 2.0},
            {kTelvoroSessionInfoSessionID, reporter},
            {kTelvoroSessionInfoBatchEvent, true},
            {kTelvoroSessionInfoHierarchyToken, 1234567890123ull},
            {kTelvoroSessionInfoContainsRealtimeEvents, false}};
  }

  FakeLogSystem logs_;
  FakeClock clock_;
  FakeRandom random_;
  TempDir dir_;
};

TEST_F(ReportingBackendsTest, SessionRowsMessagesAndFlushTimeLandInTheStore) {
  auto service = MakeSqliteService();
  const Dictionary user = {{"ClientName", "com.quorvex.tavrin"},
                           {"ServiceName", "telephony_session"}};
  const double created = Now();
  auto session = service->CreateTelvoroSession(SessionInfo(77), user, {});
  ASSERT_NE(session, nullptr);
  EXPECT_EQ(session->Description(), "<TelvoroSession row 1 reporter 77>");

  Error error;
  clock_.Advance(std::chrono::milliseconds(250));
  const double sent = Now();
  ASSERT_TRUE(session->SendSessionMessage(2, 7, {{"engine_on_time", 1}}, &error));
  ASSERT_TRUE(session->SendSessionMessage(0xFFFF, 0xFFFF, {{"summary", {1, 2}}}, &error));
  clock_.Advance(std::chrono::seconds(3));
  const double flushed = Now();

  Rows inside;
  const auto answer = Flush(*session, [&] {
    Reader reader(DbPath());
    inside = reader.Rows("SELECT session_row, reporter_id, category, type FROM session_messages");
  });
  ASSERT_TRUE(answer.answered);
  EXPECT_FALSE(answer.error);
  EXPECT_EQ(inside, (Rows{{"1", "77", "2", "7"}, {"1", "77", "65535", "65535"}}))
      << "the flush answers after the rows are visible";

  Reader reader(DbPath());
  const Rows sessions = reader.Rows(
      "SELECT row, reporter_id, session_info, user_info, created_at, flushed_at FROM sessions");
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0][0], "1");
  EXPECT_EQ(sessions[0][1], "77");
  EXPECT_EQ(Dictionary::parse(sessions[0][2]), SessionInfo(77));
  EXPECT_EQ(Dictionary::parse(sessions[0][3]), user);
  EXPECT_DOUBLE_EQ(std::stod(sessions[0][4]), created);
  EXPECT_DOUBLE_EQ(std::stod(sessions[0][5]), flushed);
  EXPECT_EQ(
      reader.Number(fmt::format(
          "SELECT COUNT(*) FROM session_messages WHERE abs(received_at - {:.17g}) < 1e-6", sent)),
      2);
}

// A back-end whose queue depth the test sets.
class BacklogBackend final : public ReportingBackend {
 public:
  BacklogBackend(std::atomic<size_t>& backlog, size_t capacity)
      : backlog_(backlog), capacity_(capacity) {}
  std::string Name() const override { return "backlog"; }
  bool IsUp() const override { return true; }
  bool Append(ReportRecordPtr) override { return true; }
  void Flush(FlushCallback done) override { done(std::nullopt); }
  BackendStats Stats() const override { return {}; }
  void Shutdown() override {}
  size_t Backlog() const override { return backlog_.load(); }
  size_t BacklogCapacity() const override { return capacity_; }

 private:
  std::atomic<size_t>& backlog_;
  const size_t capacity_;
};

TEST_F(ReportingBackendsTest, CongestedFromHalfOfAnyBoundedQueue) {
  std::atomic<size_t> bounded{0};
  std::atomic<size_t> unbounded{1000000};
  std::vector<ReportingBackendPtr> backends;
  backends.push_back(std::make_unique<BacklogBackend>(unbounded, 0));
  backends.push_back(std::make_unique<BacklogBackend>(bounded, 100));
  auto service = MakeService(std::move(backends));
  EXPECT_FALSE(service->Congested()) << "a back-end without a bounded queue never congests";
  bounded = 49;
  EXPECT_FALSE(service->Congested());
  bounded = 50;
  EXPECT_TRUE(service->Congested());
  bounded = 0;
  EXPECT_FALSE(service->Congested());
}

TEST_F(ReportingBackendsTest, DiscoveryLeavesOutADownBackendAndAnswersNothingWhenNoneIsUp) {
  {
    std::vector<ReportingBackendPtr> backends;
    backends.push_back(BrokenStore());
    backends.push_back(Store("good"));
    auto service = MakeService(std::move(backends));
    auto session = service->CreateTelvoroSession(SessionInfo(5), {}, {});
    EXPECT_EQ(Discover(*session), BackendList(std::vector<std::string>{
                                      "sqlite:" + (dir_.path() / "good" / "tavrin.db").string()}));
    // Messages still reach the good store; the flush reports the down one.
    Error error;
    EXPECT_TRUE(session->SendSessionMessage(1, 1, {{"k", 1}}, &error));
    const auto answer = Flush(*session);
    ASSERT_TRUE(answer.error);
    EXPECT_NE(answer.error->description.find("not up"), std::string::npos);
    Reader reader(dir_.path() / "good" / "tavrin.db");
    EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM session_messages"), 1);
  }
  {
    std::vector<ReportingBackendPtr> backends;
    backends.push_back(BrokenStore());
    auto service = MakeService(std::move(backends));
    auto session = service->CreateTelvoroSession(SessionInfo(6), {}, {});
    EXPECT_EQ(Discover(*session), std::nullopt);
    Error error;
    EXPECT_FALSE(session->SendSessionMessage(1, 1, {{"k", 1}}, &error));
    EXPECT_EQ(error.domain, kGeneralErrorDomain);
    EXPECT_NE(error.description.find("none of the 1 reporting back-end(s)"), std::string::npos);
    EXPECT_FALSE(service->SendOneMessage({}, {}, 1, 1, {}, &error));
    EXPECT_EQ(service->Status()[0].stats.dropped, 3u) << "session row, message, single message";
  }
  {
    auto service = MakeService({});  // --backend none
    auto session = service->CreateTelvoroSession(SessionInfo(7), {}, {});
    EXPECT_EQ(Discover(*session), std::nullopt);
    Error error;
    EXPECT_FALSE(session->SendSessionMessage(1, 1, {}, &error));
    EXPECT_EQ(error.description, "no reporting back-end is configured");
    EXPECT_FALSE(Flush(*session).error);
  }
}

TEST_F(ReportingBackendsTest, SingleMessagesAndPowerEventsAreRecorded) {
  auto service = MakeSqliteService();
  const Dictionary info = {{"ClientType", 19}, {"ClientVersion", 2.0}, {"SessionID", -1}};
  const Dictionary user = {{"ClientName", "com.quorvex.tavrin"}, {"ServiceName", "alarms"}};
  Error error;
  ASSERT_TRUE(service->SendOneMessage(info, user, 3, 4, {{"a b", 1}}, &error));
  const Dictionary extra = {{"ignored", true}};
  service->LogRegisteredEvent(28, "Mediane_Haptics", {{"EngineOnDuration", 9}}, &extra);
  service->Shutdown();

  Reader reader(DbPath());
  EXPECT_EQ(reader.Rows("SELECT session_info, user_info, category, type, payload FROM "
                        "single_messages"),
            (Rows{{JsonText(info), JsonText(user), "3", "4", R"({"a b":1})"}}));
  EXPECT_EQ(
      reader.Rows("SELECT agent, name, payload, received_at FROM power_events"),
      (Rows{{"28", "Mediane_Haptics", R"({"EngineOnDuration":9})", fmt::format("{:.1f}", Now())}}));
}

TEST_F(ReportingBackendsTest, AnalyticsPolicyDecidesWhetherThePayloadIsEvenBuilt) {
  auto service = MakeSqliteService();
  int built = 0;
  const auto send = [&](const std::string& name) {
    service->SendEventLazy(name, [&, name] {
      ++built;
      return Dictionary{{"for", name}};
    });
  };
  send("com.quorvex.tavrin.DSP.Start");  // default: every event
  service->SetAnalyticsPolicy(false, std::nullopt);
  send("com.quorvex.tavrin.DSP.Stop");
  service->SetAnalyticsPolicy(
      true, std::vector<std::string>{"com.quorvex.tavrin.HAL", "com.quorvex.tavrin.ruvo"});
  send("com.quorvex.tavrin.DSP.Stop");
  send("com.quorvex.tavrin.HAL.Error");
  send("com.quorvex.tavrin.ruvoreportingclientuptime");
  service->SetAnalyticsPolicy(true, std::vector<std::string>{});
  send("com.quorvex.tavrin.HAL.Error");
  EXPECT_EQ(built, 3);
  EXPECT_EQ(service->AnalyticsFiltered(), 3u);
  service->Shutdown();

  Reader reader(DbPath());
  EXPECT_EQ(reader.Rows("SELECT name, payload FROM analytics_events ORDER BY row"),
            (Rows{{"com.quorvex.tavrin.DSP.Start", R"({"for":"com.quorvex.tavrin.DSP.Start"})"},
                  {"com.quorvex.tavrin.HAL.Error", R"({"for":"com.quorvex.tavrin.HAL.Error"})"},
                  {"com.quorvex.tavrin.ruvoreportingclientuptime",
                   R"({"for":"com.quorvex.tavrin.ruvoreportingclientuptime"})"}}));
}

TEST_F(ReportingBackendsTest, SessionsOnSeveralThreadsGetDistinctRowsAndLoseNoMessage) {
  auto service = MakeSqliteService();
  constexpr int kThreads = 4;
  constexpr int kMessages = 500;
  std::vector<std::thread> threads;
  std::vector<std::string> descriptions(kThreads);
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      auto session = service->CreateTelvoroSession(SessionInfo(100 + t), {}, {});
      descriptions[t] = session->Description();
      Error error;
      for (int i = 0; i < kMessages; ++i) {
        EXPECT_TRUE(session->SendSessionMessage(1, 1, {{"i", i}}, &error));
      }
      EXPECT_FALSE(Flush(*session).error);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(std::set<std::string>(descriptions.begin(), descriptions.end()).size(),
            size_t(kThreads));
  Reader reader(DbPath());
  EXPECT_EQ(reader.Number("SELECT COUNT(DISTINCT row) FROM sessions"), kThreads);
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM session_messages"), kThreads * kMessages);
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM session_messages m JOIN sessions s ON "
                          "m.session_row = s.row AND m.reporter_id = s.reporter_id"),
            kThreads * kMessages);
}

// Both back-ends at once, Kafka on librdkafka's in-process mock cluster.
TEST_F(ReportingBackendsTest, FlushAnswersAfterTheStoreCommittedAndKafkaAcknowledged) {
  char error[512];
  rd_kafka_conf_t* conf = rd_kafka_conf_new();
  rd_kafka_conf_set(conf, "log_level", "3", error, sizeof error);
  rd_kafka_t* host = rd_kafka_new(RD_KAFKA_PRODUCER, conf, error, sizeof error);
  ASSERT_NE(host, nullptr) << error;
  rd_kafka_mock_cluster_t* cluster = rd_kafka_mock_cluster_new(host, 1);
  ASSERT_NE(cluster, nullptr);
  {
    BackendEnvironment environment;
    environment.stateDirectory = dir_.path().string();
    environment.clock = &clock_;
    std::string parseError;
    const auto choices = ParseBackendSpecs(
        {"sqlite",
         std::string("kafka:") + rd_kafka_mock_cluster_bootstraps(cluster) + ",topic-prefix=both."},
        &parseError);
    ASSERT_TRUE(choices) << parseError;
    auto service = MakeService(CreateBackends(*choices, environment));
    auto session = service->CreateTelvoroSession(SessionInfo(9), {}, {});
    const BackendList list = Discover(*session);
    ASSERT_TRUE(list);
    EXPECT_EQ(list->size(), 2u);
    EXPECT_EQ((*list)[1], std::string("kafka:") + rd_kafka_mock_cluster_bootstraps(cluster));

    Error sendError;
    for (int i = 0; i < 50; ++i) {
      ASSERT_TRUE(session->SendSessionMessage(1, 2, {{"i", i}}, &sendError));
    }
    std::vector<BackendStatus> inside;
    const auto answer = Flush(*session, [&] { inside = service->Status(); });
    ASSERT_TRUE(answer.answered);
    EXPECT_FALSE(answer.error);
    ASSERT_EQ(inside.size(), 2u);
    // 50 messages, the session row, and the row again with its flush time.
    EXPECT_EQ(inside[0].stats.committed, 52u) << inside[0].name;
    EXPECT_EQ(inside[1].stats.committed, 52u) << inside[1].name;
  }
  rd_kafka_mock_cluster_destroy(cluster);
  rd_kafka_destroy(host);
}

}  // namespace
}  // namespace tavrin
