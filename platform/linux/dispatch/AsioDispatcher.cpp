// asio's handler invocation uses std::atomic_thread_fence, which GCC flags under ThreadSanitizer
// (-Wtsan). The pool's hand-offs are ordered by asio's scheduler mutex, which TSan does see. Set
// before any include, since the warning is attributed to the standard <atomic> header.
#if defined(__SANITIZE_THREAD__)
#pragma GCC diagnostic ignored "-Wtsan"
#endif

#include "platform/linux/dispatch/AsioDispatcher.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include "platform/LogSystem.h"
#include "platform/linux/time/SystemClock.h"

namespace tavrin {
namespace {

// After this many items in a row, a serial queue goes to the back of the pool's line, so that one
// busy queue cannot keep the shared threads from the others.
constexpr size_t kMaxItemsPerTurn = 16;
// More threads than this only add contention on the pool's single handler queue.
constexpr size_t kMaxPoolThreads = 64;

[[noreturn]] void Fatal(const char* message) {
  std::fprintf(stderr, "tavrin: %s\n", message);
  std::fflush(stderr);
  std::abort();
}

// The serial queue whose item this thread is running, for IsCurrent().
thread_local const void* tCurrentQueue = nullptr;
// The dispatcher whose pool this thread belongs to, so Shutdown() can refuse to join itself.
thread_local const void* tPoolOwner = nullptr;

}  // namespace

struct TimerState;

class AsioDispatcher::Core {
 public:
  explicit Core(size_t threads);
  ~Core() { Shutdown(); }

  bool Accepting() const { return !stopping_.load(std::memory_order_acquire); }
  void CountDropped(uint64_t count = 1) { dropped_.fetch_add(count, std::memory_order_relaxed); }
  uint64_t Dropped() const { return dropped_.load(std::memory_order_relaxed); }
  uint64_t Failed() const { return failed_.load(std::memory_order_relaxed); }
  size_t ThreadCount() const { return threads_.size(); }
  asio::io_context& Io() { return io_; }
  WorkQueue& Background() { return *background_; }

  // Hands `handler` to the pool. Returns false (and drops it) once the pool has been joined.
  template <typename Handler>
  bool Post(Handler&& handler) {
    std::lock_guard lock(mutex_);
    if (joined_) return false;
    asio::post(io_, [this, handler = std::forward<Handler>(handler)]() mutable {
      if (discarding_.load(std::memory_order_acquire)) return;
      handler();
    });
    return true;
  }

  // Runs `fire` on a pool thread once `delay` has passed, unless Shutdown() comes first.
  void After(Duration delay, std::function<void()> fire);

  // Runs one work item; an exception is logged and counted, never passed on to the pool.
  void RunItem(const std::string& label, Work& work);

  // Items handed to a queue and not yet run or discarded, suspended queues' items included.
  void ItemsQueued(uint64_t count = 1) { queued_.fetch_add(count, std::memory_order_relaxed); }
  void ItemsGone(uint64_t count = 1) {
    if (count == 0) return;
    if (queued_.fetch_sub(count, std::memory_order_acq_rel) == count) {
      std::lock_guard lock(drainMutex_);
      drained_.notify_all();
    }
  }
  uint64_t Queued() const { return queued_.load(std::memory_order_acquire); }
  bool WaitUntilDrained(Duration limit) {
    std::unique_lock lock(drainMutex_);
    return drained_.wait_for(lock, limit, [this] { return Queued() == 0; });
  }

  void RegisterTimer(const std::shared_ptr<TimerState>& state);
  void UnregisterTimer(const TimerState* state);

  void Shutdown();

 private:
  void ThreadMain(size_t index);

  asio::io_context io_;
  asio::executor_work_guard<asio::io_context::executor_type> guard_;
  std::vector<std::thread> threads_;
  std::unique_ptr<WorkQueue> background_;

  std::mutex shutdownMutex_;  // serialises Shutdown(); guards finished_
  bool finished_ = false;

  std::mutex mutex_;  // guards joined_, delayed_, nextDelayedId_, timers_
  bool joined_ = false;
  uint64_t nextDelayedId_ = 0;
  std::unordered_map<uint64_t, std::unique_ptr<asio::steady_timer>> delayed_;
  std::unordered_map<const TimerState*, std::weak_ptr<TimerState>> timers_;

  std::atomic<bool> stopping_{false};
  std::atomic<bool> discarding_{false};
  std::atomic<uint64_t> dropped_{0};
  std::atomic<uint64_t> failed_{0};
  std::atomic<uint64_t> queued_{0};
  std::mutex drainMutex_;
  std::condition_variable drained_;
};

namespace {

// The items of one serial queue, first in first out. Holds no memory while it never had items
// and little once drained: every session has a queue, most of them idle, and std::deque's first
// 512-byte block was a tenth of an idle session's memory.
class WorkFifo {
 public:
  bool empty() const { return head_ == items_.size(); }
  size_t size() const { return items_.size() - head_; }
  void push_back(Work work) { items_.push_back(std::move(work)); }
  Work pop_front() {
    Work work = std::move(items_[head_++]);
    if (head_ == items_.size()) {
      head_ = 0;
      // Drained: a small buffer is kept for the next item, a burst's is given back.
      if (items_.capacity() > kKeptCapacity) {
        items_ = {};
      } else {
        items_.clear();
      }
    } else if (head_ >= kKeptCapacity && 2 * head_ >= items_.size()) {
      // A queue that never drains does not keep what it has run.
      items_.erase(items_.begin(), items_.begin() + static_cast<ptrdiff_t>(head_));
      head_ = 0;
    }
    return work;
  }

 private:
  static constexpr size_t kKeptCapacity = 8;
  std::vector<Work> items_;
  size_t head_ = 0;  // items_[0..head_) have been taken
};

class AsioSerialQueue final : public SerialQueue,
                              public std::enable_shared_from_this<AsioSerialQueue> {
 public:
  AsioSerialQueue(std::shared_ptr<AsioDispatcher::Core> core, std::string label,
                  QualityOfService qos)
      : core_(std::move(core)), label_(std::move(label)), qos_(qos) {}

  ~AsioSerialQueue() override { core_->ItemsGone(items_.size()); }

  void Async(Work work) override {
    if (!Admit(work)) return;
    bool schedule = false;
    {
      std::lock_guard lock(mutex_);
      core_->ItemsQueued();
      items_.push_back(std::move(work));
      if (!scheduled_ && suspensions_ == 0) schedule = scheduled_ = true;
    }
    if (schedule) SchedulePump();
  }

  void AsyncAfter(Duration delay, Work work) override {
    if (!work) return;
    if (delay <= Duration::zero()) {
      Async(std::move(work));
      return;
    }
    core_->After(delay, [self = shared_from_this(), work = std::move(work)]() mutable {
      self->Async(std::move(work));
    });
  }

  void RunOrAsync(Work work) override {
    if (!Admit(work)) return;
    bool runHere = false;
    bool schedule = false;
    {
      std::lock_guard lock(mutex_);
      core_->ItemsQueued();
      if (!scheduled_ && suspensions_ == 0 && items_.empty()) {
        // This thread is the queue's pump for one item: whatever comes meanwhile waits behind it.
        runHere = scheduled_ = true;
      } else {
        items_.push_back(std::move(work));
        if (!scheduled_ && suspensions_ == 0) schedule = scheduled_ = true;
      }
    }
    if (runHere) {
      Run(work);
      schedule = HasMoreToRun();
    }
    if (schedule) SchedulePump();
  }

  const std::string& Label() const override { return label_; }
  QualityOfService Qos() const override { return qos_; }

  void Suspend() override {
    std::lock_guard lock(mutex_);
    ++suspensions_;
  }

  void Resume() override {
    bool schedule = false;
    {
      std::lock_guard lock(mutex_);
      if (suspensions_ == 0) Fatal("Resume() of a serial queue that is not suspended");
      --suspensions_;
      if (suspensions_ == 0 && !scheduled_ && !items_.empty()) schedule = scheduled_ = true;
    }
    if (schedule) SchedulePump();
  }

  bool IsCurrent() const override { return tCurrentQueue == this; }

 private:
  // False for no work, and for work offered after Shutdown (counted as dropped).
  bool Admit(const Work& work) {
    if (!work) return false;
    if (core_->Accepting()) return true;
    core_->CountDropped();
    return false;
  }

  void SchedulePump() {
    if (!core_->Post([self = shared_from_this()] { self->Pump(); })) {
      // The pool is gone; whatever is queued stays here and is freed with the queue.
      std::lock_guard lock(mutex_);
      scheduled_ = false;
    }
  }

  // Runs up to kMaxItemsPerTurn items, then yields the thread if more are waiting.
  void Pump() {
    for (size_t n = 0; n < kMaxItemsPerTurn; ++n) {
      Work work;
      {
        std::lock_guard lock(mutex_);
        if (suspensions_ > 0 || items_.empty()) {
          scheduled_ = false;
          return;
        }
        work = items_.pop_front();
      }
      Run(work);
    }
    if (HasMoreToRun()) SchedulePump();
  }

  // Runs one item taken off the queue by the caller, which holds scheduled_.
  void Run(Work& work) {
    const void* previous = tCurrentQueue;
    tCurrentQueue = this;
    core_->RunItem(label_, work);
    work = nullptr;  // the item's captures are released while it still counts as current
    tCurrentQueue = previous;
    core_->ItemsGone();
  }

  // After a turn: true when items wait and may run (the caller then schedules a pump); else the
  // caller's hold on scheduled_ ends here.
  bool HasMoreToRun() {
    std::lock_guard lock(mutex_);
    if (suspensions_ > 0 || items_.empty()) {
      scheduled_ = false;
      return false;
    }
    return true;
  }

  const std::shared_ptr<AsioDispatcher::Core> core_;
  const std::string label_;
  const QualityOfService qos_;

  std::mutex mutex_;  // guards items_, suspensions_, scheduled_
  WorkFifo items_;
  unsigned suspensions_ = 0;
  // A pump is posted to the pool or running; it alone takes items off items_.
  bool scheduled_ = false;
};

// Concurrent: every item is its own pool handler.
class AsioBackgroundQueue final : public WorkQueue {
 public:
  explicit AsioBackgroundQueue(AsioDispatcher::Core& core) : core_(core) {}

  void Async(Work work) override {
    if (!work) return;
    if (!core_.Accepting()) {
      core_.CountDropped();
      return;
    }
    core_.ItemsQueued();
    const bool posted = core_.Post([this, work = std::move(work)]() mutable {
      core_.RunItem(label_, work);
      work = nullptr;
      core_.ItemsGone();
    });
    if (!posted) core_.ItemsGone();
  }

  void AsyncAfter(Duration delay, Work work) override {
    if (!work) return;
    if (delay <= Duration::zero()) {
      Async(std::move(work));
      return;
    }
    core_.After(delay, [this, work = std::move(work)]() mutable { Async(std::move(work)); });
  }

  const std::string& Label() const override { return label_; }
  QualityOfService Qos() const override { return QualityOfService::kBackground; }

 private:
  AsioDispatcher::Core& core_;
  const std::string label_ = AsioDispatcher::kBackgroundLabel;
};

}  // namespace

// Shared by a Timer and the handlers it has outstanding, so that neither a stale expiry nor a
// destroyed Timer can reach freed memory or run work of an earlier arming.
struct TimerState {
  TimerState(std::shared_ptr<AsioDispatcher::Core> c, WorkQueue& q, Work w)
      : core(std::move(c)), timer(core->Io()), queue(&q), work(std::move(w)) {}

  const std::shared_ptr<AsioDispatcher::Core> core;  // declared first: the timer needs its io
  std::mutex mutex;                                  // guards timer, generation, armed
  asio::steady_timer timer;
  uint64_t generation = 0;  // bumped by every arming and every cancel
  bool armed = false;
  WorkQueue* const queue;
  const Work work;
};

namespace {

// Runs on the timer's queue: only the arming that is still current may start its work.
void RunTimerWork(const std::shared_ptr<TimerState>& state, uint64_t generation) {
  {
    std::lock_guard lock(state->mutex);
    if (generation != state->generation) return;
  }
  if (state->work) state->work();
}

void OnTimerExpiry(const std::shared_ptr<TimerState>& state, uint64_t generation,
                   const std::error_code& error) {
  std::lock_guard lock(state->mutex);
  // A handler that was already queued when the timer was re-armed or cancelled reports success;
  // the generation tells it apart.
  if (error || generation != state->generation) return;
  state->armed = false;
  // Handed over under the lock, so that once Cancel() or ~Timer returns the queue is not touched.
  state->queue->Async([state, generation] { RunTimerWork(state, generation); });
}

class AsioTimer final : public Timer {
 public:
  explicit AsioTimer(std::shared_ptr<TimerState> state) : state_(std::move(state)) {}
  ~AsioTimer() override {
    Cancel();
    state_->core->UnregisterTimer(state_.get());
  }

  void ScheduleAfter(Duration delay) override {
    std::lock_guard lock(state_->mutex);
    const uint64_t generation = ++state_->generation;
    if (!state_->core->Accepting()) {
      state_->core->CountDropped();
      state_->armed = false;
      state_->timer.cancel();
      return;
    }
    state_->armed = true;
    state_->timer.expires_after(std::max(delay, Duration::zero()));
    state_->timer.async_wait([state = state_, generation](const std::error_code& error) {
      OnTimerExpiry(state, generation, error);
    });
  }

  void Cancel() override {
    std::lock_guard lock(state_->mutex);
    ++state_->generation;
    state_->armed = false;
    state_->timer.cancel();
  }

 private:
  const std::shared_ptr<TimerState> state_;
};

}  // namespace

AsioDispatcher::Core::Core(size_t threads)
    : io_(static_cast<int>(std::clamp<size_t>(threads, 1, kMaxPoolThreads))),
      guard_(asio::make_work_guard(io_)),
      background_(std::make_unique<AsioBackgroundQueue>(*this)) {
  const size_t count = std::clamp<size_t>(threads, 1, kMaxPoolThreads);
  threads_.reserve(count);
  for (size_t i = 0; i < count; ++i) threads_.emplace_back([this, i] { ThreadMain(i); });
}

void AsioDispatcher::Core::ThreadMain(size_t index) {
  char name[16];  // a Linux thread name holds 15 characters
  std::snprintf(name, sizeof(name), "tavrin-pool-%zu", index);
  pthread_setname_np(pthread_self(), name);
  tPoolOwner = this;
  io_.run();
}

void AsioDispatcher::Core::After(Duration delay, std::function<void()> fire) {
  std::lock_guard lock(mutex_);
  if (!Accepting()) {
    CountDropped();
    return;
  }
  const uint64_t id = nextDelayedId_++;
  auto timer = std::make_unique<asio::steady_timer>(io_, delay);
  asio::steady_timer& waiting = *timer;
  delayed_.emplace(id, std::move(timer));
  waiting.async_wait([this, id, fire = std::move(fire)](const std::error_code& error) {
    std::unique_ptr<asio::steady_timer> finished;
    {
      std::lock_guard lock(mutex_);
      auto it = delayed_.find(id);
      if (it != delayed_.end()) {
        finished = std::move(it->second);
        delayed_.erase(it);
      }
    }
    if (error) {
      CountDropped();  // only Shutdown() cancels these
      return;
    }
    fire();
  });
}

void AsioDispatcher::Core::RunItem(const std::string& label, Work& work) {
  try {
    work();
  } catch (const std::exception& e) {
    failed_.fetch_add(1, std::memory_order_relaxed);
    TLOG_ERROR(nullptr, "Work item on queue {} ended with an exception: {}", label, e.what());
  } catch (...) {
    failed_.fetch_add(1, std::memory_order_relaxed);
    TLOG_ERROR(nullptr, "Work item on queue {} ended with an unknown exception", label);
  }
}

void AsioDispatcher::Core::RegisterTimer(const std::shared_ptr<TimerState>& state) {
  std::lock_guard lock(mutex_);
  timers_.emplace(state.get(), state);
}

void AsioDispatcher::Core::UnregisterTimer(const TimerState* state) {
  std::lock_guard lock(mutex_);
  timers_.erase(state);
}

void AsioDispatcher::Core::Shutdown() {
  if (tPoolOwner == this) Fatal("AsioDispatcher::Shutdown() called from one of its own threads");
  std::lock_guard shutdownLock(shutdownMutex_);
  if (finished_) return;

  std::vector<std::shared_ptr<TimerState>> timers;
  {
    std::lock_guard lock(mutex_);
    stopping_.store(true, std::memory_order_release);
    for (auto& [id, timer] : delayed_) timer->cancel();
    for (auto& [key, weak] : timers_) {
      if (auto state = weak.lock()) timers.push_back(std::move(state));
    }
  }
  for (const auto& state : timers) {
    std::lock_guard lock(state->mutex);
    if (state->armed) CountDropped();
    state->armed = false;
    ++state->generation;
    state->timer.cancel();
  }
  timers.clear();

  // The threads return once every queued handler, including the cancelled timers', has run.
  guard_.reset();
  for (auto& thread : threads_) thread.join();
  {
    std::lock_guard lock(mutex_);
    joined_ = true;
  }
  // A handler posted just as the threads were leaving would otherwise keep what it holds alive.
  discarding_.store(true, std::memory_order_release);
  io_.restart();
  io_.poll();
  finished_ = true;

  if (Dropped() > 0) {
    TLOG_DEFAULT(nullptr, "Dispatcher stopped; {} work items dropped at shutdown", Dropped());
  }
}

AsioDispatcher::AsioDispatcher(size_t poolThreads) : core_(std::make_shared<Core>(poolThreads)) {}

AsioDispatcher::~AsioDispatcher() { core_->Shutdown(); }

SerialQueuePtr AsioDispatcher::CreateSerialQueue(std::string label, QualityOfService qos) {
  return std::make_shared<AsioSerialQueue>(core_, std::move(label), qos);
}

WorkQueue& AsioDispatcher::BackgroundQueue() { return core_->Background(); }

std::unique_ptr<Timer> AsioDispatcher::CreateTimer(WorkQueue& queue, Work work) {
  auto state = std::make_shared<TimerState>(core_, queue, std::move(work));
  core_->RegisterTimer(state);
  return std::make_unique<AsioTimer>(std::move(state));
}

Clock& AsioDispatcher::GetClock() { return SystemClock(); }

void AsioDispatcher::Shutdown() { core_->Shutdown(); }

void AsioDispatcher::AsyncDeferred(WorkQueue& queue, Duration delay, Work work) {
  if (!work) return;
  uint64_t id = 0;
  bool held = false;
  {
    std::lock_guard lock(deferredMutex_);
    if (!deferredReleased_) {
      held = true;
      id = nextDeferredId_++;
      deferred_.emplace(id, std::pair{&queue, std::move(work)});
    }
  }
  // Released already: nothing is held back any more.
  if (!held) {
    queue.Async(std::move(work));
    return;
  }
  // The dispatcher outlives its delayed items: Shutdown() in the destructor cancels them first.
  queue.AsyncAfter(delay, [this, id] {
    Work due;
    {
      std::lock_guard lock(deferredMutex_);
      auto found = deferred_.find(id);
      if (found == deferred_.end()) return;  // handed over early
      due = std::move(found->second.second);
      deferred_.erase(found);
    }
    due();
  });
}

size_t AsioDispatcher::RunDeferredNow() {
  std::unordered_map<uint64_t, std::pair<WorkQueue*, Work>> due;
  {
    std::lock_guard lock(deferredMutex_);
    due.swap(deferred_);
    deferredReleased_ = true;
  }
  for (auto& [id, item] : due) item.first->Async(std::move(item.second));
  return due.size();
}

size_t AsioDispatcher::DeferredCount() const {
  std::lock_guard lock(deferredMutex_);
  return deferred_.size();
}

bool AsioDispatcher::WaitUntilDrained(Duration limit) { return core_->WaitUntilDrained(limit); }

uint64_t AsioDispatcher::QueuedItems() const { return core_->Queued(); }

size_t AsioDispatcher::PoolThreadCount() const { return core_->ThreadCount(); }

uint64_t AsioDispatcher::DroppedAtShutdown() const { return core_->Dropped(); }

uint64_t AsioDispatcher::FailedItems() const { return core_->Failed(); }

}  // namespace tavrin
