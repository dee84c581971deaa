#include "tests/fakes/FakeCondition.h"

#include <utility>

namespace tavrin::testing {

FakeCondition::FakeCondition(FakeClock* clock) : clock_(clock ? *clock : ownClock_) {}

void FakeCondition::AdvanceTo(SteadyTime time) {
  const SteadyTime now = clock_.Now();
  if (time > now) clock_.Advance(time - now);
}

void FakeCondition::SetFlag(bool* flag) {
  std::lock_guard lock(mutex_);
  flag_ = flag;
}

void FakeCondition::ScriptSignalWithFlag(Duration after) {
  Script([this, after](SteadyTime) {
    clock_.Advance(after);
    // As the signalling thread does: set the flag under the lock, then signal.
    Lock();
    bool* flag = nullptr;
    {
      std::lock_guard lock(mutex_);
      flag = flag_;
    }
    if (flag == nullptr) {
      Violation("ScriptSignalWithFlag played without SetFlag");
    } else {
      *flag = true;
    }
    Signal();
    Unlock();
    return true;
  });
}

void FakeCondition::ScriptSignalWithoutFlag(Duration after) {
  Script([this, after](SteadyTime) {
    clock_.Advance(after);
    Lock();
    Signal();
    Unlock();
    return true;
  });
}

void FakeCondition::ScriptTimeOut() {
  Script([this](SteadyTime deadline) {
    AdvanceTo(deadline);
    return false;
  });
}

void FakeCondition::Script(Step step) {
  std::lock_guard lock(mutex_);
  steps_.push_back(std::move(step));
}

void FakeCondition::Lock() {
  std::lock_guard lock(mutex_);
  ++locks_;
  if (locked_) violations_.push_back("Lock while already locked (the lock is not recursive)");
  locked_ = true;
}

void FakeCondition::Unlock() {
  std::lock_guard lock(mutex_);
  ++unlocks_;
  if (!locked_) violations_.push_back("Unlock without the lock held");
  locked_ = false;
}

bool FakeCondition::WaitUntil(SteadyTime deadline) {
  Step step;
  {
    std::lock_guard lock(mutex_);
    deadlines_.push_back(deadline);
    if (!locked_) violations_.push_back("WaitUntil without the lock held");
    // A real wait releases the lock while it sleeps, so the signalling side can take it.
    locked_ = false;
    if (!steps_.empty()) {
      step = std::move(steps_.front());
      steps_.pop_front();
    } else {
      ++unscripted_;
    }
  }
  // Like a real wait, the lock is held again on every way out, a throwing step included.
  auto relock = [this] {
    std::lock_guard lock(mutex_);
    if (locked_) violations_.push_back("a wait step left the lock held");
    locked_ = true;
  };
  bool signalled = false;
  try {
    if (step) {
      signalled = step(deadline);
    } else {
      AdvanceTo(deadline);
    }
  } catch (...) {
    relock();
    throw;
  }
  relock();
  return signalled;
}

void FakeCondition::Signal() {
  std::lock_guard lock(mutex_);
  ++signals_;
  if (!locked_) violations_.push_back("Signal without the lock held");
}

void FakeCondition::Advance(Duration by) { clock_.Advance(by); }

std::vector<SteadyTime> FakeCondition::Deadlines() const {
  std::lock_guard lock(mutex_);
  return deadlines_;
}

size_t FakeCondition::LockCount() const {
  std::lock_guard lock(mutex_);
  return locks_;
}

size_t FakeCondition::UnlockCount() const {
  std::lock_guard lock(mutex_);
  return unlocks_;
}

bool FakeCondition::IsLocked() const {
  std::lock_guard lock(mutex_);
  return locked_;
}

size_t FakeCondition::SignalCount() const {
  std::lock_guard lock(mutex_);
  return signals_;
}

size_t FakeCondition::UnscriptedWaits() const {
  std::lock_guard lock(mutex_);
  return unscripted_;
}

size_t FakeCondition::StepsLeft() const {
  std::lock_guard lock(mutex_);
  return steps_.size();
}

std::vector<std::string> FakeCondition::Violations() const {
  std::lock_guard lock(mutex_);
  return violations_;
}

void FakeCondition::Violation(std::string what) {
  std::lock_guard lock(mutex_);
  violations_.push_back(std::move(what));
}

}  // namespace tavrin::testing
