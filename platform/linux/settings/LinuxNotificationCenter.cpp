#include "platform/linux/settings/LinuxNotificationCenter.h"

#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/post.hpp>
#include <asio/signal_set.hpp>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <vector>

#include "platform/LogSystem.h"
#include "platform/linux/files/PosixFileSystem.h"

namespace tavrin {
namespace {

// Events that mean the watched file has new contents or is gone. IN_MODIFY is left out: a file
// being written is read once, when its writer closes it.
constexpr uint32_t kDirectoryEvents = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE |
                                      IN_CREATE | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

// Room for many events per read (each is at most sizeof(inotify_event) + NAME_MAX + 1), so a
// burst of one save is usually read, and coalesced, at once.
constexpr size_t kEventBufferBytes = 16 * 1024;

Error ErrnoError(int code, std::string_view what) {
  return Error{kPosixErrorDomain, code, fmt::format("{}: {}", what, std::strerror(code))};
}

struct Registration {
  std::string name;
  WorkQueue* queue;
  NotificationCenter::Handler handler;
  int token;
  std::atomic<bool> active{true};
};

}  // namespace

class LinuxNotificationCenter::State : public std::enable_shared_from_this<State> {
 public:
  explicit State(asio::io_context& io) : io_(io) {}

  int Register(const std::string& name, int* token, WorkQueue& queue, Handler handler) {
    if (name.empty()) return kNotifyStatusInvalidName;
    if (!token || !handler) return kNotifyStatusInvalidRequest;
    std::lock_guard lock(mutex_);
    if (closed_) return kNotifyStatusShutDown;
    auto registration = std::make_shared<Registration>();
    registration->name = name;
    registration->queue = &queue;
    registration->handler = std::move(handler);
    registration->token = nextToken_++;
    *token = registration->token;
    registrations_.emplace(registration->token, std::move(registration));
    return kNotifyStatusOk;
  }

  void Cancel(int token) {
    std::lock_guard lock(mutex_);
    const auto found = registrations_.find(token);
    if (found == registrations_.end()) return;
    found->second->active.store(false);
    registrations_.erase(found);
  }

  void Post(const std::string& name) {
    std::vector<std::shared_ptr<Registration>> targets;
    {
      std::lock_guard lock(mutex_);
      if (closed_) return;
      ++counters_.posts;
      for (const auto& [token, registration] : registrations_) {
        if (registration->name == name) targets.push_back(registration);
      }
      counters_.handlersQueued += targets.size();
    }
    // Queued outside the lock: a queue may run the work at once on another thread, and the
    // handler may register or cancel.
    for (auto& registration : targets) {
      WorkQueue* queue = registration->queue;
      queue->Async([registration = std::move(registration)] {
        if (registration->active.load()) registration->handler(registration->token);
      });
    }
  }

  OptionalError WatchFile(const std::string& path, std::string name) {
    const size_t slash = path.rfind('/');
    std::string directory = slash == std::string::npos ? "." : path.substr(0, slash);
    if (directory.empty()) directory = "/";
    std::string fileName = slash == std::string::npos ? path : path.substr(slash + 1);
    if (fileName.empty()) return ErrnoError(EINVAL, fmt::format("watch {}", path));

    const int fd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (fd < 0) return ErrnoError(errno, "inotify_init1");
    const int wd = ::inotify_add_watch(fd, directory.c_str(), kDirectoryEvents);
    if (wd < 0) {
      const int error = errno;
      ::close(fd);
      return ErrnoError(error, fmt::format("watch directory {}", directory));
    }

    std::lock_guard lock(mutex_);
    if (closed_) {
      ::close(fd);
      return ErrnoError(ECANCELED, fmt::format("watch {}", path));
    }
    auto watch = std::make_unique<FileWatch>(io_, fd);
    watch->wd = wd;
    watch->directory = std::move(directory);
    watch->fileName = std::move(fileName);
    watch->notification = std::move(name);
    watch->buffer.resize(kEventBufferBytes);
    FileWatch* raw = watch.get();
    fileWatches_.push_back(std::move(watch));
    // A new object that no other thread has seen yet; from here on only io_ touches it.
    ArmFileWatch(raw);
    return std::nullopt;
  }

  OptionalError PostOnSignal(int signal, std::string name) {
    std::lock_guard lock(mutex_);
    if (closed_) return ErrnoError(ECANCELED, "catch signal");
    // One set per signal: sets are not safe to change while io_ waits on them.
    auto set = std::make_unique<SignalWatch>(io_);
    asio::error_code error;
    set->signals.add(signal, error);
    if (error) {
      return Error{kPosixErrorDomain, error.value(),
                   fmt::format("catch signal {}: {}", signal, error.message())};
    }
    set->notification = std::move(name);
    SignalWatch* raw = set.get();
    signalWatches_.push_back(std::move(set));
    ArmSignalWatch(raw);
    return std::nullopt;
  }

  // Stops posting at once; the asio objects are closed on io_'s thread, where they are used.
  void Shutdown() {
    {
      std::lock_guard lock(mutex_);
      closed_ = true;
      for (auto& [token, registration] : registrations_) registration->active.store(false);
      registrations_.clear();
    }
    asio::post(io_, [self = shared_from_this()] { self->CloseWatchers(); });
  }

  Counters GetCounters() const {
    std::lock_guard lock(mutex_);
    return counters_;
  }

 private:
  struct FileWatch {
    FileWatch(asio::io_context& io, int fd) : descriptor(io, fd) {}
    asio::posix::stream_descriptor descriptor;
    int wd = -1;
    std::string directory;
    std::string fileName;
    std::string notification;
    std::vector<char> buffer;
  };
  struct SignalWatch {
    explicit SignalWatch(asio::io_context& io) : signals(io) {}
    asio::signal_set signals;
    std::string notification;
  };

  bool Closed() const {
    std::lock_guard lock(mutex_);
    return closed_;
  }

  void ArmFileWatch(FileWatch* watch) {
    watch->descriptor.async_wait(asio::posix::stream_descriptor::wait_read,
                                 [self = shared_from_this(), watch](const asio::error_code& error) {
                                   if (error || self->Closed()) return;
                                   if (self->ReadFileEvents(*watch)) self->ArmFileWatch(watch);
                                 });
  }

  // Reads every pending event; posts once if any concerns the file. Answers whether the watch
  // still stands.
  bool ReadFileEvents(FileWatch& watch) {
    bool changed = false;
    bool overflowed = false;
    bool directoryGone = false;
    uint64_t events = 0;
    const int fd = watch.descriptor.native_handle();
    for (;;) {
      const ssize_t count = ::read(fd, watch.buffer.data(), watch.buffer.size());
      if (count < 0) {
        if (errno == EINTR) continue;
        if (errno != EAGAIN) {
          TLOG_ERROR(nullptr, "reading file events of {} failed: {}", watch.directory,
                     std::strerror(errno));
          directoryGone = true;
        }
        break;
      }
      if (count == 0) break;
      for (ssize_t offset = 0; offset < count;) {
        inotify_event event;
        std::memcpy(&event, watch.buffer.data() + offset, sizeof event);
        const char* eventName = watch.buffer.data() + offset + sizeof event;
        offset += ssize_t(sizeof event + event.len);
        ++events;
        if (event.mask & IN_Q_OVERFLOW) {
          overflowed = true;
          continue;
        }
        if (event.mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT)) {
          directoryGone = true;
          continue;
        }
        if (event.len == 0 || watch.fileName != eventName) continue;
        if ((event.mask & IN_CREATE) && !CreatedWithoutWriter(watch)) continue;
        changed = true;
      }
    }
    if (directoryGone) {
      TLOG_ERROR(nullptr, "stopped watching {}/{}: its directory is gone or moved", watch.directory,
                 watch.fileName);
    }
    // Lost events may have been about the file; a gone directory took the file with it.
    const bool post = changed || overflowed || directoryGone;
    if (post) Post(watch.notification);
    // Counted after posting, so whoever sees the events counted finds their post already queued.
    std::lock_guard lock(mutex_);
    counters_.fileEvents += events;
    if (overflowed) ++counters_.fileEventOverflows;
    if (post) ++counters_.fileEventBatches;
    return !directoryGone;
  }

  // A regular file made by open() is followed by IN_CLOSE_WRITE once its writer is done, and is
  // read then. Anything else (a symbolic link, a hard link to a finished file) is complete now.
  static bool CreatedWithoutWriter(const FileWatch& watch) {
    const std::string path = watch.directory + "/" + watch.fileName;
    struct stat info {};
    if (::lstat(path.c_str(), &info) != 0) return true;
    return !S_ISREG(info.st_mode) || info.st_nlink > 1;
  }

  void ArmSignalWatch(SignalWatch* watch) {
    watch->signals.async_wait(
        [self = shared_from_this(), watch](const asio::error_code& error, int) {
          if (error || self->Closed()) return;
          {
            std::lock_guard lock(self->mutex_);
            ++self->counters_.signalsCaught;
          }
          self->Post(watch->notification);
          self->ArmSignalWatch(watch);
        });
  }

  void CloseWatchers() {
    // Both vectors only grow before closed_ is set and are read here after it, on io_'s thread.
    std::lock_guard lock(mutex_);
    for (auto& watch : fileWatches_) {
      asio::error_code ignored;
      watch->descriptor.close(ignored);
    }
    for (auto& watch : signalWatches_) {
      asio::error_code ignored;
      watch->signals.clear(ignored);
      watch->signals.cancel(ignored);
    }
  }

  asio::io_context& io_;
  mutable std::mutex mutex_;
  bool closed_ = false;                                         // guarded by mutex_
  int nextToken_ = 1;                                           // guarded by mutex_
  std::map<int, std::shared_ptr<Registration>> registrations_;  // guarded by mutex_
  std::vector<std::unique_ptr<FileWatch>> fileWatches_;         // guarded by mutex_
  std::vector<std::unique_ptr<SignalWatch>> signalWatches_;     // guarded by mutex_
  Counters counters_;                                           // guarded by mutex_
};

LinuxNotificationCenter::LinuxNotificationCenter(asio::io_context& io)
    : state_(std::make_shared<State>(io)) {}

LinuxNotificationCenter::~LinuxNotificationCenter() { state_->Shutdown(); }

int LinuxNotificationCenter::RegisterNotificationHandler(const std::string& name, int* token,
                                                         WorkQueue& queue, Handler handler) {
  return state_->Register(name, token, queue, std::move(handler));
}

void LinuxNotificationCenter::Cancel(int token) { state_->Cancel(token); }

void LinuxNotificationCenter::Post(const std::string& name) { state_->Post(name); }

OptionalError LinuxNotificationCenter::WatchFile(const std::string& path, std::string name) {
  return state_->WatchFile(path, std::move(name));
}

OptionalError LinuxNotificationCenter::PostOnSignal(int signal, std::string name) {
  return state_->PostOnSignal(signal, std::move(name));
}

OptionalError LinuxNotificationCenter::WatchDefaults(const std::string& path) {
  OptionalError signalError = PostOnSignal(SIGHUP, kDefaultsNotificationName);
  OptionalError fileError = WatchFile(path, kDefaultsNotificationName);
  return fileError ? fileError : signalError;
}

LinuxNotificationCenter::Counters LinuxNotificationCenter::GetCounters() const {
  return state_->GetCounters();
}

}  // namespace tavrin
