#include "platform/LogSystem.h"

#include <atomic>
#include <cstdio>
#include <mutex>
#include <string>

namespace tavrin {
namespace {

// Used until a facility is installed: writes every non-debug line to standard error.
class StandardErrorLog final : public LogScope, public LogSystem {
 public:
  bool ShouldLog(LogLevel level) const override { return level != LogLevel::kDebug; }
  void Write(LogLevel level, std::string_view line) override {
    std::lock_guard lock(mutex_);
    fmt::print(stderr, "[{}] {}\n", LogLevelName(level), line);
  }
  LogHandle RegisterLogScope(bool, uint32_t, std::string_view, std::string_view, std::string_view,
                             int) override {
    return nullptr;
  }
  LogScope& DefaultLog() override { return *this; }

 private:
  std::mutex mutex_;
};

StandardErrorLog& BuiltInLog() {
  static StandardErrorLog log;
  return log;
}

std::atomic<LogSystem*> installed{nullptr};

LogSystem& CurrentLogSystem() {
  LogSystem* system = installed.load(std::memory_order_acquire);
  return system ? *system : BuiltInLog();
}

}  // namespace

std::string_view LogLevelName(LogLevel level) {
  switch (level) {
    case LogLevel::kDebug:
      return "debug";
    case LogLevel::kInfo:
      return "info";
    case LogLevel::kDefault:
      return "default";
    case LogLevel::kError:
      return "error";
  }
  return "unknown";
}

LogHandle RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                           std::string_view subsystem, std::string_view verbosityKey, int level) {
  return CurrentLogSystem().RegisterLogScope(enabled, code, scopeName, subsystem, verbosityKey,
                                             level);
}

LogScope& DefaultSystemLog() { return CurrentLogSystem().DefaultLog(); }

LogSystem* InstallLogSystem(LogSystem* system) {
  return installed.exchange(system, std::memory_order_acq_rel);
}

namespace log_detail {

void WriteLine(LogScope& scope, LogLevel level, std::string_view file, int line,
               std::string_view function, fmt::string_view format, fmt::format_args args) {
  fmt::memory_buffer buffer;
  fmt::format_to(std::back_inserter(buffer), "{}:{}:{}: ", file, line, function);
  fmt::vformat_to(std::back_inserter(buffer), format, args);
  scope.Write(level, std::string_view(buffer.data(), buffer.size()));
}

}  // namespace log_detail
}  // namespace tavrin
