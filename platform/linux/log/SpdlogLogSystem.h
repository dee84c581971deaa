#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include <spdlog/common.h>
#include <spdlog/formatter.h>
#include <spdlog/logger.h>

#include "platform/DefaultsDomain.h"
#include "platform/LogSystem.h"

namespace tavrin {

// Where the log lines go (`--log-target`).
enum class LogTargetKind { kStderr, kJournal };

// The process's log facility over spdlog: one spdlog logger per registered scope, named after the
// scope. A scope's verbosity is the integer value of its verbosity key in the defaults domain
// (true counts as kVerboseLevel, false, a missing key or any other type as 0); debug lines pass
// only at kVerboseLevel or above, every other level passes whenever the scope is enabled.
// Verbosity is read when a scope registers and again on each Refresh() (the service calls it when
// the defaults notification fires). Thread-safe; ShouldLog is one atomic load.
//
// Standard error lines read "<local time> <level> <scope>: <line>", with the levels named debug,
// info, default and error. Journal entries carry the scope and subsystem in fields of their own
// (see JournalSink).
class SpdlogLogSystem final : public LogSystem {
 public:
  static constexpr const char* kDefaultScopeName = "default";
  // The defaults key that switches the default log's debug lines (components without a scope of
  // their own, such as the block throttle, write there), like the scopes' own keys.
  static constexpr const char* kDefaultLogVerbosityKey = "default_log_verbose";

  // `defaults` must outlive this object and every scope it hands out.
  SpdlogLogSystem(DefaultsDomain& defaults, LogTargetKind target);
  // Every scope writes to `sink` (tests; another destination), formatted as standard error is.
  SpdlogLogSystem(DefaultsDomain& defaults, spdlog::sink_ptr sink);
  ~SpdlogLogSystem() override;

  LogHandle RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                             std::string_view subsystem, std::string_view verbosityKey,
                             int level) override;
  LogScope& DefaultLog() override;

  // Re-reads the verbosity of every live scope from the defaults domain.
  void Refresh();

  // What a registration was given, for diagnostics and tests.
  struct ScopeInfo {
    bool enabled;
    uint32_t code;
    std::string name;
    std::string subsystem;
    std::string verbosityKey;
    int level;
  };
  class Scope;

  // The verbosity a defaults value stands for.
  static int VerbosityOf(const Value& value);

 private:
  spdlog::sink_ptr SinkFor(const ScopeInfo& info);
  std::shared_ptr<Scope> MakeScope(ScopeInfo info);

  DefaultsDomain& defaults_;
  LogTargetKind target_;
  spdlog::sink_ptr sharedSink_;  // every scope's sink, except journal scopes (one sink each)
  std::shared_ptr<Scope> defaultScope_;

  std::mutex mutex_;
  std::vector<std::weak_ptr<Scope>> scopes_;  // guarded by mutex_
};

// One scope of SpdlogLogSystem.
class SpdlogLogSystem::Scope final : public LogScope {
 public:
  Scope(ScopeInfo info, std::shared_ptr<spdlog::logger> logger);

  bool ShouldLog(LogLevel level) const override;
  void Write(LogLevel level, std::string_view line) override;

  const ScopeInfo& Info() const { return info_; }
  int Verbosity() const { return verbosity_.load(std::memory_order_relaxed); }
  void SetVerbosity(int verbosity) { verbosity_.store(verbosity, std::memory_order_relaxed); }

 private:
  const ScopeInfo info_;
  const std::shared_ptr<spdlog::logger> logger_;
  std::atomic<int> verbosity_{0};
};

// The formatter of standard error lines.
std::unique_ptr<spdlog::formatter> MakeLogLineFormatter();

// spdlog's level for each of the log's levels; "default" maps to warn, which journals show as
// notice and standard error lines name "default".
spdlog::level::level_enum SpdlogLevel(LogLevel level);

}  // namespace tavrin
