#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include <fmt/format.h>

#include "base/Dictionary.h"

namespace tavrin {

// Levels of the system log, lowest first. Debug lines of a scope are written only while the scope
// is verbose (its verbosity key in the defaults domain is at kVerboseLevel or above).
enum class LogLevel : uint8_t { kDebug, kInfo, kDefault, kError };

inline constexpr int kVerboseLevel = 5;

std::string_view LogLevelName(LogLevel level);

// One registered log scope. Implementations are thread-safe: any thread may write at any time.
class LogScope {
 public:
  virtual ~LogScope() = default;
  // Cheap: callers test it before formatting, so a line that is filtered out costs no formatting.
  virtual bool ShouldLog(LogLevel level) const = 0;
  // Writes one finished line (prefix included, no trailing newline).
  virtual void Write(LogLevel level, std::string_view line) = 0;
};
using LogHandle = std::shared_ptr<LogScope>;

// The process's log facility. One is installed per process (InstallLogSystem); until then a plain
// standard-error facility serves.
class LogSystem {
 public:
  virtual ~LogSystem() = default;
  // Registers a scope: `enabled` switches it on at all; `code` is its four-character code
  // ('rvrs'); `verbosityKey` names the defaults key whose integer value (booleans count as 0 and
  // kVerboseLevel) sets its verbosity; `level` is kept as given. May return nullptr, in which case
  // callers write to the default log.
  virtual LogHandle RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                                     std::string_view subsystem, std::string_view verbosityKey,
                                     int level) = 0;
  virtual LogScope& DefaultLog() = 0;
};

LogHandle RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                           std::string_view subsystem, std::string_view verbosityKey, int level);
LogScope& DefaultSystemLog();

// Installs `system` as the process's log facility and returns the previous one (nullptr for the
// built-in standard-error one). Call at start-up or from a test fixture, not while other threads
// log. Scopes registered earlier stay with the facility that made them.
LogSystem* InstallLogSystem(LogSystem* system);

constexpr uint32_t FourCharCode(const char (&code)[5]) {
  return (uint32_t(uint8_t(code[0])) << 24) | (uint32_t(uint8_t(code[1])) << 16) |
         (uint32_t(uint8_t(code[2])) << 8) | uint32_t(uint8_t(code[3]));
}

inline LogScope& LogTarget(const LogHandle& handle) {
  return handle ? *handle : DefaultSystemLog();
}
inline LogScope& LogTarget(LogScope& scope) { return scope; }
inline LogScope& LogTarget(std::nullptr_t) { return DefaultSystemLog(); }

namespace log_detail {

constexpr std::string_view BaseName(std::string_view path) {
  const auto slash = path.find_last_of('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

// Formats "<file>:<line>:<function>: " followed by the message and writes it to `scope`.
void WriteLine(LogScope& scope, LogLevel level, std::string_view file, int line,
               std::string_view function, fmt::string_view format, fmt::format_args args);

template <typename... Args>
void Write(LogScope& scope, LogLevel level, std::string_view file, int line,
           std::string_view function, fmt::format_string<Args...> format, Args&&... args) {
  WriteLine(scope, level, file, line, function, format, fmt::make_format_args(args...));
}

}  // namespace log_detail
}  // namespace tavrin

// The operation that log lines name when they are written from a lambda or helper, where
// __func__ would say "operator()". Declared at the top of the operation with TLOG_OPERATION; the
// empty one below stands everywhere else, and __func__ is used.
inline constexpr std::string_view tavrin_log_operation_{};
#define TLOG_OPERATION(name) \
  static constexpr std::string_view tavrin_log_operation_ { name }

// Writes one line with the "file:line:function: " prefix to `target` (a LogHandle, which may be
// null for the default log, or a LogScope&). The format uses fmt's "{}" placeholders; a Value
// prints in its text form. Nothing is formatted when the scope filters the level out.
#define TAVRIN_LOG(target, level, format, ...)                                                \
  do {                                                                                        \
    ::tavrin::LogScope& tavrin_log_scope_ = ::tavrin::LogTarget(target);                      \
    if (tavrin_log_scope_.ShouldLog(level)) {                                                 \
      ::tavrin::log_detail::Write(                                                            \
          tavrin_log_scope_, level, ::tavrin::log_detail::BaseName(__FILE__), __LINE__,       \
          tavrin_log_operation_.empty() ? std::string_view(__func__) : tavrin_log_operation_, \
          format __VA_OPT__(, ) __VA_ARGS__);                                                 \
    }                                                                                         \
  } while (0)

#define TLOG_DEBUG(target, format, ...) \
  TAVRIN_LOG(target, ::tavrin::LogLevel::kDebug, format __VA_OPT__(, ) __VA_ARGS__)
#define TLOG_INFO(target, format, ...) \
  TAVRIN_LOG(target, ::tavrin::LogLevel::kInfo, format __VA_OPT__(, ) __VA_ARGS__)
#define TLOG_DEFAULT(target, format, ...) \
  TAVRIN_LOG(target, ::tavrin::LogLevel::kDefault, format __VA_OPT__(, ) __VA_ARGS__)
#define TLOG_ERROR(target, format, ...) \
  TAVRIN_LOG(target, ::tavrin::LogLevel::kError, format __VA_OPT__(, ) __VA_ARGS__)
