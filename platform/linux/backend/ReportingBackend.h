#pragma once

// What the reporting back-ends (the SQLite store, Kafka) have in common: the records they take,
// the interface the reporting service drives them through, and the rate-limited drop report.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/Clock.h"
#include "platform/LogSystem.h"
#include "platform/MessageLedger.h"

namespace tavrin {

// One row of `sessions`. Handed over again with `flushedAt` set when the session is flushed; the
// store then updates the row, Kafka publishes the whole record again (consumers upsert by row).
struct SessionRecord {
  int64_t row = 0;
  std::optional<int64_t> reporterId;  // session info "SessionID"; none when absent
  Dictionary sessionInfo;
  Dictionary userInfo;
  double createdAt = 0;
  std::optional<double> flushedAt;
  // Session info "Recovered" is true: the session only carries the summary of a session that was
  // open when an earlier run of the service ended.
  bool recovered = false;
};

// One row of `session_messages`.
struct SessionMessageRecord {
  int64_t sessionRow = 0;
  std::optional<int64_t> reporterId;
  uint16_t category = 0;
  uint16_t type = 0;
  PayloadPtr payload;  // never null
  double receivedAt = 0;
  // The client message this record carries is accounted for through it; none for the service's
  // own records.
  DeliveryReceiptPtr receipt = nullptr;
};

// One row of `single_messages`.
struct SingleMessageRecord {
  Dictionary sessionInfo;
  Dictionary userInfo;
  uint16_t category = 0;
  uint16_t type = 0;
  Dictionary payload;
  double receivedAt = 0;
  DeliveryReceiptPtr receipt = nullptr;
};

// One row of `analytics_events`.
struct AnalyticsEventRecord {
  std::string name;
  Dictionary payload;
  double receivedAt = 0;
};

// One row of `power_events`.
struct PowerEventRecord {
  int32_t agent = 0;
  std::string name;
  Dictionary payload;
  double receivedAt = 0;
};

using ReportRecord = std::variant<SessionRecord, SessionMessageRecord, SingleMessageRecord,
                                  AnalyticsEventRecord, PowerEventRecord>;
// Records are immutable once made, so one copy is shared by every back-end it goes to.
using ReportRecordPtr = std::shared_ptr<const ReportRecord>;

// The table (and Kafka topic suffix) a record belongs to: "sessions", "session_messages",
// "single_messages", "analytics_events" or "power_events".
std::string_view RecordTable(const ReportRecord& record);

// The record as a JSON object with one field per column of its table (dictionaries nested, not as
// text; the store's own `row` of message and event tables is left out, a session's row is kept).
Value RecordJson(const ReportRecord& record);

// The reporter ID a record belongs to, when it has one (sessions and session messages).
std::optional<int64_t> RecordReporterId(const ReportRecord& record);

// The receipt of the client message a record carries; null for the service's own records.
const DeliveryReceiptPtr& RecordReceipt(const ReportRecord& record);
// Tells the record's receipt, when it carries one, what became of it in one back-end. Each
// back-end settles every record it is handed exactly once.
void SettleRecord(const ReportRecord& record, bool delivered,
                  DropReason reason = DropReason::kBackendDown);

// Counts that a person can read about one back-end.
struct BackendStats {
  uint64_t accepted = 0;   // handed over and taken in
  uint64_t committed = 0;  // committed (store) or acknowledged by the brokers (Kafka)
  uint64_t dropped = 0;    // lost for any reason: queue full, back-end down, failed write/delivery
};

using FlushCallback = std::function<void(const OptionalError&)>;

// One reporting back-end. Every method is safe to call from any thread and never blocks on I/O
// (Shutdown excepted).
class ReportingBackend {
 public:
  virtual ~ReportingBackend() = default;
  // What discovery lists for this back-end, e.g. "sqlite:/var/lib/tavrin/tavrin.db".
  virtual std::string Name() const = 0;
  // Whether the back-end can take records now. A back-end that is not up drops what it is handed.
  virtual bool IsUp() const = 0;
  // Hands one record over. False when it was dropped (and counted).
  virtual bool Append(ReportRecordPtr record) = 0;
  // Calls `done` once, from the back-end's own thread (never from the caller's stack), after
  // every record handed over before this call is committed or acknowledged (or given up on);
  // with an error when records were lost since the previous flush answer, or the back-end is
  // not up.
  virtual void Flush(FlushCallback done) = 0;
  virtual BackendStats Stats() const = 0;
  // Commits (or tries to deliver) what was accepted, answers pending flushes and stops the
  // back-end's threads. Records handed over afterwards are dropped. Idempotent. Must not be
  // called from a flush callback.
  virtual void Shutdown() = 0;
  // The highest session row the back-end holds (0 when none), so that new sessions continue the
  // numbering of an existing store.
  virtual int64_t LastSessionRow() const { return 0; }
  // Records taken in and not yet written out, and the number at which the back-end starts
  // dropping (0: it keeps no bounded queue of its own). Cheap: read for every request the service
  // decodes, to slow clients down before records are lost.
  virtual size_t Backlog() const { return 0; }
  virtual size_t BacklogCapacity() const { return 0; }
};
using ReportingBackendPtr = std::unique_ptr<ReportingBackend>;

// Logs dropped records without flooding the log: the first drop writes an error line at once,
// later drops at most one line (with the count since the last line) per kDropLogInterval.
class DropReporter {
 public:
  // Long enough that a sustained overload costs a handful of lines a minute, short enough that a
  // person watching the log sees that drops continue.
  static constexpr Duration kDropLogInterval = std::chrono::seconds(10);

  DropReporter(const Clock& clock, LogHandle log, std::string backendName);

  // Counts `count` dropped records for `reason` and logs when the rate limit allows.
  void Dropped(uint64_t count, std::string_view reason);
  uint64_t Total() const { return total_.load(std::memory_order_relaxed); }

 private:
  const Clock& clock_;
  LogHandle log_;
  std::string backendName_;
  std::atomic<uint64_t> total_{0};
  std::mutex mutex_;  // guards the fields below
  std::optional<SteadyTime> lastLine_;
  uint64_t sinceLastLine_ = 0;
};

}  // namespace tavrin
