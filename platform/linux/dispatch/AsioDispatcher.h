#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <utility>

#include "platform/Dispatcher.h"

namespace tavrin {

// The service's Dispatcher: one shared pool of threads ("tavrin-pool-<n>") runs every queue.
//
// - Serial queues are strands over the pool: one item at a time, in submission order, on whichever
//   pool thread is free. Each queue keeps its own list of items and occupies a pool thread only
//   while it is running one, so a suspended queue (or an idle one) costs no thread at all. Items
//   queued while suspended wait in that list and start, in order, once the last Resume() comes.
//   Resume() without a matching Suspend() is a programming error and aborts the process.
// - The quality-of-service class is kept as a label: items of every class share the same threads.
// - BackgroundQueue() is concurrent: its items go straight to the pool and may run side by side.
// - AsyncAfter and timers wait on asio steady timers (SystemClock()'s steady time); no thread
//   sleeps. A delay of zero or less runs the work as soon as a thread is free.
// - A Timer's work runs on the queue it was made for. After Cancel() or ScheduleAfter() returns,
//   the work of the earlier arming never starts, even if its expiry was already being handled or
//   its work was already waiting on the queue; work that had started runs to its end. Destroying a
//   Timer cancels it.
// - An exception escaping a work item is logged and counted; the queue carries on with its next
//   item.
// - Shutdown() (also run by the destructor) stops accepting work, cancels every waiting timer and
//   AsyncAfter item, lets items already queued on running queues finish, and joins the threads.
//   Work offered afterwards is dropped and counted; items held by suspended queues never run.
//   Queues and timers may outlive the dispatcher object: they then drop whatever they are given.
class AsioDispatcher final : public Dispatcher {
 public:
  // Two threads: the work queue's decoding and the sessions' appends are short; the store and the
  // throttle have threads of their own.
  static constexpr size_t kDefaultPoolThreads = 2;
  static constexpr const char* kBackgroundLabel = "com.quorvex.tavrin.background";

  explicit AsioDispatcher(size_t poolThreads = kDefaultPoolThreads);
  ~AsioDispatcher() override;
  AsioDispatcher(const AsioDispatcher&) = delete;
  AsioDispatcher& operator=(const AsioDispatcher&) = delete;

  SerialQueuePtr CreateSerialQueue(std::string label, QualityOfService qos) override;
  WorkQueue& BackgroundQueue() override;
  // `queue` may be any WorkQueue (it must outlive the timer); the work is handed to its Async.
  std::unique_ptr<Timer> CreateTimer(WorkQueue& queue, Work work) override;
  void AsyncDeferred(WorkQueue& queue, Duration delay, Work work) override;
  size_t RunDeferredNow() override;
  size_t DeferredCount() const override;
  Clock& GetClock() override;

  // Idempotent and thread-safe; must not be called from a pool thread (it joins them).
  void Shutdown();
  // Waits until every item handed to a queue has run, including items held by suspended queues
  // (they run once their queue resumes), or until `limit` has passed. True when drained. Timers
  // and AsyncAfter items count only once they are due. Must not be called from a pool thread.
  bool WaitUntilDrained(Duration limit);
  // Items handed to queues that have neither run nor been discarded yet.
  uint64_t QueuedItems() const;

  size_t PoolThreadCount() const;
  // Work items, delayed items and timer armings refused or cancelled by Shutdown().
  uint64_t DroppedAtShutdown() const;
  // Work items that ended with an exception.
  uint64_t FailedItems() const;

  class Core;

 private:
  std::shared_ptr<Core> core_;
  // Work of AsyncDeferred not yet handed over, by id: the timer and RunDeferredNow() each take
  // an item out under the lock, so it runs once.
  mutable std::mutex deferredMutex_;
  std::unordered_map<uint64_t, std::pair<WorkQueue*, Work>> deferred_;  // guarded by deferredMutex_
  uint64_t nextDeferredId_ = 0;                                         // guarded by deferredMutex_
  bool deferredReleased_ = false;                                       // guarded by deferredMutex_
};

}  // namespace tavrin
