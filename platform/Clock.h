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

// Seconds since the epoch, as stored in records.
inline double SecondsSinceEpoch(WallTime time) {
  return std::chrono::duration<double>(time.time_since_epoch()).count();
}

}  // namespace tavrin
