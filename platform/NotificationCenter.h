#pragma once

#include <functional>
#include <string>

#include "platform/Dispatcher.h"

namespace tavrin {

inline constexpr const char* kDefaultsNotificationName = "com.quorvex.tavrin.reporting";

// Named system notifications delivered on work queues.
class NotificationCenter {
 public:
  using Handler = std::function<void(int token)>;
  virtual ~NotificationCenter() = default;
  // Registers `handler` for notification `name`; each post queues one call of the handler on
  // `queue`, given the registration's token, which is also stored in *token. Returns 0 on success,
  // a non-zero status code otherwise. `queue` must outlive the registration.
  virtual int RegisterNotificationHandler(const std::string& name, int* token, WorkQueue& queue,
                                          Handler handler) = 0;
  virtual void Cancel(int token) = 0;
  // Posts `name` to every handler registered for it.
  virtual void Post(const std::string& name) = 0;
};

}  // namespace tavrin
