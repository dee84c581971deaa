#include "platform/linux/log/SpdlogLogSystem.h"

#include <limits>

#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/stdout_sinks.h>

#include "platform/linux/log/JournalSink.h"

namespace tavrin {
namespace {

// Prints the log's own level name (spdlog has no "default" level; it is carried as warn).
class LevelNameFlag final : public spdlog::custom_flag_formatter {
 public:
  void format(const spdlog::details::log_msg& msg, const std::tm&,
              spdlog::memory_buf_t& dest) override {
    const std::string_view name = LogLevelName(FromSpdlog(msg.level));
    dest.append(name.data(), name.data() + name.size());
  }
  std::unique_ptr<custom_flag_formatter> clone() const override {
    return std::make_unique<LevelNameFlag>();
  }

 private:
  static LogLevel FromSpdlog(spdlog::level::level_enum level) {
    switch (level) {
      case spdlog::level::trace:
      case spdlog::level::debug:
        return LogLevel::kDebug;
      case spdlog::level::info:
        return LogLevel::kInfo;
      case spdlog::level::warn:
        return LogLevel::kDefault;
      default:
        return LogLevel::kError;
    }
  }
};

}  // namespace

spdlog::level::level_enum SpdlogLevel(LogLevel level) {
  switch (level) {
    case LogLevel::kDebug:
      return spdlog::level::debug;
    case LogLevel::kInfo:
      return spdlog::level::info;
    case LogLevel::kDefault:
      return spdlog::level::warn;
    case LogLevel::kError:
      return spdlog::level::err;
  }
  return spdlog::level::err;
}

std::unique_ptr<spdlog::formatter> MakeLogLineFormatter() {
  auto formatter = std::make_unique<spdlog::pattern_formatter>();
  formatter->add_flag<LevelNameFlag>('*').set_pattern("%Y-%m-%d %H:%M:%S.%e %* %n: %v");
  return formatter;
}

SpdlogLogSystem::Scope::Scope(ScopeInfo info, std::shared_ptr<spdlog::logger> logger)
    : info_(std::move(info)), logger_(std::move(logger)) {}

bool SpdlogLogSystem::Scope::ShouldLog(LogLevel level) const {
  if (!info_.enabled) return false;
  return level != LogLevel::kDebug || verbosity_.load(std::memory_order_relaxed) >= kVerboseLevel;
}

void SpdlogLogSystem::Scope::Write(LogLevel level, std::string_view line) {
  // Also filtered here, for callers that write without asking first.
  if (!ShouldLog(level)) return;
  // The line is finished text: passed as the message, never as a format.
  logger_->log(spdlog::source_loc{}, SpdlogLevel(level),
               spdlog::string_view_t(line.data(), line.size()));
}

int SpdlogLogSystem::VerbosityOf(const Value& value) {
  if (value.is_boolean()) return value.get<bool>() ? kVerboseLevel : 0;
  if (value.is_number_unsigned()) {
    const auto number = value.get<uint64_t>();
    return number > uint64_t(std::numeric_limits<int>::max()) ? std::numeric_limits<int>::max()
                                                              : int(number);
  }
  if (value.is_number_integer()) {
    const auto number = value.get<int64_t>();
    if (number > std::numeric_limits<int>::max()) return std::numeric_limits<int>::max();
    if (number < std::numeric_limits<int>::min()) return std::numeric_limits<int>::min();
    return int(number);
  }
  return 0;
}

SpdlogLogSystem::SpdlogLogSystem(DefaultsDomain& defaults, LogTargetKind target)
    : defaults_(defaults), target_(target) {
  if (target_ == LogTargetKind::kStderr) {
    sharedSink_ = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    sharedSink_->set_formatter(MakeLogLineFormatter());
  }
  defaultScope_ = MakeScope(ScopeInfo{true, 0, kDefaultScopeName, "", kDefaultLogVerbosityKey, 0});
}

SpdlogLogSystem::SpdlogLogSystem(DefaultsDomain& defaults, spdlog::sink_ptr sink)
    : defaults_(defaults), target_(LogTargetKind::kStderr), sharedSink_(std::move(sink)) {
  sharedSink_->set_formatter(MakeLogLineFormatter());
  defaultScope_ = MakeScope(ScopeInfo{true, 0, kDefaultScopeName, "", kDefaultLogVerbosityKey, 0});
}

SpdlogLogSystem::~SpdlogLogSystem() = default;

spdlog::sink_ptr SpdlogLogSystem::SinkFor(const ScopeInfo& info) {
  if (sharedSink_) return sharedSink_;
  // A journal sink per scope: it carries the scope's subsystem field.
  return std::make_shared<JournalSink>(info.subsystem);
}

std::shared_ptr<SpdlogLogSystem::Scope> SpdlogLogSystem::MakeScope(ScopeInfo info) {
  // Not registered with spdlog's global registry: two scopes may share a name, and a scope lives
  // exactly as long as its handles.
  auto logger = std::make_shared<spdlog::logger>(info.name, SinkFor(info));
  logger->set_level(spdlog::level::trace);  // filtering is the scope's own
  logger->flush_on(spdlog::level::trace);   // a line is out before the next one is formatted
  return std::make_shared<Scope>(std::move(info), std::move(logger));
}

LogHandle SpdlogLogSystem::RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                                            std::string_view subsystem,
                                            std::string_view verbosityKey, int level) {
  auto scope = MakeScope(ScopeInfo{enabled, code, std::string(scopeName), std::string(subsystem),
                                   std::string(verbosityKey), level});
  if (!scope->Info().verbosityKey.empty()) {
    const Dictionary settings = defaults_.Read();
    if (settings.is_object()) {
      const auto found = settings.find(scope->Info().verbosityKey);
      if (found != settings.end()) scope->SetVerbosity(VerbosityOf(*found));
    }
  }
  std::lock_guard lock(mutex_);
  std::erase_if(scopes_, [](const std::weak_ptr<Scope>& weak) { return weak.expired(); });
  scopes_.push_back(scope);
  return scope;
}

LogScope& SpdlogLogSystem::DefaultLog() { return *defaultScope_; }

void SpdlogLogSystem::Refresh() {
  std::vector<std::shared_ptr<Scope>> live;
  {
    std::lock_guard lock(mutex_);
    std::erase_if(scopes_, [](const std::weak_ptr<Scope>& weak) { return weak.expired(); });
    for (const auto& weak : scopes_) {
      if (auto scope = weak.lock()) live.push_back(std::move(scope));
    }
  }
  live.push_back(defaultScope_);
  // Read outside the lock: a defaults domain that fails to parse logs through this system.
  const Dictionary settings = defaults_.Read();
  for (const auto& scope : live) {
    const std::string& key = scope->Info().verbosityKey;
    if (key.empty()) continue;
    int verbosity = 0;
    if (settings.is_object()) {
      const auto found = settings.find(key);
      if (found != settings.end()) verbosity = VerbosityOf(*found);
    }
    scope->SetVerbosity(verbosity);
  }
}

}  // namespace tavrin
