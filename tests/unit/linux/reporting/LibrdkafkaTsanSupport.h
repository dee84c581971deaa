#pragma once

// For ThreadSanitizer builds of test programs that run librdkafka (include in exactly one source
// file of the program).
//
// librdkafka uses glibc's C11 threads, mutexes and conditions, which reach the thread library
// without passing the pthread calls that ThreadSanitizer intercepts. Threads it does not know
// crash it at their first intercepted call (malloc), and locks it does not see make it report
// races inside librdkafka that are none. These definitions, in the test program itself, take the
// place of glibc's for librdkafka and forward to the pthread calls, as glibc itself does (mtx_t
// and cnd_t are pthread_mutex_t and pthread_cond_t in glibc). Other builds are unaffected.
//
// librdkafka is not built for ThreadSanitizer, so its atomic reference counts are invisible too:
// a buffer it frees on one thread after a count drop looks like a race with the thread that read
// it before. Races with a librdkafka frame are therefore suppressed; races in our own code stay
// reported.

#if defined(__SANITIZE_THREAD__)

#include <pthread.h>
#include <threads.h>

#include <cerrno>
#include <cstdint>

namespace tavrin::testing::tsan {

struct ThreadStart {
  thrd_start_t function;
  void* argument;
};

inline void* RunC11Thread(void* raw) {
  const ThreadStart start = *static_cast<ThreadStart*>(raw);
  delete static_cast<ThreadStart*>(raw);
  return reinterpret_cast<void*>(static_cast<intptr_t>(start.function(start.argument)));
}
inline int Result(int rc) { return rc == 0 ? thrd_success : thrd_error; }
inline pthread_mutex_t* M(mtx_t* mutex) { return reinterpret_cast<pthread_mutex_t*>(mutex); }
inline pthread_cond_t* C(cnd_t* condition) { return reinterpret_cast<pthread_cond_t*>(condition); }

}  // namespace tavrin::testing::tsan

namespace tsan = tavrin::testing::tsan;

extern "C" const char* __tsan_default_suppressions() { return "race:librdkafka.so.1\n"; }

extern "C" int thrd_create(thrd_t* thread, thrd_start_t function, void* argument) {
  auto* start = new tsan::ThreadStart{function, argument};
  const int rc = pthread_create(thread, nullptr, &tsan::RunC11Thread, start);
  if (rc == 0) return thrd_success;
  delete start;
  return rc == EAGAIN ? thrd_nomem : thrd_error;
}
extern "C" int thrd_join(thrd_t thread, int* result) {
  void* value = nullptr;
  if (pthread_join(thread, &value) != 0) return thrd_error;
  if (result) *result = static_cast<int>(reinterpret_cast<intptr_t>(value));
  return thrd_success;
}
extern "C" int thrd_detach(thrd_t thread) { return tsan::Result(pthread_detach(thread)); }
extern "C" int mtx_init(mtx_t* m, int type) {
  pthread_mutexattr_t attributes;
  pthread_mutexattr_init(&attributes);
  if (type & mtx_recursive) pthread_mutexattr_settype(&attributes, PTHREAD_MUTEX_RECURSIVE);
  const int rc = pthread_mutex_init(tsan::M(m), &attributes);
  pthread_mutexattr_destroy(&attributes);
  return tsan::Result(rc);
}
extern "C" void mtx_destroy(mtx_t* m) { pthread_mutex_destroy(tsan::M(m)); }
extern "C" int mtx_lock(mtx_t* m) { return tsan::Result(pthread_mutex_lock(tsan::M(m))); }
extern "C" int mtx_unlock(mtx_t* m) { return tsan::Result(pthread_mutex_unlock(tsan::M(m))); }
extern "C" int cnd_init(cnd_t* c) { return tsan::Result(pthread_cond_init(tsan::C(c), nullptr)); }
extern "C" void cnd_destroy(cnd_t* c) { pthread_cond_destroy(tsan::C(c)); }
extern "C" int cnd_signal(cnd_t* c) { return tsan::Result(pthread_cond_signal(tsan::C(c))); }
extern "C" int cnd_broadcast(cnd_t* c) { return tsan::Result(pthread_cond_broadcast(tsan::C(c))); }
extern "C" int cnd_wait(cnd_t* c, mtx_t* m) {
  return tsan::Result(pthread_cond_wait(tsan::C(c), tsan::M(m)));
}
extern "C" int cnd_timedwait(cnd_t* __restrict c, mtx_t* __restrict m,
                             const struct timespec* __restrict deadline) {
  const int rc = pthread_cond_timedwait(tsan::C(c), tsan::M(m), deadline);
  return rc == ETIMEDOUT ? thrd_timedout : tsan::Result(rc);
}

#endif  // __SANITIZE_THREAD__
