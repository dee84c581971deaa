#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Clock.h"

namespace tavrin {

// Quality-of-service classes of work queues, most urgent first. Kept as a label and mapped to a
// thread priority where the implementation has one.
enum class QualityOfService { kUserInteractive, kUserInitiated, kDefault, kUtility, kBackground };

using Work = std::function<void()>;

// A queue of work items. Work never runs on the caller's stack: Async returns at once.
class WorkQueue {
 public:
  virtual ~WorkQueue() = default;
  virtual void Async(Work work) = 0;
  // Runs `work` on this queue once `delay` has passed (on a timer, never a sleeping thread).
  virtual void AsyncAfter(Duration delay, Work work) = 0;
  virtual const std::string& Label() const = 0;
  virtual QualityOfService Qos() const = 0;
};

// A queue that runs one item at a time, in submission order, on some pool thread.
class SerialQueue : public WorkQueue {
 public:
  // Stops the queue from starting further items; the running item (if any) finishes. A suspended
  // queue holds no thread. Suspensions count: each Suspend needs one Resume.
  virtual void Suspend() = 0;
  virtual void Resume() = 0;
  // True on the thread while it runs an item of this queue.
  virtual bool IsCurrent() const = 0;
  // Runs `work` on the calling thread, before returning, when the queue is idle (nothing queued,
  // nothing running, not suspended); otherwise as Async. For a caller that waits for the item's
  // answer and whose thread may do the queue's short work itself: the item runs in its place in
  // the queue's order, without a hand-over to another thread and back. Implementations without a
  // cheaper road may queue it.
  virtual void RunOrAsync(Work work) { Async(std::move(work)); }
};
using SerialQueuePtr = std::shared_ptr<SerialQueue>;

// A one-shot timer with a movable fire date. After Cancel() or a new ScheduleAfter(), the work of
// the earlier arming never runs, even if its expiry was already being processed.
class Timer {
 public:
  virtual ~Timer() = default;
  virtual void ScheduleAfter(Duration delay) = 0;
  virtual void Cancel() = 0;
};

// Makes queues and timers. One per process in the service; tests use a manual fake.
class Dispatcher {
 public:
  virtual ~Dispatcher() = default;
  virtual SerialQueuePtr CreateSerialQueue(std::string label, QualityOfService qos) = 0;
  // The process-wide background-priority concurrent queue.
  virtual WorkQueue& BackgroundQueue() = 0;
  // A timer that runs `work` on `queue` each time it fires; the queue must outlive the timer.
  virtual std::unique_ptr<Timer> CreateTimer(WorkQueue& queue, Work work) = 0;
  // Runs `work` on `queue` once `delay` has passed, or earlier when RunDeferredNow() is called:
  // for work that may be held back but must not be lost when the process stops.
  virtual void AsyncDeferred(WorkQueue& queue, Duration delay, Work work) = 0;
  // Hands every item still held back by AsyncDeferred to its queue now; returns how many. Each
  // item runs once, whichever comes first. From then on AsyncDeferred holds nothing back: work
  // still queued when the service stops may defer more, and that must not be lost either.
  virtual size_t RunDeferredNow() = 0;
  // Items of AsyncDeferred not yet handed to their queue.
  virtual size_t DeferredCount() const = 0;
  // The clock behind every delay of this dispatcher.
  virtual Clock& GetClock() = 0;
};

}  // namespace tavrin
