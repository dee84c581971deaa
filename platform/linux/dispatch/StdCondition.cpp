#include "platform/linux/dispatch/StdCondition.h"

#include "platform/linux/time/SystemClock.h"

#include <condition_variable>
#include <cstdint>
#include <mutex>

namespace tavrin {
namespace {

class StdCondition final : public Condition {
 public:
  void Lock() override { mutex_.lock(); }
  void Unlock() override { mutex_.unlock(); }

  bool WaitUntil(SteadyTime deadline) override {
    // Signals are counted so that a spurious wake-up is not mistaken for a signal.
    const uint64_t seen = signals_;
    std::unique_lock lock(mutex_, std::adopt_lock);
    const bool signalled = condition_.wait_until(lock, deadline, [&] { return signals_ != seen; });
    lock.release();
    return signalled;
  }

  void Signal() override {
    ++signals_;
    condition_.notify_one();
  }

  Clock& GetClock() override { return SystemClock(); }

 private:
  std::mutex mutex_;
  std::condition_variable condition_;
  uint64_t signals_ = 0;  // guarded by mutex_
};

}  // namespace

std::unique_ptr<Condition> MakeCondition() { return std::make_unique<StdCondition>(); }

}  // namespace tavrin
