#include "platform/linux/time/SystemClock.h"

#include <mutex>
#include <random>

namespace tavrin {
namespace {

class RealClock final : public Clock {
 public:
  SteadyTime Now() const override { return std::chrono::steady_clock::now(); }
  WallTime WallNow() const override { return std::chrono::system_clock::now(); }
};

class RealRandom final : public RandomSource {
 public:
  uint64_t UniformBelow(uint64_t bound) override {
    std::lock_guard lock(mutex_);
    return std::uniform_int_distribution<uint64_t>(0, bound - 1)(engine_);
  }

 private:
  std::mutex mutex_;
  std::mt19937_64 engine_{std::random_device{}()};
};

}  // namespace

Clock& SystemClock() {
  static RealClock clock;
  return clock;
}

RandomSource& SystemRandom() {
  static RealRandom random;
  return random;
}

}  // namespace tavrin
