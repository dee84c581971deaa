#pragma once

#include <cstddef>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/OrientationRegistry.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Orientation callbacks that fire only when the test says so, on the test's thread (standing in
// for the registry's own thread). Keeps the real contract: once Unregister returns, the
// callbacks of that id are not called again, even when another thread is firing meanwhile.
// Callbacks must not register or unregister from inside a firing. Thread-safe.
class FakeOrientationRegistry final : public OrientationRegistry, private GuardedState {
 public:
  enum class Kind { kDevice, kUI };
  // One registration or unregistration, in call order.
  struct Change {
    Kind kind;
    bool registered;  // false: unregistered
    std::string id;
    bool operator==(const Change&) const = default;
  };

  void RegisterDeviceOrientation(const std::string& id, Callback callback) override {
    Register(Kind::kDevice, id, std::move(callback));
  }
  void RegisterUIOrientation(const std::string& id, Callback callback) override {
    Register(Kind::kUI, id, std::move(callback));
  }
  void UnregisterDeviceOrientation(const std::string& id) override {
    Unregister(Kind::kDevice, id);
  }
  void UnregisterUIOrientation(const std::string& id) override { Unregister(Kind::kUI, id); }

  // The text given to the value by SetText, else the value itself.
  std::string OrientationToString(const OrientationValue& value) override {
    std::lock_guard lock(mutex_);
    const auto found = texts_.find(value);
    return found == texts_.end() ? value : found->second;
  }
  void SetText(const OrientationValue& value, std::string text) {
    WithLock([&] { texts_[value] = std::move(text); });
  }

  // Calls every registered callback of the kind with `value`; returns how many were called.
  size_t FireDevice(const OrientationValue& value) { return Fire(Kind::kDevice, value); }
  size_t FireUI(const OrientationValue& value) { return Fire(Kind::kUI, value); }

  bool IsRegistered(Kind kind, const std::string& id) const {
    return WithLock([&] { return callbacks_[size_t(kind)].count(id) > 0; });
  }
  size_t RegisteredCount(Kind kind) const {
    return WithLock([&] { return callbacks_[size_t(kind)].size(); });
  }
  std::vector<Change> History() const { return Locked(history_); }
  // Drops every callback (and what they hold), as a registry that goes away does.
  void Clear() {
    ByID dropped[2];  // released after the locks
    {
      std::lock_guard firing(fireMutex_);
      std::lock_guard lock(mutex_);
      std::swap(dropped, callbacks_);
    }
  }

 private:
  using ByID = std::map<std::string, Callback>;

  void Register(Kind kind, const std::string& id, Callback callback) {
    Callback previous;
    std::lock_guard lock(mutex_);
    previous = std::exchange(callbacks_[size_t(kind)][id], std::move(callback));
    history_.push_back(Change{kind, true, id});
  }

  void Unregister(Kind kind, const std::string& id) {
    Callback removed;  // released after the locks: it may hold the last reference to its owner
    {
      std::lock_guard firing(fireMutex_);
      std::lock_guard lock(mutex_);
      auto& callbacks = callbacks_[size_t(kind)];
      const auto found = callbacks.find(id);
      if (found != callbacks.end()) {
        removed = std::move(found->second);
        callbacks.erase(found);
      }
      history_.push_back(Change{kind, false, id});
    }
  }

  size_t Fire(Kind kind, const OrientationValue& value) {
    std::lock_guard firing(fireMutex_);
    std::vector<Callback> callbacks;
    {
      std::lock_guard lock(mutex_);
      for (const auto& entry : callbacks_[size_t(kind)]) callbacks.push_back(entry.second);
    }
    for (const auto& callback : callbacks) callback(value);
    return callbacks.size();
  }

  std::mutex fireMutex_;  // held while callbacks run, so Unregister waits for a firing to end
  ByID callbacks_[2];     // by Kind, guarded by mutex_
  std::map<OrientationValue, std::string> texts_;  // guarded by mutex_
  std::vector<Change> history_;                    // guarded by mutex_
};

}  // namespace tavrin::testing
