#include "tests/fakes/FakeDispatcher.h"

#include <algorithm>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

namespace tavrin::testing {
namespace {

class FakeQueue;

// An item that keeps queueing itself (or a timer re-armed at zero delay) would never let
// RunUntilIdle return; past this many items in one call the test fails instead of hanging.
constexpr size_t kMaxItemsPerRun = 1'000'000;

// Fire dates are ordered by time, then by the order they were set.
using FireKey = std::pair<SteadyTime, uint64_t>;

}  // namespace

struct FakeDispatcher::State {
  explicit State(FakeClock& c) : clock(c) {}

  FakeClock& clock;
  mutable std::mutex mutex;  // guards everything below and every FakeQueue's data
  bool closed = false;
  uint64_t nextSequence = 0;
  std::vector<std::shared_ptr<FakeQueue>> queues;  // serial queues, creation order
  std::shared_ptr<FakeQueue> background;
  // Hands a due item to its queue; called without the lock.
  std::map<FireKey, std::function<void()>> delayed;
  // AsyncDeferred items not handed over yet, in the order given.
  std::map<uint64_t, std::pair<WorkQueue*, Work>> deferred;
  bool deferredReleased = false;  // RunDeferredNow was called: nothing is held back any more
  bool running = false;           // inside RunUntilIdle
  const FakeQueue* current = nullptr;
  std::thread::id currentThread;

  FireKey NextKeyLocked(Duration delay) {
    return {clock.Now() + std::max(delay, Duration::zero()), nextSequence++};
  }
};

namespace {

class FakeQueue final : public SerialQueue, public std::enable_shared_from_this<FakeQueue> {
 public:
  FakeQueue(const std::shared_ptr<FakeDispatcher::State>& state, std::string label,
            QualityOfService qos)
      : state_(state), label_(std::move(label)), qos_(qos) {}

  void Async(Work work) override {
    auto state = state_.lock();
    if (!state || !work) return;
    // Released before `work`, a parameter, is: its captures may call back in as they go.
    std::lock_guard lock(state->mutex);
    if (!state->closed) items.emplace_back(state->nextSequence++, std::move(work));
  }

  void AsyncAfter(Duration delay, Work work) override {
    auto state = state_.lock();
    if (!state || !work) return;
    std::lock_guard lock(state->mutex);
    if (state->closed) return;
    // The fire function holds the queue, as a pending timer does in the real dispatcher.
    state->delayed.emplace(state->NextKeyLocked(delay),
                           [self = shared_from_this(), work = std::move(work)]() mutable {
                             self->Async(std::move(work));
                           });
  }

  const std::string& Label() const override { return label_; }
  QualityOfService Qos() const override { return qos_; }

  void Suspend() override {
    auto state = state_.lock();
    if (!state) return;
    std::lock_guard lock(state->mutex);
    ++suspensions;
  }

  void Resume() override {
    auto state = state_.lock();
    if (!state) return;
    std::lock_guard lock(state->mutex);
    if (suspensions == 0) {
      ADD_FAILURE() << "Resume() of queue " << label_ << ", which is not suspended";
      return;
    }
    --suspensions;
  }

  bool IsCurrent() const override {
    auto state = state_.lock();
    if (!state) return false;
    std::lock_guard lock(state->mutex);
    return state->current == this && state->currentThread == std::this_thread::get_id();
  }

  bool BelongsTo(const FakeDispatcher::State* state) const { return state_.lock().get() == state; }

  // Guarded by State::mutex.
  std::deque<std::pair<uint64_t, Work>> items;
  unsigned suspensions = 0;

 private:
  const std::weak_ptr<FakeDispatcher::State> state_;
  const std::string label_;
  const QualityOfService qos_;
};

// Shared by a timer and the work it has handed to its queue.
struct TimerState {
  TimerState(WorkQueue& q, Work w) : queue(&q), work(std::move(w)) {}
  std::mutex mutex;  // guards generation and entry; taken before State::mutex
  uint64_t generation = 0;
  std::optional<FireKey> entry;
  WorkQueue* const queue;
  const Work work;
};

class FakeTimer final : public Timer {
 public:
  FakeTimer(const std::shared_ptr<FakeDispatcher::State>& dispatcher, WorkQueue& queue, Work work)
      : dispatcher_(dispatcher), state_(std::make_shared<TimerState>(queue, std::move(work))) {}
  ~FakeTimer() override { Cancel(); }

  void ScheduleAfter(Duration delay) override {
    auto dispatcher = dispatcher_.lock();
    std::lock_guard timerLock(state_->mutex);
    const uint64_t generation = ++state_->generation;
    if (!dispatcher) return;
    std::lock_guard lock(dispatcher->mutex);
    if (state_->entry) dispatcher->delayed.erase(*state_->entry);
    state_->entry.reset();
    if (dispatcher->closed) return;
    const FireKey key = dispatcher->NextKeyLocked(delay);
    state_->entry = key;
    dispatcher->delayed.emplace(key, [state = state_, generation] { Fire(state, generation); });
  }

  void Cancel() override {
    auto dispatcher = dispatcher_.lock();
    std::lock_guard timerLock(state_->mutex);
    ++state_->generation;
    if (dispatcher && state_->entry) {
      std::lock_guard lock(dispatcher->mutex);
      dispatcher->delayed.erase(*state_->entry);
    }
    state_->entry.reset();
  }

 private:
  static void Fire(const std::shared_ptr<TimerState>& state, uint64_t generation) {
    std::lock_guard lock(state->mutex);
    if (generation != state->generation) return;
    state->entry.reset();
    state->queue->Async([state, generation] {
      {
        std::lock_guard lock(state->mutex);
        if (generation != state->generation) return;
      }
      if (state->work) state->work();
    });
  }

  const std::weak_ptr<FakeDispatcher::State> dispatcher_;
  const std::shared_ptr<TimerState> state_;
};

}  // namespace

FakeDispatcher::FakeDispatcher() : FakeDispatcher(std::make_unique<FakeClock>(), nullptr) {}

FakeDispatcher::FakeDispatcher(FakeClock& clock) : FakeDispatcher(nullptr, &clock) {}

FakeDispatcher::FakeDispatcher(std::unique_ptr<FakeClock> own, FakeClock* clock)
    : ownClock_(std::move(own)),
      clock_(clock ? *clock : *ownClock_),
      state_(std::make_shared<State>(clock_)),
      background_(*(state_->background = std::make_shared<FakeQueue>(
                        state_, kBackgroundLabel, QualityOfService::kBackground))) {}

FakeDispatcher::~FakeDispatcher() {
  std::vector<std::shared_ptr<FakeQueue>> queues;
  std::vector<std::pair<uint64_t, Work>> items;
  std::map<FireKey, std::function<void()>> delayed;
  {
    std::lock_guard lock(state_->mutex);
    state_->closed = true;
    queues = std::move(state_->queues);
    queues.push_back(std::move(state_->background));
    for (auto& queue : queues) {
      std::move(queue->items.begin(), queue->items.end(), std::back_inserter(items));
      queue->items.clear();
    }
    delayed = std::move(state_->delayed);
  }
  // Released here, outside the lock: their captures may call back into the dispatcher, which
  // drops whatever they offer.
}

SerialQueuePtr FakeDispatcher::CreateSerialQueue(std::string label, QualityOfService qos) {
  auto queue = std::make_shared<FakeQueue>(state_, std::move(label), qos);
  std::lock_guard lock(state_->mutex);
  state_->queues.push_back(queue);
  return queue;
}

WorkQueue& FakeDispatcher::BackgroundQueue() { return background_; }

std::unique_ptr<Timer> FakeDispatcher::CreateTimer(WorkQueue& queue, Work work) {
  return std::make_unique<FakeTimer>(state_, queue, std::move(work));
}

void FakeDispatcher::AsyncDeferred(WorkQueue& queue, Duration delay, Work work) {
  if (!work) return;
  uint64_t id = 0;
  bool held = false;
  {
    std::lock_guard lock(state_->mutex);
    if (!state_->deferredReleased) {
      held = true;
      id = state_->nextSequence++;
      state_->deferred.emplace(id, std::pair{&queue, std::move(work)});
    }
  }
  // Released already: nothing is held back any more.
  if (!held) {
    queue.Async(std::move(work));
    return;
  }
  queue.AsyncAfter(delay, [state = std::weak_ptr(state_), id] {
    auto alive = state.lock();
    if (!alive) return;
    Work due;
    {
      std::lock_guard lock(alive->mutex);
      auto found = alive->deferred.find(id);
      if (found == alive->deferred.end()) return;
      due = std::move(found->second.second);
      alive->deferred.erase(found);
    }
    due();
  });
}

size_t FakeDispatcher::RunDeferredNow() {
  std::map<uint64_t, std::pair<WorkQueue*, Work>> due;
  {
    std::lock_guard lock(state_->mutex);
    due.swap(state_->deferred);
    state_->deferredReleased = true;
  }
  for (auto& [id, item] : due) item.first->Async(std::move(item.second));
  return due.size();
}

size_t FakeDispatcher::DeferredCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->deferred.size();
}

size_t FakeDispatcher::RunUntilIdle() {
  {
    std::lock_guard lock(state_->mutex);
    if (state_->running) {
      ADD_FAILURE() << "RunUntilIdle/AdvanceBy called from inside a work item";
      return 0;
    }
    state_->running = true;
  }
  // Leaves the dispatcher usable when a work item throws (the exception reaches the test).
  struct Reset {
    State& state;
    ~Reset() {
      std::lock_guard lock(state.mutex);
      state.running = false;
      state.current = nullptr;
    }
  } reset{*state_};

  size_t ran = 0;
  for (;;) {
    if (ran >= kMaxItemsPerRun) {
      ADD_FAILURE() << "RunUntilIdle ran " << ran << " items without becoming idle";
      return ran;
    }
    Work work;
    std::function<void()> fire;
    {
      std::lock_guard lock(state_->mutex);
      FakeQueue* next = nullptr;
      auto consider = [&](FakeQueue* queue) {
        if (queue->suspensions > 0 || queue->items.empty()) return;
        if (!next || queue->items.front().first < next->items.front().first) next = queue;
      };
      for (auto& queue : state_->queues) consider(queue.get());
      consider(state_->background.get());
      if (next) {
        work = std::move(next->items.front().second);
        next->items.pop_front();
        state_->current = next;
        state_->currentThread = std::this_thread::get_id();
      } else if (!state_->delayed.empty() && state_->delayed.begin()->first.first <= clock_.Now()) {
        fire = std::move(state_->delayed.begin()->second);
        state_->delayed.erase(state_->delayed.begin());
      } else {
        return ran;
      }
    }
    if (work) {
      work();
      work = nullptr;  // captures are released while the item still counts as current
      ++ran;
      std::lock_guard lock(state_->mutex);
      state_->current = nullptr;
    } else {
      fire();
    }
  }
}

size_t FakeDispatcher::AdvanceBy(Duration duration) {
  if (duration < Duration::zero()) {
    ADD_FAILURE() << "FakeDispatcher::AdvanceBy with a negative duration";
    return 0;
  }
  const SteadyTime end = clock_.Now() + duration;
  size_t ran = RunUntilIdle();
  for (;;) {
    SteadyTime due;
    {
      std::lock_guard lock(state_->mutex);
      if (state_->delayed.empty() || state_->delayed.begin()->first.first > end) break;
      due = state_->delayed.begin()->first.first;
    }
    // Moving the clock to the fire date lets RunUntilIdle fire it (and its ties) in order.
    if (due > clock_.Now()) clock_.Advance(due - clock_.Now());
    ran += RunUntilIdle();
  }
  if (end > clock_.Now()) clock_.Advance(end - clock_.Now());
  ran += RunUntilIdle();
  return ran;
}

namespace {

const FakeQueue* AsFakeQueue(const WorkQueue& queue, const FakeDispatcher::State* state) {
  const auto* fake = dynamic_cast<const FakeQueue*>(&queue);
  if (!fake || !fake->BelongsTo(state)) {
    ADD_FAILURE() << "queue " << queue.Label() << " was not made by this FakeDispatcher";
    return nullptr;
  }
  return fake;
}

}  // namespace

size_t FakeDispatcher::PendingCount(const WorkQueue& queue) const {
  const FakeQueue* fake = AsFakeQueue(queue, state_.get());
  if (!fake) return 0;
  std::lock_guard lock(state_->mutex);
  return fake->items.size();
}

std::optional<Duration> FakeDispatcher::NextFireDelay() const {
  std::lock_guard lock(state_->mutex);
  if (state_->delayed.empty()) return std::nullopt;
  return std::max(state_->delayed.begin()->first.first - clock_.Now(), Duration::zero());
}

bool FakeDispatcher::IsSuspended(const WorkQueue& queue) const {
  const FakeQueue* fake = AsFakeQueue(queue, state_.get());
  if (!fake) return false;
  std::lock_guard lock(state_->mutex);
  return fake->suspensions > 0;
}

SerialQueuePtr FakeDispatcher::FindQueue(std::string_view label) const {
  std::lock_guard lock(state_->mutex);
  for (auto it = state_->queues.rbegin(); it != state_->queues.rend(); ++it) {
    if ((*it)->Label() == label) return *it;
  }
  return nullptr;
}

}  // namespace tavrin::testing
