#pragma once

#include <mutex>

#include "platform/DefaultsDomain.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// A defaults domain held in memory.
class FakeDefaultsDomain final : public DefaultsDomain, private GuardedState {
 public:
  void Set(const std::string& key, Value value) {
    WithLock([&] { values_[key] = std::move(value); });
  }
  void Remove(const std::string& key) {
    WithLock([&] { values_.erase(key); });
  }
  Dictionary Read() override {
    std::lock_guard lock(mutex_);
    ++reads_;
    return values_;
  }
  int reads() const { return Locked(reads_); }

 private:
  Dictionary values_ = Dictionary::object();
  int reads_ = 0;
};

}  // namespace tavrin::testing
