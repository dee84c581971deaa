#pragma once

#include "platform/Clock.h"

namespace tavrin {

// A lock with wait-until-deadline and signal, as used by bounded waits. The lock is not
// recursive. WaitUntil is called with the lock held and returns with it held.
class Condition {
 public:
  virtual ~Condition() = default;
  virtual void Lock() = 0;
  virtual void Unlock() = 0;
  // Waits until Signal() is called or `deadline` (on the condition's clock) passes. Returns true
  // when signalled, false when the deadline was reached first.
  virtual bool WaitUntil(SteadyTime deadline) = 0;
  // Wakes one waiter. Call with the lock held, after setting whatever the waiter tests.
  virtual void Signal() = 0;
  // The clock that deadlines refer to.
  virtual Clock& GetClock() = 0;
};

}  // namespace tavrin
