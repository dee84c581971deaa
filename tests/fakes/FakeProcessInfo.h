#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/ProcessInfo.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Process names from a table the test fills.
class FakeProcessInfo final : public ProcessInfo, private GuardedState {
 public:
  int32_t ownPid = 4242;

  void SetCommandName(int32_t pid, std::string name) {
    WithLock([&] { names_[pid] = std::move(name); });
  }
  int32_t OwnProcessIdentifier() const override { return ownPid; }
  std::string OwnProcessName() const override { return "tavrind"; }
  std::optional<std::string> CommandName(int32_t pid) const override {
    std::lock_guard lock(mutex_);
    auto found = names_.find(pid);
    if (found == names_.end()) return std::nullopt;
    return found->second;
  }

 private:
  std::map<int32_t, std::string> names_;
};

}  // namespace tavrin::testing
