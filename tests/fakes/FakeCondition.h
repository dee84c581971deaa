#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Clock.h"
#include "platform/Condition.h"
#include "tests/fakes/FakeClock.h"

namespace tavrin::testing {

// A condition whose waits never block: each WaitUntil plays the next scripted step on the calling
// thread. Its clock (its own, or one shared with other fakes) moves only when a step or the test
// moves it, so deadlines are exact.
// It also checks the lock discipline a real, non-recursive lock would enforce (locking twice,
// unlocking or waiting without the lock) and records every breach in Violations().
// Meant for one test thread; the bookkeeping is locked so a stray second thread is reported by
// the checks rather than racing.
class FakeCondition final : public Condition {
 public:
  // A step run by one WaitUntil. `deadline` is what the waiter asked for; the result is the
  // value WaitUntil returns (true = signalled). The callback may use the condition's clock.
  using Step = std::function<bool(SteadyTime deadline)>;

  // `clock` (not owned) is the clock deadlines refer to; without one the condition has its own.
  explicit FakeCondition(FakeClock* clock = nullptr);

  // The flag that SignalWithFlag steps set. Not owned.
  void SetFlag(bool* flag);

  // Scripted steps, played in the order added. `after` moves the clock before the step's outcome.
  void ScriptSignalWithFlag(Duration after = Duration::zero());
  void ScriptSignalWithoutFlag(Duration after = Duration::zero());
  // Moves the clock to the deadline and reports that it was reached.
  void ScriptTimeOut();
  void Script(Step step);

  // Condition
  void Lock() override;
  void Unlock() override;
  // With nothing scripted, times out (and counts an unscripted wait) so a test cannot hang.
  bool WaitUntil(SteadyTime deadline) override;
  void Signal() override;
  Clock& GetClock() override { return clock_; }

  // Moves the condition's clock forward.
  void Advance(Duration by);
  SteadyTime Now() const { return clock_.Now(); }

  std::vector<SteadyTime> Deadlines() const;
  size_t LockCount() const;
  size_t UnlockCount() const;
  bool IsLocked() const;
  size_t SignalCount() const;
  size_t UnscriptedWaits() const;
  size_t StepsLeft() const;
  std::vector<std::string> Violations() const;

 private:
  void Violation(std::string what);

  // Moves the clock to `time` when that is later than now.
  void AdvanceTo(SteadyTime time);

  FakeClock ownClock_;
  FakeClock& clock_;
  mutable std::mutex mutex_;
  std::deque<Step> steps_;
  std::vector<SteadyTime> deadlines_;
  std::vector<std::string> violations_;
  bool* flag_ = nullptr;
  bool locked_ = false;
  size_t locks_ = 0;
  size_t unlocks_ = 0;
  size_t signals_ = 0;
  size_t unscripted_ = 0;
};

}  // namespace tavrin::testing
