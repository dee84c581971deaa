// How long tavrin_send_rt() takes on the calling thread: 1,000,000 calls from a thread with
// real-time priority where the machine allows it (SCHED_FIFO), else normal priority, with the
// service up and with it gone. Prints p50, p99, p99.9 and max per case (see docs/performance.md).

#include <pthread.h>
#include <sched.h>
#include <sys/mman.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "tavrin/tavrin.h"

namespace {
std::string gTavrindPath = TAVRIN_BUILT_TAVRIND;
}  // namespace
#define TAVRIND_PATH gTavrindPath
#include "tests/support/TavrindProcess.h"

namespace {

constexpr int kCalls = 1'000'000;

// Sends kCalls messages of four fields, one every few microseconds, as a render callback would
// report per buffer, and returns each call's duration in nanoseconds.
std::vector<int64_t> Measure(tavrin_client* client, bool* realtime) {
  std::vector<int64_t> durations(kCalls);
  std::thread sender([&] {
    sched_param priority{};
    priority.sched_priority = 50;
    const int refused = pthread_setschedparam(pthread_self(), SCHED_FIFO, &priority);
    *realtime = refused == 0;
    if (refused != 0) std::fprintf(stderr, "SCHED_FIFO refused: %s\n", std::strerror(refused));
    const int64_t reporter = 42;
    const tavrin_field fields[] = {{"xruns", TAVRIN_FIELD_INT, {.i = 0}},
                                   {"load", TAVRIN_FIELD_DOUBLE, {.d = 0.5}},
                                   {"glitch", TAVRIN_FIELD_BOOL, {.b = 0}},
                                   {"route", TAVRIN_FIELD_STRING, {.s = "speaker"}}};
    for (int i = 0; i < kCalls; ++i) {
      const auto start = std::chrono::steady_clock::now();
      tavrin_send_rt(client, &reporter, 1, 0x80000001, 1, fields, 4);
      durations[i] = std::chrono::duration_cast<std::chrono::nanoseconds>(
                         std::chrono::steady_clock::now() - start)
                         .count();
      // Paced near what the background thread sends (a render callback reports once a buffer,
      // far less often), so that most calls queue rather than find the queue full.
      if (i % 8 == 7) std::this_thread::sleep_for(std::chrono::microseconds(100));
    }
  });
  sender.join();
  std::sort(durations.begin(), durations.end());
  return durations;
}

void Print(const char* label, const std::vector<int64_t>& sorted, bool realtime,
           tavrin_client* client) {
  auto at = [&](double share) { return sorted[static_cast<size_t>(share * (sorted.size() - 1))]; };
  std::printf(
      "%-13s %s  p50 %5.2f us  p99 %5.2f us  p99.9 %5.2f us  max %7.2f us  "
      "(sent %llu, dropped %llu)\n",
      label, realtime ? "SCHED_FIFO" : "normal    ", at(0.5) / 1e3, at(0.99) / 1e3, at(0.999) / 1e3,
      sorted.back() / 1e3, static_cast<unsigned long long>(tavrin_rt_sent(client)),
      static_cast<unsigned long long>(tavrin_rt_dropped(client)));
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1) gTavrindPath = argv[1];
  // As an audio program would: no page faults on the measured thread once it runs.
  if (mlockall(MCL_CURRENT | MCL_FUTURE) != 0) std::fprintf(stderr, "mlockall refused\n");
  tavrin::testing::TavrindProcess service;
  if (!service.Start()) {
    std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
    return 1;
  }
  tavrin_client* client = tavrin_open(service.SocketPath().c_str(), 4096, nullptr);
  if (client == nullptr || tavrin_create_session(client, 42, 2, nullptr) != TAVRIN_OK ||
      tavrin_start_session(client, 42) != TAVRIN_OK) {
    std::fprintf(stderr, "could not open a session\n");
    return 1;
  }
  bool realtime = false;
  const auto up = Measure(client, &realtime);
  Print("service up", up, realtime, client);
  service.Stop(SIGKILL);
  const auto down = Measure(client, &realtime);
  Print("service down", down, realtime, client);
  tavrin_close(client);
  return 0;
}
