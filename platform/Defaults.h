#pragma once

#include <functional>
#include <string>

#include "platform/Dictionary.h"
#include "platform/WorkQueue.h"

namespace tavrin {

inline constexpr const char* kDefaultsDomainName = "com.quorvex.tavrin";
inline constexpr const char* kDefaultsNotificationName = "com.quorvex.tavrin.reporting";

// A defaults domain: settings by key. Read() opens the domain afresh every time.
class DefaultsDomain {
 public:
  virtual ~DefaultsDomain() = default;
  // Every key of the domain with its value (strings, booleans, integers, doubles, arrays, tables).
  // A missing domain reads as an empty dictionary; an unreadable one too, with one error line.
  virtual Dictionary Read() = 0;
};

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
