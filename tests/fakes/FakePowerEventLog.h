#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/PowerEventLog.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Records every power event. Thread-safe.
class FakePowerEventLog final : public PowerEventLog, private GuardedState {
 public:
  struct Event {
    int32_t agent = 0;
    std::string name;
    Dictionary payload;
    std::optional<Dictionary> extra;  // the fourth argument, when one was given
  };

  void LogRegisteredEvent(int32_t agent, const std::string& name, const Dictionary& payload,
                          const Dictionary* extra) override {
    std::lock_guard lock(mutex_);
    events_.push_back(
        Event{agent, name, payload, extra ? std::optional<Dictionary>(*extra) : std::nullopt});
  }

  std::vector<Event> Events() const { return Locked(events_); }

 private:
  std::vector<Event> events_;  // guarded by mutex_
};

}  // namespace tavrin::testing
