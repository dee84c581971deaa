#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/LogSystem.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

struct LoggedLine {
  std::string scope;  // "default" for the default system log
  LogLevel level;
  std::string text;
};

// Records every line in memory. Installs itself as the process's log facility for its lifetime;
// scopes it handed out write to the fake installed at the time of writing.
// Scopes are verbose (debug lines pass) unless SetVerbose says otherwise.
class FakeLogSystem final : public LogSystem, private GuardedState {
 public:
  FakeLogSystem();
  ~FakeLogSystem() override;

  LogHandle RegisterLogScope(bool enabled, uint32_t code, std::string_view scopeName,
                             std::string_view subsystem, std::string_view verbosityKey,
                             int level) override;
  LogScope& DefaultLog() override;

  // Makes RegisterLogScope answer nullptr, as a failed registration does.
  void FailRegistrations(bool fail) { Set(failRegistrations_, fail); }
  void SetVerbose(bool verbose) { Set(verbose_, verbose); }

  std::vector<LoggedLine> Lines() const { return Locked(lines_); }
  // Lines whose text contains `needle` (and, when given, have `level`).
  std::vector<LoggedLine> Matching(std::string_view needle) const;
  size_t Count(std::string_view needle, std::optional<LogLevel> level = {}) const;
  bool Contains(std::string_view needle) const { return Count(needle) > 0; }
  // The texts of lines without their "file:line:function: " prefix, of `level` and `scope` when
  // given, in order.
  std::vector<std::string> Messages(std::optional<LogLevel> level = {},
                                    std::string_view scope = {}) const;
  void Clear() {
    WithLock([&] { lines_.clear(); });
  }

  // What RegisterLogScope was asked, by scope name.
  struct Registration {
    bool enabled;
    uint32_t code;
    std::string subsystem;
    std::string verbosityKey;
    int level;
  };
  std::map<std::string, Registration> Registrations() const { return Locked(registrations_); }

 private:
  class Scope;
  void Append(const std::string& scope, LogLevel level, std::string_view text) {
    WithLock([&] { lines_.push_back(LoggedLine{scope, level, std::string(text)}); });
  }
  bool Verbose() const { return Locked(verbose_); }

  std::vector<LoggedLine> lines_;
  std::map<std::string, Registration> registrations_;
  bool failRegistrations_ = false;
  bool verbose_ = true;
  std::shared_ptr<Scope> defaultScope_;
  LogSystem* previous_ = nullptr;
  FakeLogSystem* previousRecording_ = nullptr;
};

}  // namespace tavrin::testing
