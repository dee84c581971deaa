#pragma once

#include <mutex>
#include <utility>

namespace tavrin {

// The one mutex of a fake's recorded state, which the code under test writes from its threads
// while the test reads: copies out, assignments in and other steps, each under the lock.
class GuardedState {
 protected:
  template <typename T>
  T Locked(const T& member) const {
    std::lock_guard lock(mutex_);
    return member;
  }
  template <typename T>
  void Set(T& member, T value) {
    std::lock_guard lock(mutex_);
    member = std::move(value);
  }
  template <typename Step>
  auto WithLock(Step step) const {
    std::lock_guard lock(mutex_);
    return step();
  }

  mutable std::mutex mutex_;
};

}  // namespace tavrin
