#pragma once

#include <chrono>
#include <mutex>

#include <gtest/gtest.h>

#include "platform/Clock.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// A clock that moves only when the test moves it. Thread-safe: code under test may read it from
// any thread while the test advances it.
class FakeClock final : public Clock, private GuardedState {
 public:
  // 2026-11-16 05:27:45 UTC: a fixed date, so records and file names are reproducible.
  static constexpr WallTime kStartWallTime =
      WallTime(std::chrono::sys_days(std::chrono::year(2026) / 11 / 16)) + std::chrono::hours(5) +
      std::chrono::minutes(27) + std::chrono::seconds(45);
  // Well away from the steady clock's epoch, so that "now minus a while" stays meaningful.
  static constexpr SteadyTime kStartSteadyTime = SteadyTime(std::chrono::hours(1000));

  SteadyTime Now() const override { return Locked(now_); }
  WallTime WallNow() const override { return Locked(wallNow_); }

  // Moves both times forward by `duration`. Time never goes back: a negative duration is a test
  // bug and fails the test.
  void Advance(Duration duration) {
    if (duration < Duration::zero()) {
      ADD_FAILURE() << "FakeClock::Advance with a negative duration";
      return;
    }
    std::lock_guard lock(mutex_);
    now_ += duration;
    wallNow_ += duration;
  }

 private:
  SteadyTime now_ = kStartSteadyTime;  // guarded by mutex_
  WallTime wallNow_ = kStartWallTime;  // guarded by mutex_
};

}  // namespace tavrin::testing
