#pragma once

#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"

namespace tavrin {

enum class OrientationKind : uint8_t { kDevice, kUI };

// The name of a registry's own thread (at most 15 characters, the kernel's limit).
inline constexpr char kOrientationThreadName[] = "tavrin-orient";

// The registered callbacks of a Linux orientation registry, both kinds, with the delivery rule
// every registry here shares. The registry's one thread calls Deliver; any thread registers and
// unregisters.
//
// Unregistering: after Unregister(kind, id) returns, the callback of `id` is not called again,
// even when Deliver had already picked it for the value it is delivering (each callback is looked
// up again just before it is called). If the callback is running on the delivering thread at that
// moment, Unregister waits for it to return, and the callback object (with whatever it captured)
// has been destroyed by the time Unregister returns. Called on the delivering thread itself (from
// inside a callback, which may unregister itself or any other), Unregister never waits, so it
// cannot deadlock there. A caller on another thread must not hold anything the callback needs
// while unregistering; that would deadlock as any wait-for-completion does.
//
// No lock is held while a callback runs: callbacks may register and unregister freely, and a slow
// callback holds up only an Unregister of that same callback.
class OrientationCallbacks {
 public:
  explicit OrientationCallbacks(LogHandle log = nullptr) : log_(std::move(log)) {}
  OrientationCallbacks(const OrientationCallbacks&) = delete;
  OrientationCallbacks& operator=(const OrientationCallbacks&) = delete;

  // Registering an identifier again replaces its callback. An empty callback is refused with an
  // error line.
  void Register(OrientationKind kind, const std::string& id,
                OrientationRegistry::Callback callback);
  // Unknown identifiers are ignored.
  void Unregister(OrientationKind kind, const std::string& id);

  // Calls every callback of `kind` registered when it starts, in identifier order, on the calling
  // thread. One thread at a time (the registry's own) may deliver. An exception thrown by a
  // callback is logged and does not stop the others. Returns how many callbacks were called.
  size_t Deliver(OrientationKind kind, const OrientationValue& value);

  size_t Count(OrientationKind kind) const;

 private:
  struct Entry {
    uint64_t serial;
    std::shared_ptr<const OrientationRegistry::Callback> callback;
  };
  using Table = std::map<std::string, Entry>;

  Table& TableLocked(OrientationKind kind) {
    return kind == OrientationKind::kDevice ? device_ : ui_;
  }
  const Table& TableLocked(OrientationKind kind) const {
    return kind == OrientationKind::kDevice ? device_ : ui_;
  }

  const LogHandle log_;
  mutable std::mutex mutex_;
  std::condition_variable callbackReturned_;
  // Guarded by mutex_.
  Table device_;
  Table ui_;
  uint64_t nextSerial_ = 1;
  uint64_t runningSerial_ = 0;  // serial of the callback being called; 0 when none
  std::thread::id deliveringThread_;
};

}  // namespace tavrin
