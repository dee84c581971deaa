// The C interface's real-time send against the real service: what an audio thread sends arrives,
// and the send never allocates or waits on a lock, whether the service runs, is gone, or never
// reads. The client comes back with its sessions when the service restarts.

// The counting operator new below hands out malloc's blocks, and its delete frees them.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <new>
#include <string>

#include "tavrin/tavrin.h"
#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

// Allocations and lock waits of the thread that armed the hooks. The sanitizers bring their own
// allocator and lock interceptors, which these would fight, so there the hooks count nothing and
// the check is skipped.
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
#define TAVRIN_HOOKS 1
namespace {
thread_local bool armed = false;
thread_local uint64_t allocations = 0;
thread_local uint64_t lockWaits = 0;
}  // namespace

void* operator new(size_t size) {
  if (armed) ++allocations;
  if (void* block = std::malloc(size ? size : 1)) return block;
  throw std::bad_alloc();
}
void operator delete(void* block) noexcept { std::free(block); }
void operator delete(void* block, size_t) noexcept { std::free(block); }

extern "C" int pthread_mutex_lock(pthread_mutex_t* mutex) {
  using Lock = int (*)(pthread_mutex_t*);
  static Lock real = reinterpret_cast<Lock>(dlsym(RTLD_NEXT, "pthread_mutex_lock"));
  if (armed) ++lockWaits;
  return real(mutex);
}
#endif

namespace tavrin {
namespace {

using testing::TavrindProcess;

const tavrin_field kFields[] = {
    {"xruns", TAVRIN_FIELD_INT, {.i = 3}},
    {"load", TAVRIN_FIELD_DOUBLE, {.d = 0.25}},
    {"glitch", TAVRIN_FIELD_BOOL, {.b = 1}},
    {"route",
     TAVRIN_FIELD_STRING,
     {.s = "speaker and a name longer than the sixty-three bytes kept"}},
};

// 100,000 sends from this thread, counting what the hooks saw.
void SendManyWithoutAllocatingOrLocking(tavrin_client* client, int64_t reporter) {
#ifdef TAVRIN_HOOKS
  allocations = lockWaits = 0;
  armed = true;
#endif
  for (int i = 0; i < 100'000; ++i) {
    const tavrin_status status = tavrin_send_rt(client, &reporter, 1, 0x80000001, 1, kFields, 4);
    if (status != TAVRIN_OK && status != TAVRIN_ERR_QUEUE_FULL) {
      ADD_FAILURE() << "send " << i << " refused: " << status;
      break;
    }
  }
#ifdef TAVRIN_HOOKS
  armed = false;
  EXPECT_EQ(allocations, 0u);
  EXPECT_EQ(lockWaits, 0u);
#endif
}

TEST(RealtimeSendE2eTest, MessagesArriveAndSendingNeverAllocatesNorLocks) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  tavrin_status status;
  tavrin_client* client = tavrin_open(service.SocketPath().c_str(), 256, &status);
  ASSERT_NE(client, nullptr) << status;
  ASSERT_EQ(tavrin_create_session(client, 42, 2, R"({"HostApplicationDisplayID": "rt"})"),
            TAVRIN_OK);
  ASSERT_EQ(tavrin_start_session(client, 42), TAVRIN_OK);
  int64_t reporter = 42;
  EXPECT_EQ(tavrin_send_rt(client, &reporter, 1, 0x80000001, 1, kFields, 4), TAVRIN_OK);
  const std::string sent = "SELECT payload FROM session_messages WHERE reporter_id = 42";
  std::vector<std::string> payloads;
  ASSERT_TRUE(testing::WaitUntil([&] {
    return !(payloads = testing::QueryStoreColumn(service.DatabasePath(), sent)).empty();
  })) << service.Log();
  EXPECT_EQ(nlohmann::ordered_json::parse(payloads[0]),
            nlohmann::ordered_json::parse(R"({"xruns": 3, "load": 0.25, "glitch": true,
              "route": "speaker and a name longer than the sixty-three bytes kept"})"));

  // Refused messages are counted, never queued.
  const tavrin_field many[TAVRIN_RT_MAX_FIELDS + 1] = {};
  EXPECT_EQ(tavrin_send_rt(client, nullptr, 0, 1, 0, many, TAVRIN_RT_MAX_FIELDS + 1),
            TAVRIN_ERR_TOO_LARGE);
  EXPECT_EQ(tavrin_rt_dropped(client), 1u);

  SendManyWithoutAllocatingOrLocking(client, reporter);
  EXPECT_TRUE(testing::WaitUntil([&] {
    return tavrin_rt_sent(client) + tavrin_rt_dropped(client) == 100'002;
  })) << tavrin_rt_sent(client)
      << " sent, " << tavrin_rt_dropped(client) << " dropped";

  // The service goes away: sends still neither allocate nor lock, and are counted as lost.
  const uint64_t sentBefore = tavrin_rt_sent(client);
  service.Stop(SIGKILL);
  SendManyWithoutAllocatingOrLocking(client, reporter);
  EXPECT_TRUE(testing::WaitUntil(
      [&] { return tavrin_rt_sent(client) + tavrin_rt_dropped(client) == 200'002; }));
  EXPECT_LT(tavrin_rt_sent(client) - sentBefore, 100'000u) << "sent to a service that is gone";

  // It comes back: the client reconnects, opens session 42 again, and sends reach the store.
  ASSERT_TRUE(service.Start()) << service.Log();
  ASSERT_TRUE(testing::WaitUntil([&] {
    tavrin_send_rt(client, &reporter, 1, 0x80000001, 2, kFields, 1);
    return testing::StoreCount(service.DatabasePath(),
                               "session_messages WHERE reporter_id = 42 AND type = 2") > 0;
  })) << service.Log();
  tavrin_close(client);
}

TEST(RealtimeSendE2eTest, AServiceThatNeverReadsOnlyFillsTheQueue) {
  // A listener that accepts and never reads: the background thread blocks in its write, the
  // queue fills, and the audio thread's sends keep returning at once.
  const std::string directory = testing::MakeTempDirectory("tavrin-rt-");
  const std::string path = directory + "/reporting.sock";
  const int listener = testing::BindUnixSocket(path, true);
  ASSERT_GE(listener, 0);
  tavrin_client* client = tavrin_open(path.c_str(), 64, nullptr);
  ASSERT_NE(client, nullptr);
  const int accepted = ::accept(listener, nullptr, nullptr);
  SendManyWithoutAllocatingOrLocking(client, 7);
  EXPECT_GT(tavrin_rt_dropped(client), 90'000u) << "the queue did not bound what waits";
  // Closing ends the stalled write by ending the connection from our side.
  ::close(accepted);
  tavrin_close(client);
  ::close(listener);
  std::filesystem::remove_all(directory);
}

}  // namespace
}  // namespace tavrin
