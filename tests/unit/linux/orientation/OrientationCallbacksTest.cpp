#include "platform/linux/orientation/OrientationCallbacks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <mutex>
#include <random>
#include <stdexcept>
#include <thread>
#include <vector>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::FakeLogSystem;

constexpr auto kDevice = OrientationKind::kDevice;
constexpr auto kUI = OrientationKind::kUI;

struct Calls {
  std::mutex mutex;
  std::vector<std::string> seen;  // "id=value"
  void Add(const std::string& id, const std::string& value) {
    std::lock_guard lock(mutex);
    seen.push_back(id + "=" + value);
  }
  std::vector<std::string> Get() {
    std::lock_guard lock(mutex);
    return seen;
  }
};

OrientationRegistry::Callback Recorder(Calls& calls, const std::string& id) {
  return [&calls, id](const OrientationValue& value) { calls.Add(id, value); };
}

class OrientationCallbacksTest : public ::testing::Test {
 protected:
  FakeLogSystem log_;
  OrientationCallbacks callbacks_;
  Calls calls_;
};

TEST_F(OrientationCallbacksTest, KindsAreSeparateAndEveryCallbackOfAKindIsCalled) {
  callbacks_.Register(kDevice, "a", Recorder(calls_, "a"));
  callbacks_.Register(kDevice, "b", Recorder(calls_, "b"));
  callbacks_.Register(kUI, "a", Recorder(calls_, "ui-a"));
  EXPECT_EQ(callbacks_.Deliver(kDevice, "normal"), 2u);
  EXPECT_EQ(callbacks_.Deliver(kUI, "left-up"), 1u);
  EXPECT_EQ(calls_.Get(), (std::vector<std::string>{"a=normal", "b=normal", "ui-a=left-up"}));
  EXPECT_EQ(callbacks_.Count(kDevice), 2u);
  EXPECT_EQ(callbacks_.Count(kUI), 1u);
}

TEST_F(OrientationCallbacksTest, EmptyCallbackIsRefusedWithAnErrorLine) {
  callbacks_.Register(kDevice, "a", nullptr);
  EXPECT_EQ(callbacks_.Count(kDevice), 0u);
  EXPECT_EQ(callbacks_.Deliver(kDevice, "x"), 0u);
  EXPECT_EQ(log_.Count("empty device orientation callback for \"a\"", LogLevel::kError), 1u);
}

TEST_F(OrientationCallbacksTest, ThrowingCallbackIsLoggedAndTheOthersStillRun) {
  callbacks_.Register(kDevice, "a",
                      [](const OrientationValue&) { throw std::runtime_error("boom"); });
  callbacks_.Register(kDevice, "b", Recorder(calls_, "b"));
  EXPECT_EQ(callbacks_.Deliver(kDevice, "x"), 2u);
  EXPECT_EQ(calls_.Get(), (std::vector<std::string>{"b=x"}));
  EXPECT_EQ(log_.Count("callback of \"a\" threw: boom", LogLevel::kError), 1u);
}

TEST_F(OrientationCallbacksTest, CallbackThatUnregistersAPickedOneStopsItInTheSameDelivery) {
  // "a" runs first (identifier order) and removes "b", which Deliver had already picked.
  callbacks_.Register(kDevice, "a", [&](const OrientationValue& value) {
    calls_.Add("a", value);
    callbacks_.Unregister(kDevice, "b");
  });
  callbacks_.Register(kDevice, "b", Recorder(calls_, "b"));
  EXPECT_EQ(callbacks_.Deliver(kDevice, "x"), 1u);
  EXPECT_EQ(calls_.Get(), (std::vector<std::string>{"a=x"}));
}

TEST_F(OrientationCallbacksTest, CallbackMayUnregisterItselfWithoutDeadlock) {
  callbacks_.Register(kUI, "self", [&](const OrientationValue& value) {
    calls_.Add("self", value);
    callbacks_.Unregister(kUI, "self");
    callbacks_.Unregister(kDevice, "other-kind");  // a different kind, also without waiting
  });
  callbacks_.Register(kDevice, "other-kind", Recorder(calls_, "other"));
  callbacks_.Deliver(kUI, "1");
  callbacks_.Deliver(kUI, "2");
  callbacks_.Deliver(kDevice, "3");
  EXPECT_EQ(calls_.Get(), (std::vector<std::string>{"self=1"}));
}

// Tracks whether the object a callback captured is still alive.
struct Capture {
  explicit Capture(std::atomic<bool>& alive) : alive(alive) { alive = true; }
  ~Capture() { alive = false; }
  std::atomic<bool>& alive;
};

TEST_F(OrientationCallbacksTest, UnregisterFromAnotherThreadWaitsForTheRunningCallback) {
  std::promise<void> entered;
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  std::atomic<bool> captureAlive{false};
  auto capture = std::make_shared<Capture>(captureAlive);
  std::atomic<bool> running{false};
  callbacks_.Register(kDevice, "slow", [&, capture, released](const OrientationValue&) {
    running = true;
    entered.set_value();
    released.wait();
    running = false;
  });
  capture.reset();

  std::thread deliverer([&] { callbacks_.Deliver(kDevice, "x"); });
  entered.get_future().wait();

  std::atomic<bool> unregistered{false};
  bool runningWhenReturned = true;
  bool captureAliveWhenReturned = true;
  std::thread unregisterer([&] {
    callbacks_.Unregister(kDevice, "slow");
    runningWhenReturned = running.load();
    captureAliveWhenReturned = captureAlive.load();
    unregistered = true;
  });
  // Not a timing assertion: whatever the delay, Unregister must still be waiting here.
  std::this_thread::sleep_for(50ms);
  EXPECT_FALSE(unregistered.load());
  release.set_value();
  unregisterer.join();
  deliverer.join();
  EXPECT_TRUE(unregistered.load());
  EXPECT_FALSE(runningWhenReturned);
  EXPECT_FALSE(captureAliveWhenReturned);
}

// Many threads register and unregister while one thread delivers; a callback that runs after its
// Unregister returned is a fault. Meant for ThreadSanitizer as much as for the assertion.
TEST_F(OrientationCallbacksTest, NoCallAfterUnregisterReturnsUnderConcurrentChurn) {
  constexpr int kThreads = 3;
  constexpr int kRounds = 300;
  std::atomic<bool> stop{false};
  std::atomic<int> lateCalls{0};
  std::atomic<uint64_t> delivered{0};
  std::thread deliverer([&] {
    while (!stop) {
      callbacks_.Deliver(kDevice, "d");
      callbacks_.Deliver(kUI, "u");
      ++delivered;
    }
  });
  std::vector<std::thread> churners;
  for (int t = 0; t < kThreads; ++t) {
    churners.emplace_back([&, t] {
      std::minstd_rand random(t);
      for (int round = 0; round < kRounds; ++round) {
        const std::string id = "t" + std::to_string(t) + "-" + std::to_string(round % 4);
        const OrientationKind kind = random() % 2 ? kDevice : kUI;
        auto gone = std::make_shared<std::atomic<bool>>(false);
        callbacks_.Register(kind, id, [gone, &lateCalls](const OrientationValue&) {
          if (gone->load()) ++lateCalls;
        });
        if (random() % 3 == 0) std::this_thread::yield();
        callbacks_.Unregister(kind, id);
        *gone = true;
      }
    });
  }
  for (auto& churner : churners) churner.join();
  stop = true;
  deliverer.join();
  EXPECT_EQ(lateCalls.load(), 0);
  EXPECT_GT(delivered.load(), 0u);
  EXPECT_EQ(callbacks_.Count(kDevice) + callbacks_.Count(kUI), 0u);
}

}  // namespace
}  // namespace tavrin
