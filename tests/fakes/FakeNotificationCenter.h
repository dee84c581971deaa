#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/NotificationCenter.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Notifications posted by the test; handlers run on their queue like the real ones.
class FakeNotificationCenter final : public NotificationCenter, private GuardedState {
 public:
  int RegisterNotificationHandler(const std::string& name, int* token, WorkQueue& queue,
                                  Handler handler) override {
    std::lock_guard lock(mutex_);
    if (failWith != 0) return failWith;
    const int assigned = nextToken_++;
    *token = assigned;
    registrations_[assigned] = Registration{name, &queue, std::move(handler)};
    return 0;
  }
  void Cancel(int token) override {
    WithLock([&] { registrations_.erase(token); });
  }
  void Post(const std::string& name) override { PostWithToken(name, std::nullopt); }
  // Posts as if the registration's token were `token` (a stale or foreign token).
  void PostWithToken(const std::string& name, std::optional<int> token) {
    std::lock_guard lock(mutex_);
    for (auto& [assigned, registration] : registrations_) {
      if (registration.name != name) continue;
      const int delivered = token.value_or(assigned);
      registration.queue->Async(
          [handler = registration.handler, delivered] { handler(delivered); });
    }
  }

  int failWith = 0;  // a non-zero status makes registration fail

 private:
  struct Registration {
    std::string name;
    WorkQueue* queue;
    Handler handler;
  };
  std::map<int, Registration> registrations_;
  int nextToken_ = 1;
};

}  // namespace tavrin::testing
