#include "platform/linux/backend/ReportingBackend.h"

namespace tavrin {
namespace {

Value OptionalNumber(const std::optional<int64_t>& number) {
  return number ? Value(*number) : Value(nullptr);
}

struct JsonOf {
  Value operator()(const SessionRecord& r) const {
    return Value{{"row", r.row},
                 {"reporter_id", OptionalNumber(r.reporterId)},
                 {"session_info", r.sessionInfo},
                 {"user_info", r.userInfo},
                 {"created_at", r.createdAt},
                 {"flushed_at", r.flushedAt ? Value(*r.flushedAt) : Value(nullptr)},
                 {"recovered", r.recovered}};
  }
  Value operator()(const SessionMessageRecord& r) const {
    return Value{{"session_row", r.sessionRow}, {"reporter_id", OptionalNumber(r.reporterId)},
                 {"category", r.category},      {"type", r.type},
                 {"payload", *r.payload},       {"received_at", r.receivedAt}};
  }
  Value operator()(const SingleMessageRecord& r) const {
    return Value{{"session_info", r.sessionInfo}, {"user_info", r.userInfo},
                 {"category", r.category},        {"type", r.type},
                 {"payload", r.payload},          {"received_at", r.receivedAt}};
  }
  Value operator()(const AnalyticsEventRecord& r) const {
    return Value{{"name", r.name}, {"payload", r.payload}, {"received_at", r.receivedAt}};
  }
  Value operator()(const PowerEventRecord& r) const {
    return Value{{"agent", r.agent},
                 {"name", r.name},
                 {"payload", r.payload},
                 {"received_at", r.receivedAt}};
  }
};

struct TableOf {
  std::string_view operator()(const SessionRecord&) const { return "sessions"; }
  std::string_view operator()(const SessionMessageRecord&) const { return "session_messages"; }
  std::string_view operator()(const SingleMessageRecord&) const { return "single_messages"; }
  std::string_view operator()(const AnalyticsEventRecord&) const { return "analytics_events"; }
  std::string_view operator()(const PowerEventRecord&) const { return "power_events"; }
};

}  // namespace

std::string_view RecordTable(const ReportRecord& record) { return std::visit(TableOf{}, record); }

Value RecordJson(const ReportRecord& record) { return std::visit(JsonOf{}, record); }

std::optional<int64_t> RecordReporterId(const ReportRecord& record) {
  if (const auto* session = std::get_if<SessionRecord>(&record)) return session->reporterId;
  if (const auto* message = std::get_if<SessionMessageRecord>(&record)) return message->reporterId;
  return std::nullopt;
}

DropReporter::DropReporter(const Clock& clock, LogHandle log, std::string backendName)
    : clock_(clock), log_(std::move(log)), backendName_(std::move(backendName)) {}

void DropReporter::Dropped(uint64_t count, std::string_view reason) {
  if (count == 0) return;
  total_.fetch_add(count, std::memory_order_relaxed);
  uint64_t toReport = 0;
  {
    std::lock_guard lock(mutex_);
    sinceLastLine_ += count;
    const SteadyTime now = clock_.Now();
    if (lastLine_ && now - *lastLine_ < kDropLogInterval) return;
    lastLine_ = now;
    toReport = sinceLastLine_;
    sinceLastLine_ = 0;
  }
  TLOG_ERROR(log_, "{}: dropped {} record(s): {} ({} dropped in all)", backendName_, toReport,
             reason, Total());
}

const DeliveryReceiptPtr& RecordReceipt(const ReportRecord& record) {
  static const DeliveryReceiptPtr kNone;
  if (const auto* r = std::get_if<SessionMessageRecord>(&record)) return r->receipt;
  if (const auto* r = std::get_if<SingleMessageRecord>(&record)) return r->receipt;
  return kNone;
}

void SettleRecord(const ReportRecord& record, bool delivered, DropReason reason) {
  Settle(RecordReceipt(record), delivered, reason);
}

}  // namespace tavrin
