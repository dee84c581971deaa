#include "platform/linux/orientation/OrientationCallbacks.h"

#include <exception>
#include <utility>
#include <vector>

namespace tavrin {
namespace {

std::string_view KindName(OrientationKind kind) {
  return kind == OrientationKind::kDevice ? "device" : "ui";
}

}  // namespace

void OrientationCallbacks::Register(OrientationKind kind, const std::string& id,
                                    OrientationRegistry::Callback callback) {
  if (!callback) {
    TLOG_ERROR(log_, "empty {} orientation callback for \"{}\" refused", KindName(kind), id);
    return;
  }
  auto shared = std::make_shared<const OrientationRegistry::Callback>(std::move(callback));
  std::shared_ptr<const OrientationRegistry::Callback> replaced;
  {
    std::lock_guard lock(mutex_);
    Entry& entry = TableLocked(kind)[id];
    replaced = std::move(entry.callback);
    entry = Entry{nextSerial_++, std::move(shared)};
  }
  // `replaced` may hold the last reference to what the old callback captured: released here,
  // outside the lock.
}

void OrientationCallbacks::Unregister(OrientationKind kind, const std::string& id) {
  std::shared_ptr<const OrientationRegistry::Callback> dropped;
  {
    std::unique_lock lock(mutex_);
    Table& table = TableLocked(kind);
    const auto it = table.find(id);
    if (it == table.end()) return;
    const uint64_t serial = it->second.serial;
    dropped = std::move(it->second.callback);
    table.erase(it);
    if (std::this_thread::get_id() != deliveringThread_) {
      callbackReturned_.wait(lock, [&] { return runningSerial_ != serial; });
    }
  }
}

size_t OrientationCallbacks::Deliver(OrientationKind kind, const OrientationValue& value) {
  std::vector<std::pair<std::string, uint64_t>> picked;
  {
    std::lock_guard lock(mutex_);
    deliveringThread_ = std::this_thread::get_id();
    for (const auto& [id, entry] : TableLocked(kind)) picked.emplace_back(id, entry.serial);
  }
  size_t called = 0;
  for (const auto& [id, serial] : picked) {
    std::shared_ptr<const OrientationRegistry::Callback> callback;
    {
      std::lock_guard lock(mutex_);
      const Table& table = TableLocked(kind);
      const auto it = table.find(id);
      if (it == table.end() || it->second.serial != serial) continue;
      callback = it->second.callback;
      runningSerial_ = serial;
    }
    try {
      (*callback)(value);
    } catch (const std::exception& e) {
      TLOG_ERROR(log_, "{} orientation callback of \"{}\" threw: {}", KindName(kind), id, e.what());
    } catch (...) {
      TLOG_ERROR(log_, "{} orientation callback of \"{}\" threw", KindName(kind), id);
    }
    ++called;
    // Released before the waiting Unregister is let go, so that the callback's captures are gone
    // by the time it returns.
    callback.reset();
    {
      std::lock_guard lock(mutex_);
      runningSerial_ = 0;
    }
    callbackReturned_.notify_all();
  }
  {
    std::lock_guard lock(mutex_);
    deliveringThread_ = std::thread::id();
  }
  return called;
}

size_t OrientationCallbacks::Count(OrientationKind kind) const {
  std::lock_guard lock(mutex_);
  return TableLocked(kind).size();
}

}  // namespace tavrin
