#pragma once

#include <mutex>
#include <utility>

namespace tavrin {

// The one mutex of a fake's recorded state, which the code under test writes from its threads
// while the test reads: copies out and assignments in, each under the lock.
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

  mutable std::mutex mutex_;
};

}  // namespace tavrin
