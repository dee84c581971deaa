#include "platform/linux/store/SqliteStore.h"

#include <fcntl.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <span>
#include <thread>
#include <vector>

namespace tavrin {
namespace {

// Tries of one batch while another process holds the write lock (each try already waits the busy
// timeout), and the first pause between them, doubled each time.
constexpr int kMaxWriteAttempts = 5;
constexpr auto kFirstRetryDelay = std::chrono::milliseconds(50);

bool IsBusy(int rc) {
  const int primary = rc & 0xff;
  return primary == SQLITE_BUSY || primary == SQLITE_LOCKED;
}

bool NeedsReopen(int rc) {
  const int primary = rc & 0xff;
  return primary == SQLITE_READONLY || primary == SQLITE_IOERR || primary == SQLITE_CANTOPEN ||
         rc == SQLITE_MISUSE;  // no connection: an earlier reopen failed
}

constexpr const char* kSchema = R"sql(
CREATE TABLE IF NOT EXISTS sessions(row INTEGER PRIMARY KEY, reporter_id INTEGER,
  session_info TEXT, user_info TEXT, created_at REAL, flushed_at REAL,
  recovered INTEGER NOT NULL DEFAULT 0);
CREATE TABLE IF NOT EXISTS session_messages(row INTEGER PRIMARY KEY, session_row INTEGER,
  reporter_id INTEGER, category INTEGER, type INTEGER, payload TEXT, received_at REAL);
CREATE TABLE IF NOT EXISTS single_messages(row INTEGER PRIMARY KEY, session_info TEXT,
  user_info TEXT, category INTEGER, type INTEGER, payload TEXT, received_at REAL);
CREATE TABLE IF NOT EXISTS analytics_events(row INTEGER PRIMARY KEY, name TEXT, payload TEXT,
  received_at REAL);
CREATE TABLE IF NOT EXISTS power_events(row INTEGER PRIMARY KEY, agent INTEGER, name TEXT,
  payload TEXT, received_at REAL);
)sql";

constexpr const char* kAddRecoveredColumn =
    "ALTER TABLE sessions ADD COLUMN recovered INTEGER NOT NULL DEFAULT 0";

// A session's row is handed over twice: at creation, and with flushed_at when it is flushed.
constexpr const char* kInsertSession =
    "INSERT INTO sessions(row, reporter_id, session_info, user_info, created_at, flushed_at, "
    "recovered) VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7) "
    "ON CONFLICT(row) DO UPDATE SET flushed_at = excluded.flushed_at";
constexpr const char* kInsertSessionMessage =
    "INSERT INTO session_messages(session_row, reporter_id, category, type, payload, "
    "received_at) VALUES(?1, ?2, ?3, ?4, ?5, ?6)";
constexpr const char* kInsertSingleMessage =
    "INSERT INTO single_messages(session_info, user_info, category, type, payload, received_at) "
    "VALUES(?1, ?2, ?3, ?4, ?5, ?6)";
constexpr const char* kInsertAnalyticsEvent =
    "INSERT INTO analytics_events(name, payload, received_at) VALUES(?1, ?2, ?3)";

// The two tables that take a row per client message are written kRowsPerInsert rows a
// statement: a statement's own cost (the step, reset and clearing of its bindings) is then paid
// once for that many rows.
constexpr size_t kRowsPerInsert = 32;
constexpr int kSessionMessageColumns = 6;
constexpr int kAnalyticsEventColumns = 3;

// "INSERT INTO <table>(<columns>) VALUES(?,...),(?,...),..." with `rows` rows of `columns`.
std::string MultiRowInsert(const char* into, int columns, size_t rows) {
  std::string row = "(?";
  for (int i = 1; i < columns; ++i) row += ",?";
  row += ')';
  std::string sql = fmt::format("INSERT INTO {} VALUES", into);
  for (size_t i = 0; i < rows; ++i) sql += (i == 0 ? "" : ",") + row;
  return sql;
}
constexpr const char* kInsertPowerEvent =
    "INSERT INTO power_events(agent, name, payload, received_at) VALUES(?1, ?2, ?3, ?4)";

// Several stores may be moved aside within one second (tests, a crash loop); a numbered suffix
// keeps every one of them. Past this many the store gives up rather than search forever.
constexpr int kMaxCorruptNameAttempts = 100;

bool IsCorruption(int rc) {
  const int primary = rc & 0xff;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
}

std::string SqliteError(sqlite3* db, int rc) {
  return fmt::format("{} (SQLite code {})", db ? sqlite3_errmsg(db) : sqlite3_errstr(rc), rc);
}

std::string UtcStamp(WallTime time) {
  const std::time_t seconds = std::chrono::system_clock::to_time_t(time);
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  char text[32];
  std::strftime(text, sizeof text, "%Y%m%dT%H%M%S", &parts);
  return text;
}

// True for a missing or empty file (SQLite makes a new database of it) and for a file that
// begins with SQLite's 16-byte magic text.
bool HasDatabaseHeader(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) return true;  // missing, or not openable: SQLite reports that itself
  struct stat info;
  char header[16] = {};
  bool sound = true;
  if (::fstat(fd, &info) == 0 && S_ISREG(info.st_mode) && info.st_size > 0) {
    sound = ::pread(fd, header, sizeof header, 0) == ssize_t(sizeof header) &&
            std::memcmp(header, "SQLite format 3", sizeof header) == 0;
  }
  ::close(fd);
  return sound;
}

bool Exists(const std::string& path) {
  struct stat info;
  return ::lstat(path.c_str(), &info) == 0 || errno != ENOENT;
}

// Renames without ever replacing an existing file.
int RenameNoReplace(const std::string& from, const std::string& to) {
  if (::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) == 0) return 0;
  if (errno != EINVAL && errno != ENOSYS) return errno;
  // File systems without RENAME_NOREPLACE: link() refuses to replace as well.
  if (::link(from.c_str(), to.c_str()) != 0) return errno;
  if (::unlink(from.c_str()) != 0) return errno;
  return 0;
}

void BindOptionalInt(sqlite3_stmt* statement, int index, const std::optional<int64_t>& value) {
  if (value) {
    sqlite3_bind_int64(statement, index, *value);
  } else {
    sqlite3_bind_null(statement, index);
  }
}

void BindText(sqlite3_stmt* statement, int index, const std::string& text) {
  // The text outlives the step that reads it.
  sqlite3_bind_text(statement, index, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
}

// Binds one row's columns from `first` on; `payload` keeps the payload's text until the step.
void BindRow(sqlite3_stmt* statement, int first, const SessionMessageRecord& r,
             std::string& payload) {
  payload = JsonText(*r.payload);
  sqlite3_bind_int64(statement, first, r.sessionRow);
  BindOptionalInt(statement, first + 1, r.reporterId);
  sqlite3_bind_int(statement, first + 2, r.category);
  sqlite3_bind_int(statement, first + 3, r.type);
  BindText(statement, first + 4, payload);
  sqlite3_bind_double(statement, first + 5, r.receivedAt);
}

void BindRow(sqlite3_stmt* statement, int first, const AnalyticsEventRecord& r,
             std::string& payload) {
  payload = JsonText(r.payload);
  BindText(statement, first, r.name);
  BindText(statement, first + 1, payload);
  sqlite3_bind_double(statement, first + 2, r.receivedAt);
}

int Step(sqlite3_stmt* statement) {
  const int rc = sqlite3_step(statement);
  sqlite3_reset(statement);
  sqlite3_clear_bindings(statement);
  return rc == SQLITE_DONE ? SQLITE_OK : rc;
}

}  // namespace

SqliteStore::SqliteStore(SqliteStoreOptions options)
    : options_(std::move(options)),
      path_((std::filesystem::path(options_.stateDirectory) / kFileName).string()),
      drops_(*options_.clock, options_.log, "sqlite:" + path_) {
  if (Open()) {
    TLOG_INFO(options_.log, "store {} open (WAL, {} sessions so far)", path_, lastSessionRow_);
  }
  // The writer runs even when the store is down: it answers flushes from its own thread.
  writer_ = std::thread([this] { WriterLoop(); });
}

SqliteStore::~SqliteStore() { Shutdown(); }

std::string SqliteStore::Name() const { return "sqlite:" + path_; }

bool SqliteStore::IsUp() const { return state_.load(std::memory_order_acquire) == State::kUp; }

std::string SqliteStore::DownReason() const {
  std::lock_guard lock(mutex_);
  return downReason_;
}

void SqliteStore::Fail(std::string reason) {
  TLOG_ERROR(options_.log, "store {} is not up, records will be dropped: {}", path_, reason);
  std::lock_guard lock(mutex_);
  downReason_ = std::move(reason);
  state_.store(State::kFailed, std::memory_order_release);
}

bool SqliteStore::Open() {
  std::error_code error;
  std::filesystem::create_directories(options_.stateDirectory, error);
  if (error) {
    Fail(fmt::format("cannot create state directory {}: {}", options_.stateDirectory,
                     error.message()));
    return false;
  }
  std::string reason;
  int rc = OpenDatabase(&reason);
  if (IsCorruption(rc)) {
    CloseDatabase();
    std::string movedTo;
    if (!MoveCorruptFilesAside(&movedTo)) return false;
    TLOG_ERROR(options_.log,
               "store {} is not a database or is corrupt ({}); moved it to {} and started a "
               "fresh store",
               path_, reason, movedTo);
    rc = OpenDatabase(&reason);
  }
  if (rc != SQLITE_OK) {
    CloseDatabase();
    Fail(fmt::format("cannot open {}: {}", path_, reason));
    return false;
  }
  return true;
}

int SqliteStore::OpenDatabase(std::string* reason) {
  // SQLite deletes the -wal of a database it closes; a file that is no database is therefore
  // recognised by its header before SQLite opens it, so its -wal stays as it is.
  if (!HasDatabaseHeader(path_)) {
    *reason = "the file does not begin with the SQLite header";
    return SQLITE_NOTADB;
  }
  int rc =
      sqlite3_open_v2(path_.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  const auto failed = [&](int code) {
    *reason = SqliteError(db_, code);
    return code;
  };
  if (rc != SQLITE_OK) return failed(rc);
  // Until the file has proved sound, closing must not checkpoint into it (or delete its -wal).
  sqlite3_db_config(db_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  sqlite3_extended_result_codes(db_, 1);
  sqlite3_busy_timeout(db_, static_cast<int>(options_.busyTimeout.count()));

  // The first statement reads the file header: a file that is no database fails here.
  sqlite3_stmt* statement = nullptr;
  rc = sqlite3_prepare_v2(db_, "PRAGMA journal_mode=WAL", -1, &statement, nullptr);
  if (rc != SQLITE_OK) return failed(rc);
  rc = sqlite3_step(statement);
  std::string mode;
  if (rc == SQLITE_ROW) {
    mode = reinterpret_cast<const char*>(sqlite3_column_text(statement, 0));
    rc = SQLITE_OK;
  }
  sqlite3_finalize(statement);
  if (rc != SQLITE_OK) return failed(rc);
  if (mode != "wal") {
    TLOG_ERROR(options_.log, "store {}: WAL mode refused, journal mode is {}", path_, mode);
  }

  std::string pragmas = "PRAGMA synchronous=NORMAL;";
  if (options_.maxPageCount > 0) {
    pragmas += fmt::format("PRAGMA max_page_count={};", options_.maxPageCount);
  }
  rc = sqlite3_exec(db_, pragmas.c_str(), nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) return failed(rc);
  rc = sqlite3_exec(db_, kSchema, nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) return failed(rc);
  // Stores made before sessions could be recovered lack the column; SQLite has no
  // "ADD COLUMN IF NOT EXISTS", so the duplicate-column error is the "already there" answer.
  sqlite3_exec(db_, kAddRecoveredColumn, nullptr, nullptr, nullptr);

  rc = sqlite3_prepare_v2(db_, "SELECT COALESCE(MAX(row), 0) FROM sessions", -1, &statement,
                          nullptr);
  if (rc != SQLITE_OK) return failed(rc);
  rc = sqlite3_step(statement);
  if (rc == SQLITE_ROW) {
    lastSessionRow_ = sqlite3_column_int64(statement, 0);
    rc = SQLITE_OK;
  }
  sqlite3_finalize(statement);
  if (rc != SQLITE_OK) return failed(rc);

  const std::pair<const char*, sqlite3_stmt**> statements[] = {
      {kInsertSession, &insertSession_},
      {kInsertSessionMessage, &insertSessionMessage_},
      {kInsertSingleMessage, &insertSingleMessage_},
      {kInsertAnalyticsEvent, &insertAnalyticsEvent_},
      {kInsertPowerEvent, &insertPowerEvent_},
  };
  const std::string insertSessionMessages = MultiRowInsert(
      "session_messages(session_row, reporter_id, category, type, payload, "
      "received_at)",
      kSessionMessageColumns, kRowsPerInsert);
  const std::string insertAnalyticsEvents = MultiRowInsert(
      "analytics_events(name, payload, received_at)", kAnalyticsEventColumns, kRowsPerInsert);
  const std::pair<const char*, sqlite3_stmt**> manyRows[] = {
      {insertSessionMessages.c_str(), &insertSessionMessages_},
      {insertAnalyticsEvents.c_str(), &insertAnalyticsEvents_},
  };
  using Statements = std::span<const std::pair<const char*, sqlite3_stmt**>>;
  for (const Statements list : {Statements(statements), Statements(manyRows)}) {
    for (const auto& [sql, target] : list) {
      rc = sqlite3_prepare_v3(db_, sql, -1, SQLITE_PREPARE_PERSISTENT, target, nullptr);
      if (rc != SQLITE_OK) return failed(rc);
    }
  }
  rowTexts_.resize(kRowsPerInsert);
  sqlite3_db_config(db_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 0, nullptr);
  return SQLITE_OK;
}

void SqliteStore::CloseDatabase() {
  for (sqlite3_stmt** statement :
       {&insertSession_, &insertSessionMessage_, &insertSingleMessage_, &insertAnalyticsEvent_,
        &insertPowerEvent_, &insertSessionMessages_, &insertAnalyticsEvents_}) {
    sqlite3_finalize(*statement);
    *statement = nullptr;
  }
  sqlite3_close_v2(db_);
  db_ = nullptr;
}

bool SqliteStore::MoveCorruptFilesAside(std::string* movedTo) {
  const std::string stamp = UtcStamp(options_.clock->WallNow());
  const char* suffixes[] = {"", "-wal", "-shm"};
  std::string base;
  for (int attempt = 0; attempt < kMaxCorruptNameAttempts && base.empty(); ++attempt) {
    const std::string candidate = attempt == 0
                                      ? fmt::format("{}.corrupt-{}", path_, stamp)
                                      : fmt::format("{}.corrupt-{}.{}", path_, stamp, attempt);
    bool taken = false;
    for (const char* suffix : suffixes) taken = taken || Exists(candidate + suffix);
    if (!taken) base = candidate;
  }
  if (base.empty()) {
    Fail(fmt::format("{} is corrupt and no free name to move it to was found", path_));
    return false;
  }
  // The main file first; its -wal must never stay beside a fresh database, which would replay it.
  for (const char* suffix : suffixes) {
    const std::string from = path_ + suffix;
    if (!Exists(from)) continue;
    if (const int error = RenameNoReplace(from, base + suffix); error != 0) {
      Fail(fmt::format("{} is corrupt and could not be moved to {}: {}", from, base + suffix,
                       std::strerror(error)));
      return false;
    }
  }
  *movedTo = base;
  return true;
}

bool SqliteStore::Append(ReportRecordPtr record) {
  const State state = state_.load(std::memory_order_acquire);
  if (state == State::kFailed || state == State::kClosed) {
    drops_.Dropped(1, state == State::kClosed ? "the store is shut down" : "the store is not up");
    SettleRecord(*record, false, DropReason::kBackendDown);
    return false;
  }
  bool stopping = false;
  {
    std::lock_guard lock(mutex_);
    stopping = stopping_;
    if (!stopping && queue_.size() < options_.queueCapacity) {
      queue_.push_back(Queued{++acceptedSeq_, std::move(record)});
      queued_.store(queue_.size(), std::memory_order_relaxed);
      accepted_.fetch_add(1, std::memory_order_relaxed);
      if (queue_.size() >= wakeAtQueued_) wakeup_.notify_one();
      return true;
    }
  }
  // Counted outside the lock: the drop line must not hold up the writer.
  if (stopping) {
    drops_.Dropped(1, "the store is shut down");
    SettleRecord(*record, false, DropReason::kBackendDown);
  } else {
    drops_.Dropped(1,
                   fmt::format("the store's queue is full ({} records)", options_.queueCapacity));
    SettleRecord(*record, false, DropReason::kQueueFull);
  }
  return false;
}

void SqliteStore::Flush(FlushCallback done) {
  std::unique_lock lock(mutex_);
  if (stopping_) {
    // No writer thread is left to answer from.
    lock.unlock();
    if (done) done(Error{kGeneralErrorDomain, -1, fmt::format("store {} is shut down", path_)});
    return;
  }
  waiters_.push_back(Waiter{acceptedSeq_, std::move(done)});
  wakeup_.notify_one();
}

BackendStats SqliteStore::Stats() const {
  return BackendStats{accepted_.load(std::memory_order_relaxed),
                      committed_.load(std::memory_order_relaxed), drops_.Total()};
}

void SqliteStore::Shutdown() {
  std::lock_guard shutdownLock(shutdownMutex_);
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
    wakeup_.notify_one();
  }
  if (writer_.joinable()) writer_.join();
  CloseDatabase();
  const State previous = state_.exchange(State::kClosed, std::memory_order_acq_rel);
  if (previous != State::kFailed) {
    TLOG_INFO(options_.log, "store {} closed: {} records committed, {} dropped", path_,
              committed_.load(), drops_.Total());
  }
}

void SqliteStore::WriterLoop() {
  pthread_setname_np(pthread_self(), "tavrin-store");
  std::deque<Queued> batch;
  for (;;) {
    bool finished = false;
    {
      std::unique_lock lock(mutex_);
      const auto hasWork = [this] { return !queue_.empty() || !waiters_.empty() || stopping_; };
      wakeAtQueued_ = 1;
      wakeup_.wait(lock, hasWork);
      if (!queue_.empty()) {
        const auto deadline = std::chrono::steady_clock::now() + kMaxBatchDelay;
        for (;;) {
          while (!queue_.empty() && batch.size() < kMaxBatchRecords) {
            batch.push_back(std::move(queue_.front()));
            queue_.pop_front();
          }
          queued_.store(queue_.size(), std::memory_order_relaxed);
          // Whoever waits for a flush or the shutdown waits for this batch: commit it now.
          if (batch.size() >= kMaxBatchRecords || stopping_ || !waiters_.empty()) break;
          // Until the deadline, only a full batch, a flush or the shutdown is worth a wake-up.
          wakeAtQueued_ = kMaxBatchRecords - batch.size();
          if (!wakeup_.wait_until(lock, deadline, hasWork)) break;
        }
      } else {
        finished = stopping_ && waiters_.empty();
      }
    }
    if (finished) return;
    if (!batch.empty()) WriteBatch(batch);
    AnswerFlushes();
  }
}

template <typename Record>
int SqliteStore::InsertRows(const std::vector<const Record*>& rows, sqlite3_stmt* many,
                            sqlite3_stmt* one, int columns) {
  size_t i = 0;
  for (; i + kRowsPerInsert <= rows.size(); i += kRowsPerInsert) {
    for (size_t k = 0; k < kRowsPerInsert; ++k) {
      BindRow(many, static_cast<int>(k) * columns + 1, *rows[i + k], rowTexts_[k]);
    }
    if (const int rc = Step(many); rc != SQLITE_OK) return rc;
  }
  for (; i < rows.size(); ++i) {
    BindRow(one, 1, *rows[i], rowTexts_[0]);
    if (const int rc = Step(one); rc != SQLITE_OK) return rc;
  }
  return SQLITE_OK;
}

int SqliteStore::TryWriteBatch(const std::deque<Queued>& batch) {
  int rc = db_ ? sqlite3_exec(db_, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr) : SQLITE_MISUSE;
  if (rc == SQLITE_OK) {
    // Per table the batch's order holds, so rows are numbered in the order they were accepted;
    // which table is written first does not show once the transaction commits.
    std::vector<const SessionMessageRecord*> messages;
    std::vector<const AnalyticsEventRecord*> events;
    for (const Queued& queued : batch) {
      if (const auto* r = std::get_if<SessionMessageRecord>(queued.record.get())) {
        messages.push_back(r);
      } else if (const auto* e = std::get_if<AnalyticsEventRecord>(queued.record.get())) {
        events.push_back(e);
      } else if (rc = WriteRecord(*queued.record); rc != SQLITE_OK) {
        break;
      }
    }
    if (rc == SQLITE_OK) {
      rc = InsertRows(messages, insertSessionMessages_, insertSessionMessage_,
                      kSessionMessageColumns);
    }
    if (rc == SQLITE_OK) {
      rc =
          InsertRows(events, insertAnalyticsEvents_, insertAnalyticsEvent_, kAnalyticsEventColumns);
    }
    if (rc == SQLITE_OK) rc = sqlite3_exec(db_, "COMMIT", nullptr, nullptr, nullptr);
  }
  if (rc != SQLITE_OK && db_ && !sqlite3_get_autocommit(db_)) {
    sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
  }
  return rc;
}

void SqliteStore::WriteBatch(std::deque<Queued>& batch) {
  const uint64_t lastSeq = batch.back().seq;
  const size_t count = batch.size();
  int rc = TryWriteBatch(batch);
  // Another process holding the write lock past the busy timeout is a passing condition: the
  // batch waits for it, backing off, rather than being dropped. Meanwhile the queue fills and its
  // bound, not this wait, decides what is lost.
  auto backoff = kFirstRetryDelay;
  for (int attempt = 1; attempt < kMaxWriteAttempts && IsBusy(rc); ++attempt) {
    std::this_thread::sleep_for(backoff);
    backoff *= 2;
    rc = TryWriteBatch(batch);
  }
  // A file that turned read-only or a connection that lost its file (remounted, moved, I/O
  // errors) may write again through a new connection: reopen once per batch, then retry.
  if (rc != SQLITE_OK && NeedsReopen(rc)) {
    std::string reason;
    const int64_t rowsBefore = lastSessionRow_;  // the numbering was read at the first open
    CloseDatabase();
    const int reopened = OpenDatabase(&reason);
    lastSessionRow_ = rowsBefore;
    if (reopened == SQLITE_OK) {
      rc = TryWriteBatch(batch);
    } else {
      CloseDatabase();
      rc = reopened;
    }
  }
  for (const Queued& queued : batch) {
    SettleRecord(*queued.record, rc == SQLITE_OK, DropReason::kWriteFailed);
  }
  batch.clear();
  if (rc == SQLITE_OK) {
    committed_.fetch_add(count, std::memory_order_relaxed);
    State expected = State::kWriteFailing;
    if (state_.compare_exchange_strong(expected, State::kUp, std::memory_order_acq_rel)) {
      TLOG_ERROR(options_.log, "store {} is written again ({} records dropped in all)", path_,
                 drops_.Total());
      std::lock_guard lock(mutex_);
      downReason_.clear();
    }
  } else {
    const std::string reason = SqliteError(db_, rc);
    SetWriteFailing(reason);
    drops_.Dropped(count, fmt::format("writing to the store failed: {}", reason));
  }
  std::lock_guard lock(mutex_);
  processedSeq_ = lastSeq;
}

int SqliteStore::WriteRecord(const ReportRecord& record) {
  if (const auto* r = std::get_if<SessionRecord>(&record)) {
    const std::string sessionInfo = JsonText(r->sessionInfo);
    const std::string userInfo = JsonText(r->userInfo);
    sqlite3_bind_int64(insertSession_, 1, r->row);
    BindOptionalInt(insertSession_, 2, r->reporterId);
    BindText(insertSession_, 3, sessionInfo);
    BindText(insertSession_, 4, userInfo);
    sqlite3_bind_double(insertSession_, 5, r->createdAt);
    if (r->flushedAt) {
      sqlite3_bind_double(insertSession_, 6, *r->flushedAt);
    } else {
      sqlite3_bind_null(insertSession_, 6);
    }
    sqlite3_bind_int(insertSession_, 7, r->recovered ? 1 : 0);
    return Step(insertSession_);
  }
  if (const auto* r = std::get_if<SingleMessageRecord>(&record)) {
    const std::string sessionInfo = JsonText(r->sessionInfo);
    const std::string userInfo = JsonText(r->userInfo);
    const std::string payload = JsonText(r->payload);
    BindText(insertSingleMessage_, 1, sessionInfo);
    BindText(insertSingleMessage_, 2, userInfo);
    sqlite3_bind_int(insertSingleMessage_, 3, r->category);
    sqlite3_bind_int(insertSingleMessage_, 4, r->type);
    BindText(insertSingleMessage_, 5, payload);
    sqlite3_bind_double(insertSingleMessage_, 6, r->receivedAt);
    return Step(insertSingleMessage_);
  }
  const auto& r = std::get<PowerEventRecord>(record);
  const std::string payload = JsonText(r.payload);
  sqlite3_bind_int(insertPowerEvent_, 1, r.agent);
  BindText(insertPowerEvent_, 2, r.name);
  BindText(insertPowerEvent_, 3, payload);
  sqlite3_bind_double(insertPowerEvent_, 4, r.receivedAt);
  return Step(insertPowerEvent_);
}

void SqliteStore::SetWriteFailing(const std::string& reason) {
  State expected = State::kUp;
  if (!state_.compare_exchange_strong(expected, State::kWriteFailing, std::memory_order_acq_rel)) {
    return;
  }
  TLOG_ERROR(options_.log,
             "store {} is not up, records are dropped until a write succeeds again: {}", path_,
             reason);
  std::lock_guard lock(mutex_);
  downReason_ = reason;
}

void SqliteStore::AnswerFlushes() {
  std::vector<std::pair<FlushCallback, OptionalError>> ready;
  {
    std::lock_guard lock(mutex_);
    const bool failed = state_.load(std::memory_order_acquire) == State::kFailed;
    // Every flush answered now covers the records lost since the previous answer.
    const uint64_t lostNow = drops_.Total();
    const uint64_t lost = lostNow - lostReported_;
    while (!waiters_.empty() && waiters_.front().target <= processedSeq_) {
      Waiter& waiter = waiters_.front();
      OptionalError error;
      lostReported_ = lostNow;
      if (failed) {
        error = Error{kGeneralErrorDomain, -1,
                      fmt::format("store {} is not up: {}", path_, downReason_)};
      } else if (lost > 0) {
        error = Error{kGeneralErrorDomain, -1,
                      fmt::format("store {} dropped {} record(s) since the previous flush answer",
                                  path_, lost)};
      }
      ready.emplace_back(std::move(waiter.done), std::move(error));
      waiters_.pop_front();
    }
  }
  for (auto& [done, error] : ready) {
    if (done) done(error);
  }
}

}  // namespace tavrin
