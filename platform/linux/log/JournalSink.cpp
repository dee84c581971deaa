#include "platform/linux/log/JournalSink.h"

#include <sys/uio.h>
#include <systemd/sd-journal.h>

#include <fmt/format.h>

namespace tavrin {

int JournalPriority(spdlog::level::level_enum level) {
  switch (level) {
    case spdlog::level::trace:
    case spdlog::level::debug:
      return 7;  // LOG_DEBUG
    case spdlog::level::info:
      return 6;  // LOG_INFO
    case spdlog::level::warn:
      return 5;  // LOG_NOTICE
    case spdlog::level::err:
      return 3;  // LOG_ERR
    case spdlog::level::critical:
      return 2;  // LOG_CRIT
    default:
      return 5;
  }
}

JournalSink::JournalSink(std::string subsystem, SendFunction send)
    : subsystem_(std::move(subsystem)), send_(std::move(send)) {}

int JournalSink::SendToJournal(const std::vector<std::string>& fields) {
  std::vector<iovec> vectors;
  vectors.reserve(fields.size());
  for (const auto& field : fields) {
    vectors.push_back(iovec{const_cast<char*>(field.data()), field.size()});
  }
  // sd_journal_sendv takes each field verbatim (no format string), so a line holding '%' or a
  // newline arrives unchanged.
  return sd_journal_sendv(vectors.data(), static_cast<int>(vectors.size()));
}

size_t JournalSink::FailedSends() const { return failedSends_.load(std::memory_order_relaxed); }

void JournalSink::sink_it_(const spdlog::details::log_msg& msg) {
  std::vector<std::string> fields;
  fields.reserve(5);
  fields.push_back(fmt::format("MESSAGE={}", msg.payload));
  fields.push_back(fmt::format("PRIORITY={}", JournalPriority(msg.level)));
  fields.push_back(fmt::format("SYSLOG_IDENTIFIER={}", kSyslogIdentifier));
  fields.push_back(fmt::format("TAVRIN_SCOPE={}", msg.logger_name));
  if (!subsystem_.empty()) fields.push_back(fmt::format("TAVRIN_SUBSYSTEM={}", subsystem_));
  if (send_(fields) < 0) failedSends_.fetch_add(1, std::memory_order_relaxed);
}

}  // namespace tavrin
