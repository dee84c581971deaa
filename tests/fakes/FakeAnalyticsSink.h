#pragma once

#include <cstddef>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/AnalyticsSink.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Records every analytics event. By default it builds each payload at once, as a sink that
// wants every event does; it can also hold builders for the test to run later, or never call
// them, as a sink switched off does. Thread-safe; builders run outside the lock.
class FakeAnalyticsSink final : public AnalyticsSink, private GuardedState {
 public:
  enum class Builders { kCallAtOnce, kCallLater, kNeverCall };

  struct Event {
    std::string name;
    size_t builderCalls = 0;
    // What the builder returned, once it was called.
    std::optional<Dictionary> payload;
  };

  void SetBuilders(Builders mode) { Set(mode_, mode); }

  void SendEventLazy(const std::string& name, std::function<Dictionary()> buildPayload) override {
    const auto [index, mode] = WithLock([&] {
      events_.push_back(Event{name, 0, std::nullopt});
      builders_.push_back(buildPayload);
      return std::pair(events_.size() - 1, mode_);
    });
    if (mode == Builders::kCallAtOnce) RunBuilder(index);
  }

  // Calls every builder not called yet (kCallLater); returns how many ran.
  size_t RunPendingBuilders() {
    size_t count = 0;
    for (size_t index = 0; index < Events().size(); ++index) {
      if (Events()[index].builderCalls == 0 && RunBuilder(index)) ++count;
    }
    return count;
  }

  std::vector<Event> Events() const { return Locked(events_); }

 private:
  bool RunBuilder(size_t index) {
    const std::function<Dictionary()> builder = Locked(builders_)[index];
    if (!builder) return false;
    Dictionary payload = builder();
    std::lock_guard lock(mutex_);
    ++events_[index].builderCalls;
    events_[index].payload = std::move(payload);
    return true;
  }

  Builders mode_ = Builders::kCallAtOnce;              // guarded by mutex_
  std::vector<Event> events_;                          // guarded by mutex_
  std::vector<std::function<Dictionary()>> builders_;  // guarded by mutex_
};

}  // namespace tavrin::testing
