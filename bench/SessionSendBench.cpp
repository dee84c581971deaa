// The session send path: sendMessage(payload, category, type, sync, reply) on a started session.
//
//   BM_SendCallerSide  what the client's work queue pays per message (cleaning, counting, the two
//                      appends, queueing the delivery); queued deliveries are drained untimed.
//   BM_SendAndDeliver  the same plus the delivery on the session's queue, on the fake dispatcher
//                      drained in batches of kBatch on the benchmark's thread.
//   BM_SendAsio        the same on the real AsioDispatcher (2 pool threads): the caller sends a
//                      batch, then waits until the back-end has received all of it.
// Argument 0: payload keys without blanks (the common case); 1: one key with blanks.
// The back-end only counts what it is given, so the numbers are the session's own.
// Allocations are counted by a replaced global operator new and reported per message.

#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <memory>
#include <new>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/LogSystem.h"
#include "platform/TelvoroSession.h"
#include "platform/linux/dispatch/AsioDispatcher.h"
#include "tests/fakes/FakePlatform.h"

// The replacements below pair malloc with free; GCC cannot see that operator new is replaced
// too and reports every delete as mismatched.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

namespace {

std::atomic<uint64_t> gAllocations{0};

}  // namespace

void* operator new(std::size_t size) {
  gAllocations.fetch_add(1, std::memory_order_relaxed);
  if (void* p = std::malloc(size == 0 ? 1 : size)) return p;
  throw std::bad_alloc();
}
void* operator new[](std::size_t size) { return operator new(size); }
void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  gAllocations.fetch_add(1, std::memory_order_relaxed);
  return std::malloc(size == 0 ? 1 : size);
}
void* operator new[](std::size_t size, const std::nothrow_t& tag) noexcept {
  return operator new(size, tag);
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete(void* p, std::size_t) noexcept { std::free(p); }
void operator delete[](void* p, std::size_t) noexcept { std::free(p); }

namespace tavrin {
namespace {

uint64_t Allocations() { return gAllocations.load(std::memory_order_relaxed); }

constexpr uint32_t kCategory = 0x80000003;  // Toolbox_Playback
constexpr uint16_t kType = 1;
// Deliveries drained (or awaited) per batch.
constexpr int64_t kBatch = 1024;
// A started session aggregates until it stops; restarting keeps memory flat over long runs.
constexpr int64_t kMessagesPerRun = 16 * 1024;

// Filters debug lines, as a non-verbose scope does, and discards the rest: the numbers should
// be the session's, not the terminal's.
class QuietLog final : public LogScope, public LogSystem {
 public:
  bool ShouldLog(LogLevel level) const override { return false; }
  void Write(LogLevel, std::string_view) override {}
  LogHandle RegisterLogScope(bool, uint32_t, std::string_view, std::string_view, std::string_view,
                             int) override {
    return nullptr;
  }
  LogScope& DefaultLog() override { return *this; }
};

// A back-end that answers discovery at once and only counts messages.
class CountingBackend final : public TelvoroService {
 public:
  class Session final : public TelvoroSession {
   public:
    explicit Session(std::atomic<uint64_t>& received) : received_(received) {}
    void StartConfiguration(std::function<void(const BackendList&)> done) override {
      done(std::vector<std::string>{"bench"});
    }
    bool SendSessionMessage(uint16_t, uint16_t, const PayloadPtr&, Error*,
                            const DeliveryReceiptPtr&) override {
      received_.fetch_add(1, std::memory_order_release);
      return true;
    }
    void FlushMessages(std::function<void(const OptionalError&)> done) override {
      done(std::nullopt);
    }
    std::string Description() const override { return "bench"; }

   private:
    std::atomic<uint64_t>& received_;
  };

  TelvoroTokenPtr NewSecureHierarchyToken(const TelvoroTokenPtr&) override {
    return std::make_shared<const TelvoroSecureHierarchyToken>(TelvoroSecureHierarchyToken{1});
  }
  TelvoroSessionPtr CreateTelvoroSession(const Dictionary&, const Dictionary&,
                                         const std::vector<std::string>&) override {
    return std::make_shared<Session>(received);
  }
  bool SendOneMessage(const Dictionary&, const Dictionary&, uint16_t, uint16_t, const Dictionary&,
                      Error*, const DeliveryReceiptPtr&) override {
    return true;
  }

  std::atomic<uint64_t> received{0};
};

Dictionary Payload(bool blanks) {
  // A typical message: a time stamp, a few measurements and names.
  Dictionary payload{{"ruvoreporting_timestamp", 1763270865123},
                     {"EngineOnTime", 12.5},
                     {"route", "speaker"},
                     {"sample_rate", 48000},
                     {"latency_ms", 12},
                     {"device", "builtin"}};
  if (blanks) payload["buffer size frames"] = 512;
  return payload;
}

// One started session on the fake platform with the counting back-end.
struct Bench {
  explicit Bench(Dispatcher* dispatcher = nullptr) {
    previousLog = InstallLogSystem(&log);
    platform.deviceInfo.SetBool(kDeviceInfoInternalBuild, false);
    platform.services.telvoro = &backend;
    if (dispatcher != nullptr) platform.services.dispatcher = dispatcher;
    session = RuvoReportingSession::create(1, {1}, platform.services);
    session->setServiceType(3);
    session->start();
  }
  ~Bench() {
    session->stop();
    platform.dispatcher.RunUntilIdle();
    session.reset();
    InstallLogSystem(previousLog);
  }
  void Restart() {
    session->stop();
    session->start();
  }

  QuietLog log;
  LogSystem* previousLog = nullptr;
  testing::FakePlatform platform;
  CountingBackend backend;
  std::shared_ptr<RuvoReportingSession> session;
};

void BM_SendCallerSide(benchmark::State& state) {
  Bench bench;
  const Dictionary payload = Payload(state.range(0) != 0);
  uint64_t allocations = 0;
  int64_t sent = 0;
  for (auto _ : state) {
    const uint64_t before = Allocations();
    bench.session->sendMessage(payload, kCategory, kType, false, nullptr);
    allocations += Allocations() - before;
    if (++sent % kBatch == 0) {
      state.PauseTiming();
      bench.platform.dispatcher.RunUntilIdle();
      if (sent % kMessagesPerRun == 0) bench.Restart();
      state.ResumeTiming();
    }
  }
  state.SetItemsProcessed(sent);
  state.counters["allocs/msg"] =
      benchmark::Counter(static_cast<double>(allocations) / static_cast<double>(sent));
}
BENCHMARK(BM_SendCallerSide)->Arg(0)->Arg(1);

void BM_SendAndDeliver(benchmark::State& state) {
  Bench bench;
  const Dictionary payload = Payload(state.range(0) != 0);
  uint64_t allocations = 0;
  int64_t sent = 0;
  uint64_t mark = Allocations();
  for (auto _ : state) {
    bench.session->sendMessage(payload, kCategory, kType, false, nullptr);
    if (++sent % kBatch == 0) {
      bench.platform.dispatcher.RunUntilIdle();
      if (sent % kMessagesPerRun == 0) {
        allocations += Allocations() - mark;
        state.PauseTiming();
        bench.Restart();
        bench.platform.dispatcher.RunUntilIdle();
        state.ResumeTiming();
        mark = Allocations();
      }
    }
  }
  bench.platform.dispatcher.RunUntilIdle();
  allocations += Allocations() - mark;
  state.SetItemsProcessed(sent);
  state.counters["allocs/msg"] =
      benchmark::Counter(static_cast<double>(allocations) / static_cast<double>(sent));
}
BENCHMARK(BM_SendAndDeliver)->Arg(0)->Arg(1);

void BM_SendAsio(benchmark::State& state) {
  AsioDispatcher dispatcher;
  uint64_t allocations = 0;
  int64_t sent = 0;
  {
    Bench bench(&dispatcher);
    const Dictionary payload = Payload(state.range(0) != 0);
    // Each restart's stop sends the run's summary the same way as the messages.
    uint64_t summaries = 0;
    const auto waitForDeliveries = [&] {
      const uint64_t expected = static_cast<uint64_t>(sent) + summaries;
      while (bench.backend.received.load(std::memory_order_acquire) < expected) {
        std::this_thread::yield();
      }
    };
    uint64_t mark = Allocations();
    for (auto _ : state) {
      bench.session->sendMessage(payload, kCategory, kType, false, nullptr);
      if (++sent % kBatch == 0) {
        waitForDeliveries();
        if (sent % kMessagesPerRun == 0) {
          allocations += Allocations() - mark;
          state.PauseTiming();
          bench.Restart();
          ++summaries;
          state.ResumeTiming();
          mark = Allocations();
        }
      }
    }
    waitForDeliveries();
    allocations += Allocations() - mark;
    bench.session->stop();
    // Lets the last run's summary and flush finish while the back-end still exists.
    dispatcher.Shutdown();
  }
  state.SetItemsProcessed(sent);
  state.counters["allocs/msg"] =
      benchmark::Counter(static_cast<double>(allocations) / static_cast<double>(sent));
}
BENCHMARK(BM_SendAsio)->Arg(0)->Arg(1)->UseRealTime();

}  // namespace
}  // namespace tavrin

BENCHMARK_MAIN();
