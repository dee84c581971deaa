#pragma once

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include <spdlog/sinks/base_sink.h>

namespace tavrin {

// The journal priority of a line written at spdlog level `level`, as the log system maps its own
// levels onto spdlog's: debug 7, info 6, warn (the "default" level) 5 notice, err 3, critical 2.
int JournalPriority(spdlog::level::level_enum level);

// An spdlog sink that writes each line to the systemd journal with fields of its own, so that
// `journalctl TAVRIN_SCOPE=rvrs` finds one scope's lines (spdlog's stock journal sink drops the
// logger's name). Fields sent, in order: MESSAGE (the line as given, unformatted), PRIORITY,
// SYSLOG_IDENTIFIER, TAVRIN_SCOPE (the logger's name) and TAVRIN_SUBSYSTEM (omitted when empty).
class JournalSink final : public spdlog::sinks::base_sink<std::mutex> {
 public:
  // Sends one entry given as "FIELD=value" strings; answers 0 or a negative errno, as
  // sd_journal_sendv does. Tests inject one that records the fields.
  using SendFunction = std::function<int(const std::vector<std::string>& fields)>;

  static constexpr const char* kSyslogIdentifier = "tavrind";

  explicit JournalSink(std::string subsystem, SendFunction send = SendToJournal);

  // The real sender, over sd_journal_sendv.
  static int SendToJournal(const std::vector<std::string>& fields);

  // Entries the sender refused (journal not running, socket buffer full); a person can read it
  // from the service's own diagnostics.
  size_t FailedSends() const;

 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override;
  void flush_() override {}

 private:
  std::string subsystem_;
  SendFunction send_;
  std::atomic<size_t> failedSends_{0};
};

}  // namespace tavrin
