#include "tests/fakes/FakeLogSystem.h"

#include <algorithm>
#include <atomic>
#include <regex>

namespace tavrin::testing {

namespace {
// The fake that records right now. Code under test keeps some scopes for the life of the process
// (registered once, in a function-local static), so a scope must not point at the fixture that
// happened to register it: it writes to whichever fake is installed when the line is written.
std::atomic<FakeLogSystem*> recording{nullptr};
}  // namespace

class FakeLogSystem::Scope final : public LogScope {
 public:
  explicit Scope(std::string name) : name_(std::move(name)) {}
  bool ShouldLog(LogLevel level) const override {
    FakeLogSystem* owner = recording.load(std::memory_order_acquire);
    return owner ? level != LogLevel::kDebug || owner->Verbose()
                 : DefaultSystemLog().ShouldLog(level);
  }
  void Write(LogLevel level, std::string_view line) override {
    if (FakeLogSystem* owner = recording.load(std::memory_order_acquire)) {
      owner->Append(name_, level, line);
    } else {
      DefaultSystemLog().Write(level, line);
    }
  }

 private:
  std::string name_;
};

FakeLogSystem::FakeLogSystem()
    : defaultScope_(std::make_shared<Scope>("default")),
      previous_(InstallLogSystem(this)),
      previousRecording_(recording.exchange(this, std::memory_order_acq_rel)) {}

FakeLogSystem::~FakeLogSystem() {
  recording.store(previousRecording_, std::memory_order_release);
  InstallLogSystem(previous_);
}

LogHandle FakeLogSystem::RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                                          std::string_view subsystem, std::string_view verbosityKey,
                                          int level) {
  std::lock_guard lock(mutex_);
  registrations_[std::string(scopeName)] =
      Registration{enabled, code, std::string(subsystem), std::string(verbosityKey), level};
  if (failRegistrations_) return nullptr;
  return std::make_shared<Scope>(std::string(scopeName));
}

LogScope& FakeLogSystem::DefaultLog() { return *defaultScope_; }

std::vector<LoggedLine> FakeLogSystem::Matching(std::string_view needle) const {
  std::vector<LoggedLine> found;
  for (const auto& line : Lines()) {
    if (line.text.find(needle) != std::string::npos) found.push_back(line);
  }
  return found;
}

size_t FakeLogSystem::Count(std::string_view needle, std::optional<LogLevel> level) const {
  return static_cast<size_t>(std::ranges::count_if(
      Matching(needle), [&](const LoggedLine& line) { return !level || line.level == *level; }));
}

std::vector<std::string> FakeLogSystem::Messages(std::optional<LogLevel> level,
                                                 std::string_view scope) const {
  static const std::regex prefix("^[^:]+:[0-9]+:.*?: ");
  std::vector<std::string> messages;
  for (const auto& line : Lines()) {
    if ((level && line.level != *level) || (!scope.empty() && line.scope != scope)) continue;
    messages.push_back(
        std::regex_replace(line.text, prefix, "", std::regex_constants::format_first_only));
  }
  return messages;
}

}  // namespace tavrin::testing
