#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "base/Error.h"
#include "platform/NotificationCenter.h"

namespace asio {
class io_context;
}

namespace tavrin {

// Status codes of RegisterNotificationHandler.
inline constexpr int kNotifyStatusOk = 0;
inline constexpr int kNotifyStatusInvalidName = 1;     // empty notification name
inline constexpr int kNotifyStatusInvalidRequest = 2;  // no token holder or no handler
inline constexpr int kNotifyStatusShutDown = 3;        // the center is being destroyed

// Named notifications within the process, plus watchers that post them when a file changes or a
// signal arrives. Watchers run on `io` (no thread of their own): inotify and the signal set are
// asio objects of that context. Handlers run on the work queue given at registration.
//
// Thread-safe. `io` must outlive this object; the watchers' last completions run on `io` after
// destruction (they do nothing then), or are dropped when `io` is destroyed.
class LinuxNotificationCenter final : public NotificationCenter {
 public:
  explicit LinuxNotificationCenter(asio::io_context& io);
  ~LinuxNotificationCenter() override;

  LinuxNotificationCenter(const LinuxNotificationCenter&) = delete;
  LinuxNotificationCenter& operator=(const LinuxNotificationCenter&) = delete;

  // Tokens are distinct for the life of the center. A handler queued before Cancel() but not yet
  // run is skipped; Cancel() does not wait for a handler that is already running.
  int RegisterNotificationHandler(const std::string& name, int* token, WorkQueue& queue,
                                  Handler handler) override;
  void Cancel(int token) override;
  void Post(const std::string& name) override;

  // Posts `name` whenever the file at `path` is written and closed, replaced by a rename over it
  // (editors write a temporary and rename it), created as a link, or removed. The file's directory
  // is watched, so the file need not exist yet, but the directory must. Events read together are
  // coalesced into one post.
  OptionalError WatchFile(const std::string& path, std::string name);
  // Posts `name` each time `signal` arrives. The signal is caught (not left to its default
  // action) for the life of this object.
  OptionalError PostOnSignal(int signal, std::string name);
  // The service's defaults watch: kDefaultsNotificationName on changes of `path` and on SIGHUP.
  // A directory that cannot be watched is an error, but SIGHUP is caught all the same.
  OptionalError WatchDefaults(const std::string& path);

  // What the watchers saw, for a person reading the service's diagnostics.
  struct Counters {
    uint64_t posts = 0;               // Post() calls, from watchers or callers
    uint64_t handlersQueued = 0;      // handler calls queued on work queues
    uint64_t fileEvents = 0;          // inotify events read, about any file of the directories
    uint64_t fileEventBatches = 0;    // reads of inotify events that posted a notification
    uint64_t fileEventOverflows = 0;  // kernel queue overflows (events lost; posted anyway)
    uint64_t signalsCaught = 0;
  };
  Counters GetCounters() const;

 private:
  class State;
  std::shared_ptr<State> state_;
};

}  // namespace tavrin
