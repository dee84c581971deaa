#include "platform/linux/store/SqliteStore.h"

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/backend/BackendTestSupport.h"

extern char** environ;

namespace tavrin {
namespace {

using testing::FakeClock;
using testing::FakeLogSystem;
using testing::FlushAndWait;
using testing::ReadBytes;
using testing::Reader;
using testing::TempDir;
using testing::WriteBytes;

ReportRecordPtr Analytics(const std::string& name, Dictionary payload, double at = 1.5) {
  return std::make_shared<const ReportRecord>(AnalyticsEventRecord{name, std::move(payload), at});
}

// "tavrin.db.corrupt-" and the fake clock's start, 2026-11-16 05:27:45 UTC.
constexpr const char* kCorruptName = "tavrin.db.corrupt-20261116T052745";

class SqliteStoreTest : public ::testing::Test {
 protected:
  SqliteStoreOptions Options() {
    SqliteStoreOptions options;
    options.stateDirectory = dir_.path().string();
    options.clock = &clock_;
    return options;
  }
  std::filesystem::path DbPath() const { return dir_.path() / "tavrin.db"; }

  FakeLogSystem logs_;
  FakeClock clock_;
  TempDir dir_;
};

std::vector<std::string> Columns(Reader& reader, const std::string& table) {
  std::vector<std::string> columns;
  for (const auto& row : reader.Rows("PRAGMA table_info(" + table + ")")) {
    columns.push_back(row[1] + " " + row[2]);
  }
  return columns;
}

TEST_F(SqliteStoreTest, RowsLandInTheDocumentedTablesAndColumns) {
  SqliteStore store(Options());
  ASSERT_TRUE(store.IsUp()) << store.DownReason();
  EXPECT_EQ(store.Name(), "sqlite:" + DbPath().string());

  const Dictionary info = {{"ClientType", 19}, {"SessionID", 42}, {"HierarchyToken", 1ull << 63}};
  const Dictionary user = {{"ClientName", "com.quorvex.tavrin"}, {"ServiceName", "x_session"}};
  const Dictionary payload = {{"engine on time", 4.5}, {"nested", {{"a", {1, 2}}}}};
  ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(
      SessionRecord{7, 42, info, user, 1000.25, std::nullopt})));
  ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(
      SessionMessageRecord{7, 42, 0xFFFF, 3, payload, 1001.5})));
  ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(
      SingleMessageRecord{{{"SessionID", -1}}, user, 2, 1, payload, 1002.75})));
  ASSERT_TRUE(store.Append(Analytics("com.quorvex.tavrin.Session.Start", payload, 1003.0)));
  ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(
      PowerEventRecord{28, "Mediane_Haptics", {{"EngineOnDuration", 12}}, 1004.5})));
  // A session message of a session whose info had no reporter ID.
  ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(
      SessionMessageRecord{8, std::nullopt, 1, 1, Dictionary::object(), 1005.0})));
  const auto answer = FlushAndWait(store);
  ASSERT_TRUE(answer.answered);
  EXPECT_FALSE(answer.error) << answer.error->description;

  Reader reader(DbPath());
  EXPECT_EQ(reader.Rows("PRAGMA journal_mode")[0][0], "wal");
  EXPECT_EQ(Columns(reader, "sessions"),
            (std::vector<std::string>{"row INTEGER", "reporter_id INTEGER", "session_info TEXT",
                                      "user_info TEXT", "created_at REAL", "flushed_at REAL"}));
  EXPECT_EQ(Columns(reader, "session_messages"),
            (std::vector<std::string>{"row INTEGER", "session_row INTEGER", "reporter_id INTEGER",
                                      "category INTEGER", "type INTEGER", "payload TEXT",
                                      "received_at REAL"}));
  EXPECT_EQ(Columns(reader, "single_messages"),
            (std::vector<std::string>{"row INTEGER", "session_info TEXT", "user_info TEXT",
                                      "category INTEGER", "type INTEGER", "payload TEXT",
                                      "received_at REAL"}));
  EXPECT_EQ(
      Columns(reader, "analytics_events"),
      (std::vector<std::string>{"row INTEGER", "name TEXT", "payload TEXT", "received_at REAL"}));
  EXPECT_EQ(Columns(reader, "power_events"),
            (std::vector<std::string>{"row INTEGER", "agent INTEGER", "name TEXT", "payload TEXT",
                                      "received_at REAL"}));

  auto rows = reader.Rows(
      "SELECT row, reporter_id, session_info, user_info, created_at, typeof(flushed_at) "
      "FROM sessions");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0][0], "7");
  EXPECT_EQ(rows[0][1], "42");
  EXPECT_EQ(Dictionary::parse(rows[0][2]), info);  // the 64-bit token survives unchanged
  EXPECT_EQ(Dictionary::parse(rows[0][3]), user);
  EXPECT_EQ(rows[0][4], "1000.25");
  EXPECT_EQ(rows[0][5], "null");

  rows = reader.Rows(
      "SELECT session_row, reporter_id, category, type, payload, received_at, "
      "typeof(received_at) FROM session_messages ORDER BY row");
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0], (std::vector<std::string>{"7", "42", "65535", "3", JsonText(payload), "1001.5",
                                               "real"}));
  EXPECT_EQ(rows[1][1], "NULL");

  rows =
      reader.Rows("SELECT session_info, user_info, category, type, payload FROM single_messages");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0], (std::vector<std::string>{R"({"SessionID":-1})", JsonText(user), "2", "1",
                                               JsonText(payload)}));
  rows = reader.Rows("SELECT name, payload, received_at FROM analytics_events");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0], (std::vector<std::string>{"com.quorvex.tavrin.Session.Start",
                                               JsonText(payload), "1003.0"}));
  rows = reader.Rows("SELECT agent, name, payload, received_at FROM power_events");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0], (std::vector<std::string>{"28", "Mediane_Haptics",
                                               R"({"EngineOnDuration":12})", "1004.5"}));
  EXPECT_EQ(store.Stats().committed, 6u);
  EXPECT_EQ(store.DroppedRecords(), 0u);
}

TEST_F(SqliteStoreTest, SessionRowGetsItsFlushTimeAndNumberingContinuesAfterReopen) {
  {
    SqliteStore store(Options());
    EXPECT_EQ(store.LastSessionRow(), 0);
    SessionRecord session{41, 5, {{"SessionID", 5}}, Dictionary::object(), 10.0, std::nullopt};
    ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(session)));
    session.flushedAt = 20.5;
    ASSERT_TRUE(store.Append(std::make_shared<const ReportRecord>(session)));
    ASSERT_FALSE(FlushAndWait(store).error);
    Reader reader(DbPath());
    EXPECT_EQ(reader.Rows("SELECT row, created_at, flushed_at FROM sessions"),
              (std::vector<std::vector<std::string>>{{"41", "10.0", "20.5"}}));
  }
  SqliteStore reopened(Options());
  EXPECT_EQ(reopened.LastSessionRow(), 41);
}

TEST_F(SqliteStoreTest, FlushAnswersFromTheWriterAfterItsRowsAreVisibleToAnotherConnection) {
  SqliteStore store(Options());
  constexpr int kRecords = 1500;  // spans several batches
  for (int i = 0; i < kRecords; ++i) ASSERT_TRUE(store.Append(Analytics("e", {{"i", i}})));

  std::promise<std::pair<int64_t, std::string>> seen;
  store.Flush([&](const OptionalError& error) {
    EXPECT_FALSE(error);
    char name[16] = {};
    pthread_getname_np(pthread_self(), name, sizeof name);
    Reader other(DbPath());
    seen.set_value({other.Number("SELECT COUNT(*) FROM analytics_events"), name});
  });
  auto future = seen.get_future();
  ASSERT_EQ(future.wait_for(testing::kAnswerTimeout), std::future_status::ready);
  const auto [count, thread] = future.get();
  EXPECT_EQ(count, kRecords);
  EXPECT_EQ(thread, "tavrin-store");
}

TEST_F(SqliteStoreTest, ConcurrentProducersBelowTheBoundLoseNothing) {
  SqliteStore store(Options());
  constexpr int kThreads = 4;
  constexpr int kPerThread = 5000;  // 20,000 in all: well below the queue bound
  std::vector<std::thread> producers;
  std::atomic<int> refused{0};
  for (int t = 0; t < kThreads; ++t) {
    producers.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        if (!store.Append(Analytics("p", {{"t", t}, {"i", i}}))) refused.fetch_add(1);
      }
    });
  }
  for (auto& producer : producers) producer.join();
  ASSERT_FALSE(FlushAndWait(store).error);
  EXPECT_EQ(refused.load(), 0);
  EXPECT_EQ(store.DroppedRecords(), 0u);

  Reader reader(DbPath());
  EXPECT_EQ(reader.Number("SELECT COUNT(DISTINCT payload) FROM analytics_events"),
            kThreads * kPerThread);
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM analytics_events"), kThreads * kPerThread);
  // Each producer's records keep their order.
  for (int t = 0; t < kThreads; ++t) {
    const auto rows = reader.Rows(
        "SELECT json_extract(payload, '$.i') FROM analytics_events WHERE "
        "json_extract(payload, '$.t') = " +
        std::to_string(t) + " ORDER BY row");
    ASSERT_EQ(rows.size(), size_t(kPerThread));
    for (int i = 0; i < kPerThread; ++i) ASSERT_EQ(rows[i][0], std::to_string(i));
  }
  EXPECT_EQ(store.Stats().committed, uint64_t(kThreads * kPerThread));
}

TEST_F(SqliteStoreTest, FullQueueDropsAreCountedAndLoggedOnceAndTheRestIsCommitted) {
  SqliteStoreOptions options = Options();
  options.queueCapacity = 16;
  options.busyTimeout = std::chrono::seconds(20);
  SqliteStore store(options);
  ASSERT_TRUE(store.IsUp());

  // Another process holds the write lock: the writer waits and the queue fills.
  Reader blocker(DbPath());
  ASSERT_EQ(blocker.Exec("BEGIN IMMEDIATE"), SQLITE_OK);
  ASSERT_TRUE(store.Append(Analytics("first", {})));
  std::this_thread::sleep_for(std::chrono::milliseconds(50));  // lets the writer take it
  constexpr int kPushed = 200;
  int accepted = 1;
  for (int i = 0; i < kPushed; ++i) accepted += store.Append(Analytics("e", {{"i", i}})) ? 1 : 0;

  const uint64_t dropped = store.DroppedRecords();
  EXPECT_GE(dropped, uint64_t(kPushed - 2 * options.queueCapacity));
  EXPECT_EQ(accepted + dropped, uint64_t(kPushed + 1));
  EXPECT_EQ(store.Stats().dropped, dropped);
  EXPECT_EQ(logs_.Count("dropped", LogLevel::kError), 1u);
  EXPECT_EQ(logs_.Count("queue is full (16 records)", LogLevel::kError), 1u);

  // Drops that go on past the rate limit are reported again, with their count.
  clock_.Advance(DropReporter::kDropLogInterval);
  for (size_t i = 0; i < 5 * options.queueCapacity; ++i) {
    accepted += store.Append(Analytics("late", {})) ? 1 : 0;
  }
  EXPECT_EQ(logs_.Count("dropped", LogLevel::kError), 2u);

  ASSERT_EQ(blocker.Exec("COMMIT"), SQLITE_OK);
  const auto answer = FlushAndWait(store);
  ASSERT_TRUE(answer.answered);
  ASSERT_TRUE(answer.error) << "records were dropped since the previous flush";
  EXPECT_NE(answer.error->description.find("dropped"), std::string::npos);
  EXPECT_EQ(blocker.Number("SELECT COUNT(*) FROM analytics_events"), accepted);
  EXPECT_EQ(store.Stats().committed, uint64_t(accepted));

  // The next flush covers no drop and succeeds.
  ASSERT_TRUE(store.Append(Analytics("after", {})));
  EXPECT_FALSE(FlushAndWait(store).error);
}

TEST_F(SqliteStoreTest, ShutdownCommitsEverythingAcceptedAndAnswersPendingFlushes) {
  constexpr int kRecords = 20000;
  std::promise<OptionalError> flushed;
  {
    SqliteStore store(Options());
    for (int i = 0; i < kRecords; ++i) ASSERT_TRUE(store.Append(Analytics("s", {{"i", i}})));
    store.Flush([&](const OptionalError& error) { flushed.set_value(error); });
    store.Shutdown();
    EXPECT_FALSE(store.IsUp());
    EXPECT_EQ(store.Stats().committed, uint64_t(kRecords));

    // Afterwards: hand-over is refused and counted, a flush answers at once with an error.
    EXPECT_FALSE(store.Append(Analytics("late", {})));
    EXPECT_EQ(store.DroppedRecords(), 1u);
    bool lateAnswered = false;
    store.Flush([&](const OptionalError& error) { lateAnswered = error.has_value(); });
    EXPECT_TRUE(lateAnswered);
    store.Shutdown();  // a second call does nothing
  }
  auto future = flushed.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  EXPECT_FALSE(future.get());
  Reader reader(DbPath());
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM analytics_events"), kRecords);
  EXPECT_EQ(logs_.Count("committed", LogLevel::kInfo), 1u);
}

// ---- Bad conditions -------------------------------------------------------------------------

TEST_F(SqliteStoreTest, StateDirectoryThatCannotBeCreatedLeavesTheStoreDownNotTheProcess) {
  // Root ignores permission bits; a regular file where a directory should be stops root too.
  WriteBytes(dir_.path() / "blocker", "not a directory");
  SqliteStoreOptions options = Options();
  options.stateDirectory = (dir_.path() / "blocker" / "state").string();
  SqliteStore store(options);

  EXPECT_FALSE(store.IsUp());
  EXPECT_NE(store.DownReason().find("cannot create state directory"), std::string::npos);
  EXPECT_EQ(logs_.Count("is not up", LogLevel::kError), 1u);
  EXPECT_EQ(logs_.Count("cannot create state directory", LogLevel::kError), 1u);

  EXPECT_FALSE(store.Append(Analytics("e", {})));
  EXPECT_FALSE(store.Append(Analytics("e", {})));
  EXPECT_EQ(store.DroppedRecords(), 2u);
  EXPECT_EQ(store.Stats().dropped, 2u);
  const auto answer = FlushAndWait(store);
  ASSERT_TRUE(answer.answered);
  ASSERT_TRUE(answer.error);
  EXPECT_NE(answer.error->description.find("not up"), std::string::npos);
  EXPECT_EQ(ReadBytes(dir_.path() / "blocker"), "not a directory");
  EXPECT_EQ(logs_.Count("cannot create state directory"), 1u) << "the reason is logged once";
  EXPECT_EQ(logs_.Count("dropped 1 record(s)", LogLevel::kError), 1u) << "drops: one line";
}

TEST_F(SqliteStoreTest, FileThatIsNoDatabaseIsMovedAsideWithItsWalAndAFreshStoreStarts) {
  std::string garbage;
  for (int i = 0; i < 300; ++i) garbage += "this is a text file, not a database\n";
  WriteBytes(DbPath(), garbage);
  WriteBytes(dir_.path() / "tavrin.db-wal", "old wal bytes");
  WriteBytes(dir_.path() / "tavrin.db-shm", "old shm bytes");

  SqliteStore store(Options());
  ASSERT_TRUE(store.IsUp()) << store.DownReason();
  const auto moved = dir_.path() / kCorruptName;
  EXPECT_EQ(ReadBytes(moved), garbage) << "the original bytes are kept";
  EXPECT_EQ(ReadBytes(moved.string() + "-wal"), "old wal bytes");
  EXPECT_EQ(ReadBytes(moved.string() + "-shm"), "old shm bytes");

  const auto lines = logs_.Matching("moved it to");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kError);
  EXPECT_NE(lines[0].text.find(DbPath().string() + " is not a database"), std::string::npos);
  EXPECT_NE(lines[0].text.find(moved.string()), std::string::npos);

  ASSERT_TRUE(store.Append(Analytics("fresh", {})));
  ASSERT_FALSE(FlushAndWait(store).error);
  Reader reader(DbPath());
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM analytics_events"), 1);
}

TEST_F(SqliteStoreTest, DatabaseWithCorruptSchemaPageIsMovedAside) {
  {
    SqliteStore store(Options());
    ASSERT_TRUE(store.Append(Analytics("old", {})));
    ASSERT_FALSE(FlushAndWait(store).error);
  }
  // Keep the 100-byte header, scramble the rest of page 1 (the schema).
  std::string bytes = ReadBytes(DbPath());
  ASSERT_GT(bytes.size(), 4096u);
  for (size_t i = 100; i < 4096; ++i) bytes[i] = char(0xA5 ^ (i * 7));
  WriteBytes(DbPath(), bytes);
  // A -wal that SQLite does not recognise: it must be kept as it is, not checkpointed or deleted.
  WriteBytes(dir_.path() / "tavrin.db-wal", "stale wal");

  SqliteStore store(Options());
  EXPECT_TRUE(store.IsUp()) << store.DownReason();
  EXPECT_EQ(ReadBytes(dir_.path() / kCorruptName), bytes);
  EXPECT_EQ(ReadBytes(dir_.path() / (std::string(kCorruptName) + "-wal")), "stale wal");
  EXPECT_EQ(logs_.Count("moved it to", LogLevel::kError), 1u);
}

TEST_F(SqliteStoreTest, FullDiskDropsTheBatchTakesTheStoreDownAndItRecoversWhenSpaceFrees) {
  SqliteStoreOptions options = Options();
  options.maxPageCount = 40;  // a "disk" of 40 pages: a few hundred records
  SqliteStore store(options);
  ASSERT_TRUE(store.IsUp());

  const std::string filler(1000, 'x');
  uint64_t handed = 0;
  std::optional<Error> failure;
  for (int round = 0; round < 50 && !failure; ++round) {
    for (int i = 0; i < 20; ++i, ++handed) {
      ASSERT_TRUE(store.Append(Analytics("fill", {{"f", filler}})));
    }
    failure = FlushAndWait(store).error;
  }
  ASSERT_TRUE(failure) << "the page limit was never reached";
  EXPECT_FALSE(store.IsUp());
  EXPECT_NE(store.DownReason().find("full"), std::string::npos) << store.DownReason();
  EXPECT_GT(store.DroppedRecords(), 0u);
  EXPECT_EQ(store.Stats().committed + store.DroppedRecords(), handed);
  EXPECT_EQ(logs_.Count("is not up", LogLevel::kError), 1u);

  // Still failing: no second "not up" line, drops keep being counted.
  const uint64_t droppedBefore = store.DroppedRecords();
  for (int i = 0; i < 20; ++i) ASSERT_TRUE(store.Append(Analytics("fill", {{"f", filler}})));
  EXPECT_TRUE(FlushAndWait(store).error);
  EXPECT_EQ(store.DroppedRecords(), droppedBefore + 20);
  EXPECT_EQ(logs_.Count("is not up", LogLevel::kError), 1u);

  // Space frees (another process deletes rows): the next batch commits and the store is up.
  Reader reader(DbPath());
  const int64_t committedRows = reader.Number("SELECT COUNT(*) FROM analytics_events");
  EXPECT_EQ(uint64_t(committedRows), store.Stats().committed) << "committed rows are intact";
  ASSERT_EQ(reader.Exec("DELETE FROM analytics_events"), SQLITE_OK);
  ASSERT_TRUE(store.Append(Analytics("small", {})));
  EXPECT_FALSE(FlushAndWait(store).error);
  EXPECT_TRUE(store.IsUp());
  EXPECT_EQ(store.DownReason(), "");
  EXPECT_EQ(logs_.Count("is written again"), 1u);
  EXPECT_EQ(reader.Number("SELECT COUNT(*) FROM analytics_events WHERE name = 'small'"), 1);
}

// Another process holding the write lock past the busy timeout (tavrinctl, sqlite3) used to cost
// a whole batch; the writer now waits it out with backoff and drops nothing.
TEST_F(SqliteStoreTest, WriteLockHeldPastTheBusyTimeoutDelaysTheBatchWithoutDroppingIt) {
  SqliteStoreOptions options = Options();
  options.busyTimeout = std::chrono::milliseconds(20);
  SqliteStore store(options);
  ASSERT_TRUE(store.IsUp());
  Reader other(DbPath());
  ASSERT_EQ(other.Exec("BEGIN IMMEDIATE"), SQLITE_OK);
  for (int i = 0; i < 10; ++i) ASSERT_TRUE(store.Append(Analytics("waiting", {})));
  std::this_thread::sleep_for(std::chrono::milliseconds(150));  // several busy timeouts
  ASSERT_EQ(other.Exec("COMMIT"), SQLITE_OK);
  EXPECT_FALSE(FlushAndWait(store).error);
  EXPECT_EQ(store.DroppedRecords(), 0u);
  EXPECT_EQ(other.Number("SELECT COUNT(*) FROM analytics_events"), 10);
}

// ---- SIGKILL -----------------------------------------------------------------------------------

constexpr const char* kChildDirVariable = "TAVRIN_STORE_CHILD_DIR";
constexpr const char* kChildFdVariable = "TAVRIN_STORE_CHILD_FD";

// Not a test of its own: the body of the child process of SigkillLosesNothingAFlushAcknowledged.
// Appends numbered records without end and, after every flush answer, writes the number of the
// last record that flush covered to the pipe.
TEST(SqliteStoreChild, WritesUntilKilled) {
  const char* dir = std::getenv(kChildDirVariable);
  const char* fd = std::getenv(kChildFdVariable);
  if (!dir || !fd) GTEST_SKIP() << "runs only as the child of the SIGKILL test";
  const int pipe = std::atoi(fd);
  SqliteStoreOptions options;
  options.stateDirectory = dir;
  SqliteStore store(options);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  for (int64_t i = 1; std::chrono::steady_clock::now() < deadline; ++i) {
    while (!store.Append(Analytics("k", {{"i", i}}))) std::this_thread::yield();
    if (i % 64 == 0) {
      store.Flush([pipe, i](const OptionalError& error) {
        if (!error) (void)!::write(pipe, &i, sizeof i);
      });
    }
  }
  ::_exit(3);  // killed long before
}

TEST_F(SqliteStoreTest, SigkillLosesNothingAFlushAcknowledged) {
  int fds[2];
  ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
  const std::string childFd = std::to_string(::fcntl(fds[1], F_DUPFD, 10));  // inherited copy

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) env.emplace_back(*e);
  env.push_back(std::string(kChildDirVariable) + "=" + dir_.path().string());
  env.push_back(std::string(kChildFdVariable) + "=" + childFd);
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);
  std::string self = "/proc/self/exe";
  std::string filter = "--gtest_filter=SqliteStoreChild.WritesUntilKilled";
  char* argv[] = {self.data(), filter.data(), nullptr};
  pid_t child = -1;
  ASSERT_EQ(posix_spawn(&child, self.c_str(), &actions, nullptr, argv, envp.data()), 0);
  posix_spawn_file_actions_destroy(&actions);
  ::close(std::stoi(childFd));
  ::close(fds[1]);

  // Let the child get well into writing, then kill it in the middle of its work.
  int64_t acknowledged = 0;
  int acks = 0;
  while (acks < 40) {
    int64_t value = 0;
    const ssize_t got = ::read(fds[0], &value, sizeof value);
    ASSERT_EQ(got, ssize_t(sizeof value)) << "the child ended early";
    acknowledged = std::max(acknowledged, value);
    ++acks;
  }
  ASSERT_EQ(::kill(child, SIGKILL), 0);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status));
  for (;;) {  // acknowledgements written before the kill
    int64_t value = 0;
    if (::read(fds[0], &value, sizeof value) != ssize_t(sizeof value)) break;
    acknowledged = std::max(acknowledged, value);
  }
  ::close(fds[0]);

  Reader reader(DbPath());
  const int64_t kept =
      reader.Number("SELECT COUNT(*) FROM analytics_events WHERE json_extract(payload, '$.i') <= " +
                    std::to_string(acknowledged));
  EXPECT_EQ(kept, acknowledged) << "every acknowledged record is in the store";
  const int64_t total = reader.Number("SELECT COUNT(*) FROM analytics_events");
  EXPECT_EQ(reader.Number("SELECT MAX(json_extract(payload, '$.i')) FROM analytics_events"), total)
      << "the store holds a gap-free prefix: what was lost is only the tail";
  RecordProperty("acknowledged", std::to_string(acknowledged));
  RecordProperty("stored", std::to_string(total));
  // And the store opens cleanly again.
  SqliteStore reopened(Options());
  EXPECT_TRUE(reopened.IsUp());
}

}  // namespace
}  // namespace tavrin
