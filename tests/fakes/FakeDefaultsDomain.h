#pragma once

#include <mutex>

#include "platform/DefaultsDomain.h"

namespace tavrin::testing {

// A defaults domain held in memory.
class FakeDefaultsDomain final : public DefaultsDomain {
 public:
  void Set(const std::string& key, Value value) {
    std::lock_guard lock(mutex_);
    values_[key] = std::move(value);
  }
  void Remove(const std::string& key) {
    std::lock_guard lock(mutex_);
    values_.erase(key);
  }
  Dictionary Read() override {
    std::lock_guard lock(mutex_);
    ++reads_;
    return values_;
  }
  int reads() const {
    std::lock_guard lock(mutex_);
    return reads_;
  }

 private:
  mutable std::mutex mutex_;
  Dictionary values_ = Dictionary::object();
  int reads_ = 0;
};

}  // namespace tavrin::testing
