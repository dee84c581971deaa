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

}  // namespace tavrin::testing::tsan

extern "C" const char* __tsan_default_suppressions() { return "race:librdkafka.so.1\n"; }

extern "C" int thrd_create(thrd_t* thread, thrd_start_t function, void* argument) {
  auto* start = new tavrin::testing::tsan::ThreadStart{function, argument};
  const int rc = pthread_create(thread, nullptr, &tavrin::testing::tsan::RunC11Thread, start);
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

extern "C" int thrd_detach(thrd_t thread) {
  return pthread_detach(thread) == 0 ? thrd_success : thrd_error;
}

extern "C" int mtx_init(mtx_t* mutex, int type) {
  pthread_mutexattr_t attributes;
  pthread_mutexattr_init(&attributes);
  if (type & mtx_recursive) pthread_mutexattr_settype(&attributes, PTHREAD_MUTEX_RECURSIVE);
  const int rc = pthread_mutex_init(reinterpret_cast<pthread_mutex_t*>(mutex), &attributes);
  pthread_mutexattr_destroy(&attributes);
  return rc == 0 ? thrd_success : thrd_error;
}

extern "C" void mtx_destroy(mtx_t* mutex) {
  pthread_mutex_destroy(reinterpret_cast<pthread_mutex_t*>(mutex));
}

extern "C" int mtx_lock(mtx_t* mutex) {
  return pthread_mutex_lock(reinterpret_cast<pthread_mutex_t*>(mutex)) == 0 ? thrd_success
                                                                            : thrd_error;
}

extern "C" int mtx_unlock(mtx_t* mutex) {
  return pthread_mutex_unlock(reinterpret_cast<pthread_mutex_t*>(mutex)) == 0 ? thrd_success
                                                                              : thrd_error;
}

extern "C" int cnd_init(cnd_t* condition) {
  return pthread_cond_init(reinterpret_cast<pthread_cond_t*>(condition), nullptr) == 0
             ? thrd_success
             : thrd_error;
}

extern "C" void cnd_destroy(cnd_t* condition) {
  pthread_cond_destroy(reinterpret_cast<pthread_cond_t*>(condition));
}

extern "C" int cnd_signal(cnd_t* condition) {
  return pthread_cond_signal(reinterpret_cast<pthread_cond_t*>(condition)) == 0 ? thrd_success
                                                                                : thrd_error;
}

extern "C" int cnd_broadcast(cnd_t* condition) {
  return pthread_cond_broadcast(reinterpret_cast<pthread_cond_t*>(condition)) == 0 ? thrd_success
                                                                                   : thrd_error;
}

extern "C" int cnd_wait(cnd_t* condition, mtx_t* mutex) {
  return pthread_cond_wait(reinterpret_cast<pthread_cond_t*>(condition),
                           reinterpret_cast<pthread_mutex_t*>(mutex)) == 0
             ? thrd_success
             : thrd_error;
}

extern "C" int cnd_timedwait(cnd_t* __restrict condition, mtx_t* __restrict mutex,
                             const struct timespec* __restrict deadline) {
  const int rc = pthread_cond_timedwait(reinterpret_cast<pthread_cond_t*>(condition),
                                        reinterpret_cast<pthread_mutex_t*>(mutex), deadline);
  return rc == 0 ? thrd_success : rc == ETIMEDOUT ? thrd_timedout : thrd_error;
}

#endif  // __SANITIZE_THREAD__
