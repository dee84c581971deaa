#include "platform/linux/reporting/ReportingBackends.h"

#include <librdkafka/rdkafka.h>
#include <librdkafka/rdkafka_mock.h>

#include <sqlite3.h>

#include <algorithm>
#include <future>
#include <thread>

#include <gtest/gtest.h>

#include "platform/linux/kafka/KafkaBackend.h"
#include "platform/linux/store/SqliteStore.h"
#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/fakes/FakeRandomSource.h"
#include "tests/unit/linux/LinuxTestSupport.h"
#include "tests/unit/linux/reporting/LibrdkafkaTsanSupport.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::ReadBytes;
using testing::WriteBytes;
using Lines = std::vector<std::string>;

// A second connection to a store file, as tavrinctl or sqlite3 would open it.
class Reader {
 public:
  explicit Reader(const std::string& path) {
    EXPECT_EQ(sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
    sqlite3_busy_timeout(db_, 5000);
  }
  ~Reader() { sqlite3_close_v2(db_); }
  // Every row of `sql` as one line, columns (NULL as "NULL") separated by "|".
  Lines Query(const std::string& sql) {
    Lines lines;
    sqlite3_stmt* statement = nullptr;
    EXPECT_EQ(sqlite3_prepare_v2(db_, sql.c_str(), -1, &statement, nullptr), SQLITE_OK) << sql;
    while (statement && sqlite3_step(statement) == SQLITE_ROW) {
      lines.emplace_back();
      for (int i = 0; i < sqlite3_column_count(statement); ++i) {
        const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement, i));
        lines.back() += (i ? "|" : "") + std::string(text ? text : "NULL");
      }
    }
    sqlite3_finalize(statement);
    return lines;
  }
  std::string Row(const std::string& sql) { return Query(sql).at(0); }
  int64_t Number(const std::string& sql) { return std::stoll(Row(sql)); }
  int Exec(const std::string& sql) {
    return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr);
  }

 private:
  sqlite3* db_ = nullptr;
};

// Asks a back-end or a session for a flush and waits: "" when it answers success, otherwise what
// went wrong; then the text of `inside`, run within the answer.
template <typename Target>
std::string FlushAnswer(
    Target& target, std::function<std::string()> inside = [] { return ""; }) {
  auto promise = std::make_shared<std::promise<std::string>>();
  auto future = promise->get_future();
  auto answer = [promise, inside](const OptionalError& error) {
    promise->set_value((error ? "error: " + error->description : "") + inside());
  };
  if constexpr (std::is_base_of_v<TelvoroSession, Target>) {
    target.FlushMessages(answer);
  } else {
    target.Flush(answer);
  }
  if (future.wait_for(testing::kWaitLimit) != std::future_status::ready) return "no answer";
  return future.get();
}

template <typename R>
ReportRecordPtr Record(R record) {
  return std::make_shared<const ReportRecord>(std::move(record));
}
PayloadPtr Shared(Dictionary payload) {
  return std::make_shared<const Dictionary>(std::move(payload));
}
ReportRecordPtr Event(const std::string& name, Dictionary payload = Dictionary::object()) {
  return Record(AnalyticsEventRecord{name, std::move(payload), 1.5});
}
ReportRecordPtr Event(int i) { return Event("e", {{"i", i}}); }

// Each case is "VALUES => EXPECTED": a value (or several, separated by blanks) and "sqlite",
// "none", "kafka BOOTSTRAP PREFIX", the number of back-ends, or a piece of the error naming it.
TEST(ParseBackendSpecTest, TheThreeKindsTheirCombinationsAndBadValuesWithTheirReason) {
  for (std::string_view c :
       {"sqlite => sqlite", "none => none", "kafka:b:9092 => kafka b:9092 ",
        "kafka:a:9092,b:9093,topic-prefix=fleet. => kafka a:9092,b:9093 fleet.",
        "kafka:topic-prefix=p,a:1 => kafka a:1 p", "SQLite => \"SQLite\": unknown back-end",
        "kafka: => \"kafka:\": empty broker address", "kafka:topic-prefix=x => no broker address",
        "kafka:a:1,,b:2 => empty broker address", "kafka:a:1,acks=all => unknown option",
        "kafka:a:1,topic-prefix=x,topic-prefix=y => topic-prefix given twice",
        "kafka:a 1 => holds a blank"}) {
    std::string error;
    const auto choice = ParseBackendSpec(c.substr(0, c.find(" => ")), &error);
    const std::string parsed =
        !choice ? error
        : choice->kind == BackendSpec::Kind::kKafka
            ? "kafka " + choice->bootstrap + " " + choice->topicPrefix
            : (choice->kind == BackendSpec::Kind::kSqlite ? "sqlite" : "none");
    EXPECT_NE(parsed.find(c.substr(c.find(" => ") + 4)), std::string::npos) << c << ": " << parsed;
  }
  // No value means sqlite; none stands alone; sqlite and each broker list come once.
  const std::pair<std::vector<std::string>, std::string> sets[] = {
      {{}, "1"},
      {{"sqlite", "kafka:a:1", "kafka:b:1,topic-prefix=x"}, "3"},
      {{"none", "sqlite"}, "cannot be combined"},
      {{"sqlite", "sqlite"}, "given twice"},
      {{"kafka:a:1", "kafka:a:1,topic-prefix=y"}, "given twice"}};
  for (const auto& [texts, expected] : sets) {
    std::string error;
    const auto values = ParseBackendSpecs(texts, &error);
    EXPECT_NE((values ? std::to_string(values->size()) : error).find(expected), std::string::npos)
        << expected << ": " << error;
  }
}

// The store in a temporary directory; Kafka is librdkafka's own mock cluster, in process: one
// broker, shared by the tests because taking one down costs a second. Changing the cluster can take
// a second too, so topics are made on first use and each test has a topic prefix of its own.
class ReportingBackendsTest : public ::testing::Test {
 protected:
  static constexpr int kPartitions = 4;  // the mock cluster's default for new topics

  static void SetUpTestSuite() {
    rd_kafka_conf_t* conf = rd_kafka_conf_new();
    rd_kafka_conf_set(conf, "log_level", "3", nullptr, 0);
    host_ = rd_kafka_new(RD_KAFKA_PRODUCER, conf, nullptr, 0);
    cluster_ = rd_kafka_mock_cluster_new(host_, 1);
  }
  static void TearDownTestSuite() {
    rd_kafka_mock_cluster_destroy(cluster_);
    rd_kafka_destroy(host_);
  }
  void TearDown() override { SetBroker(true); }
  void SetBroker(bool up) {
    auto set = up ? rd_kafka_mock_broker_set_up : rd_kafka_mock_broker_set_down;
    ASSERT_EQ(set(cluster_, 1), RD_KAFKA_RESP_ERR_NO_ERROR);
  }
  SqliteStoreOptions StoreOptions() {
    SqliteStoreOptions options;
    options.stateDirectory = dir_.path();
    options.clock = &clock_;
    return options;
  }
  static std::string Bootstrap() { return rd_kafka_mock_cluster_bootstraps(cluster_); }
  KafkaBackendOptions KafkaOptions() {
    static int tests = 0;
    KafkaBackendOptions options;
    options.bootstrap = Bootstrap();
    options.topicPrefix = "t" + std::to_string(++tests) + ".";
    options.clock = &clock_;
    options.messageTimeout = 20s;
    options.shutdownTimeout = 2s;
    // Reconnect quickly once the broker is back, so the tests take seconds.
    options.extraConfig = {{"reconnect.backoff.ms", "20"}, {"reconnect.backoff.max.ms", "100"}};
    return options;
  }
  // "key value" of each record of `topic` (key "-" when none), from its start, until `count`
  // arrived or the time-out.
  static std::vector<std::string> Consume(const std::string& topic, size_t count) {
    rd_kafka_conf_t* conf = rd_kafka_conf_new();
    rd_kafka_conf_set(conf, "group.id", "test", nullptr, 0);
    rd_kafka_conf_set(conf, "log_level", "3", nullptr, 0);
    rd_kafka_conf_set(conf, "bootstrap.servers", Bootstrap().c_str(), nullptr, 0);
    rd_kafka_t* consumer = rd_kafka_new(RD_KAFKA_CONSUMER, conf, nullptr, 0);
    auto* partitions = rd_kafka_topic_partition_list_new(kPartitions);
    for (int p = 0; p < kPartitions; ++p) {
      rd_kafka_topic_partition_list_add(partitions, topic.c_str(), p)->offset =
          RD_KAFKA_OFFSET_BEGINNING;
    }
    rd_kafka_assign(consumer, partitions);
    rd_kafka_topic_partition_list_destroy(partitions);
    std::vector<std::string> got;
    for (auto end = std::chrono::steady_clock::now() + testing::kWaitLimit;
         got.size() < count && std::chrono::steady_clock::now() < end;) {
      rd_kafka_message_t* message = rd_kafka_consumer_poll(consumer, 100);
      if (message && !message->err) {
        const auto* key = static_cast<const char*>(message->key);
        got.push_back((key ? std::string(key, message->key_len) : "-") + " " +
                      std::string(static_cast<const char*>(message->payload), message->len));
      }
      if (message) rd_kafka_message_destroy(message);
    }
    rd_kafka_consumer_close(consumer);
    rd_kafka_destroy(consumer);
    return got;
  }
  std::unique_ptr<BackendReportingService> Service(const std::vector<std::string>& values,
                                                   bool brokenStoreFirst = false) {
    BackendEnvironment environment;
    environment.stateDirectory = dir_.path();
    environment.clock = &clock_;
    std::string error;
    auto backends = CreateBackends(*ParseBackendSpecs(values, &error), environment);
    if (brokenStoreFirst) {  // a store whose state directory cannot be made: never up
      testing::WriteBytes(dir_ / "file", "x");
      environment.stateDirectory = dir_ / "file/state";
      backends.insert(backends.begin(), std::move(CreateBackends({{}}, environment)[0]));
    }
    return std::make_unique<BackendReportingService>(std::move(backends), clock_, random_);
  }
  static BackendList Discover(TelvoroSession& session) {
    std::promise<BackendList> answered;
    session.StartConfiguration([&](const BackendList& list) { answered.set_value(list); });
    auto future = answered.get_future();
    EXPECT_EQ(future.wait_for(testing::kWaitLimit), std::future_status::ready);
    return future.get();
  }
  std::string Now() const { return fmt::format("{:.2f}", SecondsSinceEpoch(clock_.WallNow())); }

  static inline rd_kafka_t* host_ = nullptr;
  static inline rd_kafka_mock_cluster_t* cluster_ = nullptr;
  testing::FakeLogSystem logs_;
  testing::FakeClock clock_;
  testing::FakeRandom random_;
  testing::TempDir dir_;
  const std::string db_ = dir_ / "tavrin.db";
  const Dictionary info_ = {{kTelvoroSessionInfoSessionID, 77}};
  Error error_;
};

// ---- The SQLite store ------------------------------------------------------------------------

// The tables are a contract (columns may be added, never changed). A session row handed over
// again with its flush time is updated, not added.
TEST_F(ReportingBackendsTest, StoreEachRecordLandsInTheColumnsOfItsTable) {
  SqliteStore store(StoreOptions());
  const Dictionary big = {{"t", 1ull << 63}}, json = {{"k", {1, "v"}}};
  for (const auto& record :
       {Record(SessionRecord{7, 42, big, json, 1000.25, std::nullopt, true}),
        Record(SessionRecord{7, 42, big, json, 1000.25, 1010.5, true}),
        Record(SessionMessageRecord{7, 42, 0xFFFF, 3, Shared(json), 1001.5}),
        Record(SessionMessageRecord{8, std::nullopt, 1, 1, Shared(json), 1005}),
        Record(SingleMessageRecord{big, json, 2, 1, json, 1002.75}), Event("Session.Start", json),
        Record(PowerEventRecord{28, "Mediane_Haptics", json, 1004.5})}) {
    ASSERT_TRUE(store.Append(record));
  }
  ASSERT_EQ(FlushAnswer(store), "");
  Reader reader(db_);
  EXPECT_EQ(reader.Query("PRAGMA journal_mode"), Lines{"wal"});
  EXPECT_EQ(reader.Query("SELECT m.name, group_concat(p.name || ' ' || p.type, ', ') FROM "
                         "sqlite_master m, pragma_table_info(m.name) p GROUP BY m.name"),
            (Lines{"analytics_events|row INTEGER, name TEXT, payload TEXT, received_at REAL",
                   "power_events|row INTEGER, agent INTEGER, name TEXT, payload TEXT, received_at "
                   "REAL",
                   "session_messages|row INTEGER, session_row INTEGER, reporter_id INTEGER, "
                   "category INTEGER, type INTEGER, payload TEXT, received_at REAL",
                   "sessions|row INTEGER, reporter_id INTEGER, session_info TEXT, user_info TEXT, "
                   "created_at REAL, flushed_at REAL, recovered INTEGER",
                   "single_messages|row INTEGER, session_info TEXT, user_info TEXT, category "
                   "INTEGER, type INTEGER, payload TEXT, received_at REAL"}));
  // Dictionaries as compact JSON text, the 64-bit value unchanged.
  const std::string b = JsonText(big), j = JsonText(json);
  EXPECT_EQ(reader.Query("SELECT * FROM sessions"),
            Lines{"7|42|" + b + "|" + j + "|1000.25|1010.5|1"});
  EXPECT_EQ(reader.Query("SELECT * FROM session_messages"),
            (Lines{"1|7|42|65535|3|" + j + "|1001.5", "2|8|NULL|1|1|" + j + "|1005.0"}));
  EXPECT_EQ(reader.Query("SELECT * FROM single_messages"),
            Lines{"1|" + b + "|" + j + "|2|1|" + j + "|1002.75"});
  EXPECT_EQ(reader.Query("SELECT * FROM analytics_events"), Lines{"1|Session.Start|" + j + "|1.5"});
  EXPECT_EQ(reader.Query("SELECT * FROM power_events"),
            Lines{"1|28|Mediane_Haptics|" + j + "|1004.5"});
}

// The flush answers from the writer once every producer's records, in order, are visible to
// another connection.
TEST_F(ReportingBackendsTest,
       StoreConcurrentProducersBelowTheBoundLoseNothingAndTheFlushSeesThemAll) {
  SqliteStore store(StoreOptions());
  std::vector<std::thread> producers;
  for (int t = 0; t < 4; ++t) {
    producers.emplace_back([&, t] {
      for (int i = 0; i < 5000; ++i) {
        EXPECT_TRUE(store.Append(Event("p", {{"t", t}, {"i", i}})));
        if (i % 3 == 0) {
          EXPECT_TRUE(
              store.Append(Record(SessionMessageRecord{t, t, 1, 2, Shared({{"i", i}}), 1})));
        }
      }
    });
  }
  for (auto& producer : producers) producer.join();
  // Per table, the count and the steps of each producer's numbers in row order that are not the
  // producer's step: rows are written many to a statement and must keep their order.
  const std::string steps =
      "SELECT COUNT(DISTINCT payload), SUM(step != 1) FROM (SELECT payload, payload->>'i' - "
      "LAG(payload->>'i') OVER (PARTITION BY payload->>'t' ORDER BY row) AS step FROM "
      "analytics_events)";
  const std::string messageSteps =
      "SELECT COUNT(*), SUM(step != 3) FROM (SELECT payload->>'i' - LAG(payload->>'i') OVER "
      "(PARTITION BY reporter_id ORDER BY row) AS step FROM session_messages)";
  EXPECT_EQ(FlushAnswer(store,
                        [&] {
                          Reader reader(db_);
                          return testing::ThreadName() + "|" + reader.Row(steps) + "|" +
                                 reader.Row(messageSteps);
                        }),
            "tavrin-store|20000|0|6668|0");
}

// Another process holding the write lock past the busy timeout (tavrinctl, sqlite3) delays the
// batch without dropping it; meanwhile the queue fills, and only what finds it full is dropped.
TEST_F(ReportingBackendsTest,
       StoreWriteLockHeldElsewhereDelaysTheBatchAndAFullQueueDropsCountedAndLogged) {
  SqliteStoreOptions options = StoreOptions();
  options.queueCapacity = 16;
  options.busyTimeout = 20ms;
  SqliteStore store(options);
  Reader blocker(db_);
  ASSERT_EQ(blocker.Exec("BEGIN IMMEDIATE"), SQLITE_OK);
  ASSERT_TRUE(store.Append(Event("first")));
  std::this_thread::sleep_for(50ms);  // lets the writer take it and wait
  int accepted = 1, handed = 1;
  for (; handed <= 200; ++handed) accepted += store.Append(Event("e"));
  EXPECT_GE(store.DroppedRecords(), 200u - 2 * options.queueCapacity);
  EXPECT_EQ(logs_.Count("queue is full (16 records)", LogLevel::kError), 1u);
  clock_.Advance(DropReporter::kDropLogInterval);  // drops that go on are reported again
  for (; handed <= 280; ++handed) accepted += store.Append(Event("late"));
  EXPECT_EQ(logs_.Count("dropped", LogLevel::kError), 2u);
  std::this_thread::sleep_for(100ms);  // several busy timeouts
  ASSERT_EQ(blocker.Exec("COMMIT"), SQLITE_OK);
  EXPECT_NE(FlushAnswer(store).find("dropped"), std::string::npos);
  EXPECT_EQ(blocker.Number("SELECT COUNT(*) FROM analytics_events"), accepted);
  EXPECT_EQ(store.DroppedRecords(), uint64_t(handed - accepted));
  ASSERT_TRUE(store.Append(Event("after")));
  EXPECT_EQ(FlushAnswer(store), "") << "the next flush covers no drop";
}

// Afterwards, hand-over is refused and counted and a flush answers at once with an error.
TEST_F(ReportingBackendsTest, StoreShutdownCommitsEverythingAcceptedAndAnswersPendingFlushes) {
  SqliteStore store(StoreOptions());
  for (int i = 0; i < 20000; ++i) ASSERT_TRUE(store.Append(Event("s")));
  std::vector<std::string> answers;
  store.Flush([&](const OptionalError& error) { answers.push_back(error ? "error" : "ok"); });
  store.Shutdown();
  EXPECT_EQ(Reader(db_).Number("SELECT COUNT(*) FROM analytics_events"), 20000);
  EXPECT_FALSE(store.Append(Event("late")));
  EXPECT_EQ(store.DroppedRecords(), 1u);
  store.Flush([&](const OptionalError& error) { answers.push_back(error ? "error" : "ok"); });
  EXPECT_EQ(answers, (std::vector<std::string>{"ok", "error"}));
}

// Never deleted or overwritten: moved aside with its -wal and -shm, and a fresh store starts.
TEST_F(ReportingBackendsTest, StoreFileThatIsNoDatabaseOrHasACorruptSchemaIsMovedAside) {
  const std::string moved = dir_ / "tavrin.db.corrupt-20261116T052745";  // the fake clock's start
  const std::string text(20000, 't');
  WriteBytes(db_, text);
  WriteBytes(db_ + "-wal", "old wal");
  WriteBytes(db_ + "-shm", "old shm");
  {
    SqliteStore store(StoreOptions());
    ASSERT_TRUE(store.Append(Event("fresh")));
    ASSERT_EQ(FlushAnswer(store), "");
  }
  EXPECT_EQ(ReadBytes(moved) + ReadBytes(moved + "-wal") + ReadBytes(moved + "-shm"),
            text + "old wal" + "old shm");
  EXPECT_EQ(logs_.Count("store " + db_ + " is not a database", LogLevel::kError), 1u);
  EXPECT_EQ(logs_.Count("moved it to " + moved + " and started a fresh store"), 1u);
  // A database whose schema page is scrambled (its header kept), with a -wal SQLite does not know.
  std::string bytes = ReadBytes(db_);
  for (size_t i = 100; i < 4096; ++i) bytes.at(i) = char(0xA5 ^ (i * 7));
  WriteBytes(db_, bytes);
  WriteBytes(db_ + "-wal", "stale wal");
  SqliteStore store(StoreOptions());
  EXPECT_TRUE(store.IsUp()) << store.DownReason();
  EXPECT_EQ(ReadBytes(moved + ".1") + ReadBytes(moved + ".1-wal"), bytes + "stale wal");
}

// Still failing, it counts its drops without a second line; when another process frees space,
// the next batch commits and the store is up again.
TEST_F(ReportingBackendsTest,
       StoreFullDiskDropsTheBatchTakesTheStoreDownAndItRecoversWhenSpaceFrees) {
  SqliteStoreOptions options = StoreOptions();
  options.maxPageCount = 40;  // a "disk" of 40 pages: a few hundred records
  SqliteStore store(options);
  const Dictionary filler = {{"f", std::string(1000, 'x')}};
  uint64_t handed = 0;
  for (int round = 0; round < 50 && store.IsUp(); ++round) {
    for (int i = 0; i < 20; ++i, ++handed) ASSERT_TRUE(store.Append(Event("fill", filler)));
    FlushAnswer(store);
  }
  ASSERT_FALSE(store.IsUp()) << "the page limit was never reached";
  EXPECT_NE(store.DownReason().find("full"), std::string::npos) << store.DownReason();
  Reader reader(db_);
  EXPECT_EQ(
      uint64_t(reader.Number("SELECT COUNT(*) FROM analytics_events")) + store.DroppedRecords(),
      handed);
  for (int i = 0; i < 20; ++i) ASSERT_TRUE(store.Append(Event("fill", filler)));
  EXPECT_NE(FlushAnswer(store), "");
  EXPECT_EQ(
      uint64_t(reader.Number("SELECT COUNT(*) FROM analytics_events")) + store.DroppedRecords(),
      handed + 20);
  EXPECT_EQ(logs_.Count("is not up", LogLevel::kError), 1u);
  ASSERT_EQ(reader.Exec("DELETE FROM analytics_events"), SQLITE_OK);
  ASSERT_TRUE(store.Append(Event("small")));
  EXPECT_EQ(FlushAnswer(store), "");
  EXPECT_TRUE(store.IsUp());
  EXPECT_EQ(logs_.Count("is written again"), 1u);
}

// ---- Kafka -----------------------------------------------------------------------------------

// Each record as JSON on its table's topic, sessions and their messages keyed by reporter; the
// flush answers from the poll thread once every earlier record is acknowledged.
TEST_F(ReportingBackendsTest, KafkaRecordsArriveAsJsonOnTheirTopicsAndTheFlushAnswersAfterTheAcks) {
  const KafkaBackendOptions options = KafkaOptions();
  KafkaProducerBackend backend(options);
  ASSERT_TRUE(backend.IsUp());
  EXPECT_EQ(backend.Name(), "kafka:" + options.bootstrap);
  const Dictionary info = {{"SessionID", -7}, {"HierarchyToken", 18446744073709551615ull}};
  const Dictionary payload = {{"list", {1, "two"}}};
  const std::pair<ReportRecord, std::string> records[] = {
      {SessionRecord{3, -7, info, {{"ClientName", "c"}}, 100.5, std::nullopt},
       R"(sessions -7 {"row":3,"reporter_id":-7,"session_info":{"SessionID":-7,"HierarchyToken":18446744073709551615},"user_info":{"ClientName":"c"},"created_at":100.5,"flushed_at":null,"recovered":false})"},
      {SessionMessageRecord{3, -7, 258, 9, Shared(payload), 101.25},
       R"(session_messages -7 {"session_row":3,"reporter_id":-7,"category":258,"type":9,"payload":{"list":[1,"two"]},"received_at":101.25})"},
      {SingleMessageRecord{{{"SessionID", -1}}, {{"ServiceName", "alarms"}}, 1, 2, payload, 102},
       R"(single_messages - {"session_info":{"SessionID":-1},"user_info":{"ServiceName":"alarms"},"category":1,"type":2,"payload":{"list":[1,"two"]},"received_at":102.0})"},
      {AnalyticsEventRecord{"com.quorvex.tavrin.DSP.Stop", payload, 2.5},
       R"(analytics_events - {"name":"com.quorvex.tavrin.DSP.Stop","payload":{"list":[1,"two"]},"received_at":2.5})"},
      {PowerEventRecord{28, "Mediane_Haptics", {{"EngineOnDuration", 3}}, 104},
       R"(power_events - {"agent":28,"name":"Mediane_Haptics","payload":{"EngineOnDuration":3},"received_at":104.0})"},
  };
  for (const auto& [record, json] : records) {
    ASSERT_TRUE(backend.Append(std::make_shared<const ReportRecord>(record)));
  }
  for (int i = 0; i < 300; ++i) ASSERT_TRUE(backend.Append(Event(i)));
  EXPECT_EQ(
      FlushAnswer(
          backend,
          [&] { return testing::ThreadName() + " " + std::to_string(backend.Stats().committed); }),
      "tavrin-kafka 305");
  for (const auto& [record, expected] : records) {
    const std::string table(RecordTable(record));
    const size_t count = table == "analytics_events" ? 301 : 1;
    const auto got = Consume(options.topicPrefix + table, count);
    EXPECT_EQ(got.size(), count) << table;
    EXPECT_EQ(std::count(got.begin(), got.end(), expected.substr(table.size() + 1)), 1) << expected;
  }
}

TEST_F(ReportingBackendsTest,
       KafkaRecordsWaitWhileTheBrokerIsDownRecordsWaitAndArriveWhenItReturns) {
  const KafkaBackendOptions options = KafkaOptions();
  KafkaProducerBackend backend(options);
  ASSERT_EQ(FlushAnswer(backend), "");  // connected
  SetBroker(false);
  for (int i = 0; i < 10; ++i) ASSERT_TRUE(backend.Append(Event(i)));
  auto answer = std::async(std::launch::async, [&] { return FlushAnswer(backend); });
  EXPECT_EQ(answer.wait_for(500ms), std::future_status::timeout) << "answered before the acks";
  EXPECT_TRUE(backend.IsUp()) << "unreachable brokers make records wait, not the back-end down";
  SetBroker(true);
  EXPECT_EQ(answer.get(), "");
  EXPECT_EQ(backend.Stats().committed, 10u);
}

// While the broker is down: what finds the queue full is dropped and counted (one line); what
// outlives its time is dropped and the next flush says so, once; Shutdown gives up on the rest
// after its bound and answers the waiting flush.
TEST_F(ReportingBackendsTest, KafkaDropsWhatFindsTheQueueFullOrOutlivesItsTimeAndStopsInBound) {
  KafkaBackendOptions options = KafkaOptions();
  options.maxQueuedMessages = 5;
  options.messageTimeout = options.shutdownTimeout = 300ms;
  KafkaProducerBackend backend(options);
  ASSERT_EQ(FlushAnswer(backend), "");
  SetBroker(false);
  int accepted = 0;
  for (int i = 0; i < 12; ++i) accepted += backend.Append(Event(i));
  EXPECT_EQ(accepted, 5);
  EXPECT_EQ(logs_.Count("producer queue is full (5 records)", LogLevel::kError), 1u);
  clock_.Advance(DropReporter::kDropLogInterval);  // the time-outs get a drop line of their own
  EXPECT_NE(FlushAnswer(backend).find("dropped 12 record(s)"), std::string::npos);
  EXPECT_EQ(backend.FailedDeliveries(), 5u);
  EXPECT_LE(logs_.Count("delivery failed", LogLevel::kError), 1u) << "one line for the burst";
  EXPECT_EQ(FlushAnswer(backend), "") << "the loss is reported once";
  ASSERT_TRUE(backend.Append(Event(0)));
  std::optional<OptionalError> pending;
  backend.Flush([&](const OptionalError& error) { pending = error; });
  const auto started = std::chrono::steady_clock::now();
  backend.Shutdown();
  EXPECT_LT(std::chrono::steady_clock::now() - started, 10s);
  EXPECT_TRUE(pending && *pending) << "the waiting flush is answered, with an error";
  EXPECT_FALSE(backend.IsUp());
  EXPECT_FALSE(backend.Append(Event(0)));
  EXPECT_EQ(backend.Stats().dropped, 14u);
}

// A record over the producer's message size (a summary event of a very long session can be) is
// refused whole and counted with its size; the records around it go on.
TEST_F(ReportingBackendsTest, KafkaRefusesARecordOverTheMessageSizeAndCountsIt) {
  KafkaProducerBackend backend(KafkaOptions());
  ASSERT_EQ(FlushAnswer(backend), "");
  EXPECT_FALSE(backend.Append(Event("summary", {{"texts", std::string(1'100'000, '1')}})));
  EXPECT_TRUE(backend.Append(Event(1)));
  EXPECT_EQ(backend.DroppedRecords(), 1u);
  EXPECT_EQ(logs_.Count("bytes is over message.max.bytes", LogLevel::kError), 1u);
  clock_.Advance(DropReporter::kDropLogInterval);
  EXPECT_NE(FlushAnswer(backend).find("dropped 1 record(s)"), std::string::npos);
  EXPECT_EQ(backend.Stats().committed, 1u);
}

TEST_F(ReportingBackendsTest, KafkaBadSettingLeavesTheBackendDownAndItStillAnswersFlushes) {
  KafkaBackendOptions options = KafkaOptions();
  options.extraConfig.push_back({"no.such.setting", "1"});
  KafkaProducerBackend backend(options);
  EXPECT_FALSE(backend.IsUp());
  EXPECT_EQ(logs_.Count("no.such.setting", LogLevel::kError), 1u);
  EXPECT_FALSE(backend.Append(Event(0)));
  EXPECT_EQ(backend.DroppedRecords(), 1u);
  EXPECT_NE(FlushAnswer(backend).find("not up"), std::string::npos);
}

// ---- The reporting service over the back-ends ---------------------------------------------------

// Rows are numbered on from the highest in the store; received times come from the clock; the
// flush stamps the time it was asked and answers once the rows are visible to another connection.
TEST_F(ReportingBackendsTest, SessionRowMessagesAndFlushTimeLandInTheStore) {
  auto service = Service({"sqlite"});
  auto earlier = service->CreateTelvoroSession(info_, {}, {});
  auto session = service->CreateTelvoroSession(info_, {{"ClientName", "c"}}, {});
  EXPECT_EQ(session->Description(), "<TelvoroSession row 2 reporter 77>");
  const std::string created = Now();
  clock_.Advance(std::chrono::milliseconds(250));
  ASSERT_TRUE(session->SendSessionMessage(0xFFFF, 7, Shared({{"summary", {1, 2}}}), &error_));
  const std::string sent = Now();
  clock_.Advance(std::chrono::seconds(3));
  const std::string message =
      "SELECT printf('%.2f', received_at), session_row, reporter_id, category, type, payload FROM "
      "session_messages";
  EXPECT_EQ(FlushAnswer(*session, [&] { return Reader(db_).Row(message); }),
            sent + R"(|2|77|65535|7|{"summary":[1,2]})");
  EXPECT_EQ(
      Reader(db_).Query("SELECT row, reporter_id, session_info, user_info, printf('%.2f', "
                        "created_at), printf('%.2f', flushed_at) FROM sessions WHERE row = 2"),
      Lines{"2|77|" + JsonText(info_) + R"(|{"ClientName":"c"}|)" + created + "|" + Now()});
  earlier.reset();
  session.reset();
  service = Service({"sqlite"});  // a restart
  EXPECT_EQ(service->CreateTelvoroSession(info_, {}, {})->Description(),
            "<TelvoroSession row 3 reporter 77>");
}

TEST_F(ReportingBackendsTest, DiscoveryLeavesOutADownBackendAndSendsFailOnlyWhenNoneIsUp) {
  auto service = Service({"sqlite"}, /*brokenStoreFirst=*/true);
  auto session = service->CreateTelvoroSession(info_, {}, {});
  EXPECT_EQ(Discover(*session), BackendList(std::vector<std::string>{"sqlite:" + db_}));
  EXPECT_TRUE(session->SendSessionMessage(1, 1, Shared({{"k", 1}}), &error_));
  EXPECT_NE(FlushAnswer(*session).find("not up"), std::string::npos)
      << "the flush reports the down one";
  EXPECT_EQ(Reader(db_).Number("SELECT COUNT(*) FROM session_messages"), 1);

  session.reset();
  service = Service({"none"}, /*brokenStoreFirst=*/true);
  session = service->CreateTelvoroSession(info_, {}, {});
  EXPECT_EQ(Discover(*session), std::nullopt);
  EXPECT_FALSE(session->SendSessionMessage(1, 1, Shared({{"k", 1}}), &error_));
  EXPECT_NE(error_.description.find("none of the 1 reporting back-end(s)"), std::string::npos);
  EXPECT_FALSE(service->SendOneMessage({}, {}, 1, 1, {}, &error_));
  EXPECT_EQ(service->Status()[0].stats.dropped, 3u) << "session row, message, single message";

  session.reset();
  service = Service({"none"});
  session = service->CreateTelvoroSession(info_, {}, {});
  EXPECT_EQ(Discover(*session), std::nullopt);
  EXPECT_FALSE(session->SendSessionMessage(1, 1, Shared(Dictionary()), &error_));
  EXPECT_EQ(error_.description, "no reporting back-end is configured");
  EXPECT_EQ(FlushAnswer(*session), "");
}

// An event the analytics policy turns away is not even built.
TEST_F(ReportingBackendsTest, SingleMessagesPowerEventsAndTheAnalyticsTheDefaultsLetIn) {
  auto service = Service({"sqlite"});
  ASSERT_TRUE(service->SendOneMessage(info_, {}, 3, 4, {{"a", 1}}, &error_));
  service->LogRegisteredEvent(28, "Mediane_Haptics", {{"EngineOnDuration", 9}}, nullptr);
  std::vector<std::string> built;
  auto send = [&](const std::string& name) {
    service->SendEventLazy(name, [&, name] { return built.push_back(name), Dictionary{}; });
  };
  send("DSP.Start");  // by default every event
  service->ApplyDefaults({{"analytics_enabled", false}});
  send("DSP.Stop");
  service->ApplyDefaults({{"analytics_event_prefixes", {"HAL", "ruvo"}}});
  for (auto name : {"DSP.Stop", "HAL.Error", "ruvouptime"}) send(name);
  service->ApplyDefaults({{"analytics_event_prefixes", Value::array()}});
  send("HAL.Error");
  service->ApplyDefaults({{"analytics_enabled", "no"}});  // logged, read as the default
  send("Last");
  EXPECT_EQ(built, (std::vector<std::string>{"DSP.Start", "HAL.Error", "ruvouptime", "Last"}));
  EXPECT_EQ(service->AnalyticsFiltered(), 3u);
  EXPECT_EQ(logs_.Count("analytics_enabled", LogLevel::kError), 1u);
  service->Shutdown();
  Reader reader(db_);
  EXPECT_EQ(reader.Query("SELECT category, type, payload, (SELECT name FROM power_events) FROM "
                         "single_messages"),
            Lines{R"(3|4|{"a":1}|Mediane_Haptics)"});
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM analytics_events"), 4);
}

// Both back-ends at once: the flush answers once the store committed and Kafka acknowledged.
TEST_F(ReportingBackendsTest, FlushAnswersAfterTheStoreCommittedAndKafkaAcknowledged) {
  const std::string kafka = "kafka:" + Bootstrap();
  auto service = Service({"sqlite", kafka + ",topic-prefix=both."});
  auto session = service->CreateTelvoroSession(info_, {}, {});
  EXPECT_EQ(Discover(*session), BackendList(std::vector<std::string>{"sqlite:" + db_, kafka}));
  for (int i = 0; i < 50; ++i) {
    ASSERT_TRUE(session->SendSessionMessage(1, 2, Shared({{"i", i}}), &error_));
  }
  // 50 messages, the session row, and the row again with its flush time.
  std::vector<BackendStatus> inside;
  EXPECT_EQ(FlushAnswer(*session, [&] { return inside = service->Status(), ""; }), "");
  ASSERT_EQ(inside.size(), 2u);
  EXPECT_EQ(inside[0].stats.committed, 52u) << inside[0].name;
  EXPECT_EQ(inside[1].stats.committed, 52u) << inside[1].name;
}

}  // namespace
}  // namespace tavrin
