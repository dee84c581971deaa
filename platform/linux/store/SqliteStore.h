#pragma once

// The embedded store: one SQLite file, <state-dir>/tavrin.db, in WAL mode, written by one writer
// thread ("tavrin-store") in batched transactions.
//
// Tables (a contract; columns may be added, never changed). JSON columns hold dictionaries as
// JSON text; times are seconds since the epoch:
//   sessions(row INTEGER PRIMARY KEY, reporter_id INTEGER, session_info TEXT, user_info TEXT,
//            created_at REAL, flushed_at REAL, recovered INTEGER: 1 for the session of a summary
//            sent on a later start for a session that was open when the service ended)
//   session_messages(row INTEGER PRIMARY KEY, session_row INTEGER, reporter_id INTEGER,
//                    category INTEGER, type INTEGER, payload TEXT, received_at REAL)
//   single_messages(row INTEGER PRIMARY KEY, session_info TEXT, user_info TEXT,
//                   category INTEGER, type INTEGER, payload TEXT, received_at REAL)
//   analytics_events(row INTEGER PRIMARY KEY, name TEXT, payload TEXT, received_at REAL)
//   power_events(row INTEGER PRIMARY KEY, agent INTEGER, name TEXT, payload TEXT,
//                received_at REAL)
//
// Hand-over never blocks: Append pushes onto a queue of at most kMaxQueuedRecords records; a
// record that finds it full is dropped and counted (DroppedRecords(), Stats(), and an error line
// that is rate-limited by DropReporter).
//
// Batches: the writer opens a batch with the first record it takes and commits it after
// kMaxBatchRecords records or kMaxBatchDelay, whichever comes first, or at once when a flush or
// Shutdown waits for it.
//
// Durability: WAL with synchronous=NORMAL, so a committed batch survives the process being killed
// (power loss may still take the last commits back). A flush callback runs only after the
// records it covers are committed, so nothing acknowledged by a flush is ever lost. A SIGKILL
// loses the records accepted but not yet committed: the open batch, that is at most
// kMaxBatchRecords (512) records or the records of the last kMaxBatchDelay (5 ms) while the
// writer keeps up; if the writer falls behind, also what waits in the queue. Shutdown() (what
// SIGTERM does) commits everything accepted before it returns.
//
// Bad conditions. The store is then not up: discovery leaves it out, records handed to it are
// counted as dropped, the reason is logged once, and the process keeps running.
//  - The state directory cannot be created, or the file cannot be opened or written: not up for
//    the life of the store.
//  - A file that is not a SQLite database or is corrupt at open (SQLITE_NOTADB, SQLITE_CORRUPT):
//    it is never deleted or overwritten. It is renamed, with its -wal and -shm files, to
//    "tavrin.db.corrupt-<YYYYmmddTHHMMSS>" (UTC; ".N" appended if that name is taken) and a fresh
//    store is started; one error line names both paths. If the rename fails the store stays down.
//  - Another process holds the write lock past the busy timeout (SQLITE_BUSY): the batch is
//    tried again, up to 5 times with a doubling pause, before anything is dropped.
//  - The file turns read-only, or the connection loses it (remount, I/O errors): the database is
//    reopened and the batch tried once more, for every batch until it writes again.
//  - A write still fails (a full disk, SQLITE_FULL; the cases above persisting): the batch is
//    rolled back and its records are counted as dropped; the store reports itself not up until a
//    later batch commits, without a restart.

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/Clock.h"
#include "platform/LogSystem.h"
#include "platform/linux/backend/ReportingBackend.h"
#include "platform/linux/time/SystemClock.h"

struct sqlite3;
struct sqlite3_stmt;

namespace tavrin {

struct SqliteStoreOptions {
  // Directory of tavrin.db; created (with its parents) when missing.
  std::string stateDirectory = "/var/lib/tavrin";
  // Stamps records are given by their callers; the store uses the clock for the name of a moved
  // corrupt file and for rate-limiting its drop lines.
  const Clock* clock = &SystemClock();
  // Where the store's lines go; nullptr for the default log.
  LogHandle log;
  size_t queueCapacity = 65536;  // see SqliteStore::kMaxQueuedRecords
  // How long a write waits for another process (sqlite3, tavrinctl) holding the write lock.
  std::chrono::milliseconds busyTimeout{2000};
  // Largest database size in pages of kPageBytes (PRAGMA max_page_count); 0 for no limit but the
  // disk. A write beyond it fails as on a full disk.
  int64_t maxPageCount = 0;
};

class SqliteStore final : public ReportingBackend {
 public:
  static constexpr const char* kFileName = "tavrin.db";
  // SQLite's default page size, which the store never changes.
  static constexpr uint64_t kPageBytes = 4096;
  // A commit costs about as much as a few hundred inserts; 512 makes it a small share of a batch.
  static constexpr size_t kMaxBatchRecords = 512;
  // Bounds how long an accepted record stays uncommitted, and so what a SIGKILL can lose.
  static constexpr Duration kMaxBatchDelay = std::chrono::milliseconds(5);
  // About 13 MB of 200-byte records: rides out a disk stall of several seconds at peak rate.
  static constexpr size_t kMaxQueuedRecords = 65536;

  // Opens (or creates) the store; never throws. When opening fails the store is not up.
  explicit SqliteStore(SqliteStoreOptions options);
  ~SqliteStore() override;

  SqliteStore(const SqliteStore&) = delete;
  SqliteStore& operator=(const SqliteStore&) = delete;

  // "sqlite:<path of tavrin.db>".
  std::string Name() const override;
  bool IsUp() const override;
  bool Append(ReportRecordPtr record) override;
  // After Shutdown the callback is called at once, with an error, on the caller's thread.
  void Flush(FlushCallback done) override;
  BackendStats Stats() const override;
  void Shutdown() override;
  int64_t LastSessionRow() const override { return lastSessionRow_; }
  size_t Backlog() const override { return queued_.load(std::memory_order_relaxed); }
  size_t BacklogCapacity() const override { return options_.queueCapacity; }

  // Records lost so far, for any reason.
  uint64_t DroppedRecords() const { return drops_.Total(); }
  const std::string& Path() const { return path_; }
  // Why the store is not up; empty while it is.
  std::string DownReason() const;

 private:
  enum class State { kUp, kWriteFailing, kFailed, kClosed };
  struct Queued {
    uint64_t seq;
    ReportRecordPtr record;
  };
  struct Waiter {
    uint64_t target;  // the last record it covers
    FlushCallback done;
  };

  // Open helpers, run by the constructor before the writer starts.
  bool Open();
  int OpenDatabase(std::string* reason);
  bool MoveCorruptFilesAside(std::string* movedTo);
  void CloseDatabase();
  void Fail(std::string reason);

  void WriterLoop();
  void WriteBatch(std::deque<Queued>& batch);
  // One transaction of the whole batch, rolled back on failure; the SQLite result code.
  int TryWriteBatch(const std::deque<Queued>& batch);
  // Session messages and analytics events are written by InsertRows, every other record here.
  int WriteRecord(const ReportRecord& record);
  // `rows` in statements of `many` (kRowsPerInsert rows each), the rest one by one with `one`.
  template <typename Record>
  int InsertRows(const std::vector<const Record*>& rows, sqlite3_stmt* many, sqlite3_stmt* one,
                 int columns);
  void AnswerFlushes();
  void SetWriteFailing(const std::string& reason);

  const SqliteStoreOptions options_;
  const std::string path_;
  DropReporter drops_;
  int64_t lastSessionRow_ = 0;

  // Owned by the constructor until the writer starts, then by the writer thread alone.
  sqlite3* db_ = nullptr;
  sqlite3_stmt* insertSession_ = nullptr;
  sqlite3_stmt* insertSessionMessage_ = nullptr;
  sqlite3_stmt* insertSingleMessage_ = nullptr;
  sqlite3_stmt* insertAnalyticsEvent_ = nullptr;
  sqlite3_stmt* insertPowerEvent_ = nullptr;
  sqlite3_stmt* insertSessionMessages_ = nullptr;  // kRowsPerInsert rows
  sqlite3_stmt* insertAnalyticsEvents_ = nullptr;  // kRowsPerInsert rows
  std::vector<std::string> rowTexts_;              // the payload texts of one statement's rows

  std::atomic<State> state_{State::kUp};
  std::atomic<uint64_t> accepted_{0};
  std::atomic<uint64_t> committed_{0};
  std::atomic<size_t> queued_{0};  // queue_.size(), readable without the lock

  mutable std::mutex mutex_;  // guards the fields below
  std::condition_variable wakeup_;
  std::deque<Queued> queue_;
  std::deque<Waiter> waiters_;
  uint64_t acceptedSeq_ = 0;   // seq of the last accepted record
  uint64_t processedSeq_ = 0;  // seq of the last record committed or lost by the writer
  uint64_t lostReported_ = 0;  // drops counted when the last flush was answered
  // The queue length at which Append wakes the writer: 1 while it waits for work, what fills the
  // batch while it gathers one. Waking it for every record cost the appending thread a futex call
  // and the writer a context switch per record.
  size_t wakeAtQueued_ = 1;
  bool stopping_ = false;
  std::string downReason_;

  std::mutex shutdownMutex_;  // one Shutdown at a time
  std::thread writer_;
};

}  // namespace tavrin
