#pragma once

#include <chrono>
#include <cstdint>

namespace tavrin {

using SteadyTime = std::chrono::steady_clock::time_point;
using WallTime = std::chrono::system_clock::time_point;
using Duration = std::chrono::nanoseconds;

// Source of time. The core never reads a clock directly, so tests can move time by hand.
class Clock {
 public:
  virtual ~Clock() = default;
  // Monotonic time, for deadlines and elapsed intervals.
  virtual SteadyTime Now() const = 0;
  // Calendar time, for dates shown to people and stored in records.
  virtual WallTime WallNow() const = 0;
};

// Source of randomness, replaceable in tests.
class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // A uniformly distributed integer in [0, bound); bound > 0.
  virtual uint64_t UniformBelow(uint64_t bound) = 0;
};

// The real clock and a real random source (thread-safe, process-wide).
Clock& SystemClock();
RandomSource& SystemRandom();

// Seconds since the epoch, as stored in records.
double SecondsSinceEpoch(WallTime time);

}  // namespace tavrin
