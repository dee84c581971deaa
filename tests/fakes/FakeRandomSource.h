#pragma once

#include <cstdint>
#include <deque>
#include <initializer_list>
#include <mutex>
#include <vector>

#include <gtest/gtest.h>

#include "platform/RandomSource.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// A RandomSource that answers scripted values in order, then a fixed default, and records every
// bound it was asked for. A bound of zero, or a scripted value outside [0, bound), fails the test:
// the first is a caller bug, the second a test bug. Thread-safe.
class FakeRandom final : public RandomSource, private GuardedState {
 public:
  explicit FakeRandom(uint64_t fallback = 0) : fallback_(fallback) {}

  // Appends values to answer before the default.
  void Script(std::initializer_list<uint64_t> values) {
    WithLock([&] { scripted_.insert(scripted_.end(), values.begin(), values.end()); });
  }

  uint64_t UniformBelow(uint64_t bound) override {
    std::lock_guard lock(mutex_);
    bounds_.push_back(bound);
    uint64_t value = fallback_;
    if (!scripted_.empty()) {
      value = scripted_.front();
      scripted_.pop_front();
    }
    if (bound == 0) {
      ADD_FAILURE() << "UniformBelow(0) asked: the bound must be positive";
      return 0;
    }
    if (value >= bound) {
      ADD_FAILURE() << "FakeRandom scripted " << value << " for UniformBelow(" << bound << ")";
      return bound - 1;
    }
    return value;
  }

  // Every bound asked, in order.
  std::vector<uint64_t> Bounds() const { return Locked(bounds_); }

 private:
  std::deque<uint64_t> scripted_;  // guarded by mutex_
  const uint64_t fallback_;
  std::vector<uint64_t> bounds_;  // guarded by mutex_
};

}  // namespace tavrin::testing
