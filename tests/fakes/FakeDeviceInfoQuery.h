#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

#include "platform/DeviceInfoQuery.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Device facts from in-memory maps; unknown keys answer the fallback, as the real query does.
// Counts every query per key. Thread-safe.
class FakeDeviceInfo final : public DeviceInfoQuery, private GuardedState {
 public:
  void SetBool(std::string_view key, bool value) {
    WithLock([&] { bools_[std::string(key)] = value; });
  }
  void SetInt32(std::string_view key, int32_t value) {
    WithLock([&] { ints_[std::string(key)] = value; });
  }
  // Runs on the querying thread before each answer, outside the fake's lock (for example to
  // hold a query open while other threads pile up behind a once-only guard).
  void SetQueryHook(std::function<void(std::string_view)> hook) { Set(hook_, std::move(hook)); }

  bool QueryBool(std::string_view key, bool fallback) override {
    RunHook(key);
    std::lock_guard lock(mutex_);
    ++queries_[std::string(key)];
    const auto found = bools_.find(std::string(key));
    return found == bools_.end() ? fallback : found->second;
  }
  int32_t QueryInt32(std::string_view key, int32_t fallback) override {
    RunHook(key);
    std::lock_guard lock(mutex_);
    ++queries_[std::string(key)];
    const auto found = ints_.find(std::string(key));
    return found == ints_.end() ? fallback : found->second;
  }

  size_t QueryCount(std::string_view key) const {
    std::lock_guard lock(mutex_);
    const auto found = queries_.find(std::string(key));
    return found == queries_.end() ? 0 : found->second;
  }

 private:
  void RunHook(std::string_view key) {
    if (const auto hook = Locked(hook_)) hook(key);
  }

  std::map<std::string, bool> bools_;
  std::map<std::string, int32_t> ints_;
  std::map<std::string, size_t> queries_;
  std::function<void(std::string_view)> hook_;
};

}  // namespace tavrin::testing
