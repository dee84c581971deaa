#include "platform/linux/files/PosixFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <utility>

#include <fmt/format.h>

namespace tavrin {
namespace {

// Temporary names are unique per process and call; a clash means a leftover of a crashed
// process with a recycled pid, so a few more tries always find a free name.
constexpr int kTemporaryNameAttempts = 16;

Error ErrnoError(int code, std::string_view operation, const std::string& path) {
  return Error{kPosixErrorDomain, code,
               fmt::format("{} {}: {}", operation, path, std::strerror(code))};
}

bool IsDirectory(const std::string& path) {
  struct stat info {};
  return ::stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

std::string TemporaryName(const std::string& directory, std::string_view base) {
  static std::atomic<uint64_t> counter{0};
  const auto now = std::chrono::steady_clock::now().time_since_epoch().count();
  return fmt::format("{}.{}.{}.{}.{:x}.tmp", directory, base, ::getpid(), counter.fetch_add(1),
                     uint64_t(now) & 0xffffff);
}

OptionalError WriteAll(int fd, std::string_view contents, const std::string& path) {
  const char* data = contents.data();
  size_t left = contents.size();
  while (left > 0) {
    const ssize_t written = ::write(fd, data, left);
    if (written < 0) {
      if (errno == EINTR) continue;
      return ErrnoError(errno, "write", path);
    }
    data += written;
    left -= size_t(written);
  }
  return std::nullopt;
}

}  // namespace

OptionalError PosixFileSystem::CreateDirectories(const std::string& path, unsigned mode) {
  if (path.empty()) return ErrnoError(EINVAL, "create directory", path);
  const mode_t bits = mode_t(mode & 07777);
  size_t end = 0;
  while (end != std::string::npos) {
    end = path.find('/', end + 1);
    const std::string prefix = path.substr(0, end);
    // "/", "a//b" and a trailing slash give empty or repeated prefixes.
    if (prefix.empty() || prefix.back() == '/') continue;
    if (::mkdir(prefix.c_str(), bits) == 0) {
      if (::chmod(prefix.c_str(), bits) != 0) return ErrnoError(errno, "chmod", prefix);
      continue;
    }
    const int error = errno;
    // EEXIST, or EACCES/EROFS for a directory that exists where nothing may be created.
    if (IsDirectory(prefix)) continue;
    return ErrnoError(error == EEXIST ? ENOTDIR : error, "create directory", prefix);
  }
  return std::nullopt;
}

namespace {

// A file descriptor that is closed once, by whoever holds it last.
class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() { Close(); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int get() const { return fd_; }
  // The close error matters for a file being written: it may be the first report of a failed
  // write-back.
  int Close() {
    const int result = fd_ >= 0 ? ::close(fd_) : 0;
    fd_ = -1;
    return result;
  }

 private:
  int fd_;
};

class PosixAppendFile final : public WritableFile {
 public:
  PosixAppendFile(int fd, std::string path) : fd_(fd), path_(std::move(path)) {}
  OptionalError Append(std::string_view bytes) override {
    return WriteAll(fd_.get(), bytes, path_);
  }
  OptionalError Commit() override { return std::nullopt; }

 private:
  Descriptor fd_;
  const std::string path_;
};

class PosixAtomicFile final : public WritableFile {
 public:
  PosixAtomicFile(int fd, std::string temporary, std::string path, std::string directory)
      : fd_(fd),
        temporary_(std::move(temporary)),
        path_(std::move(path)),
        directory_(std::move(directory)) {}
  ~PosixAtomicFile() override {
    if (!committed_) {
      fd_.Close();
      ::unlink(temporary_.c_str());
    }
  }

  OptionalError Append(std::string_view bytes) override {
    return WriteAll(fd_.get(), bytes, temporary_);
  }

  OptionalError Commit() override {
    OptionalError error;
    if (::fsync(fd_.get()) != 0) error = ErrnoError(errno, "sync", temporary_);
    if (fd_.Close() != 0 && !error) error = ErrnoError(errno, "close", temporary_);
    if (!error && ::rename(temporary_.c_str(), path_.c_str()) != 0) {
      error = ErrnoError(errno, "rename over", path_);
    }
    if (error) return error;
    committed_ = true;
    // Makes the rename itself durable; the file is in place either way, so a failure here is
    // not the caller's concern.
    const int directoryFd =
        ::open(directory_.empty() ? "." : directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (directoryFd >= 0) {
      ::fsync(directoryFd);
      ::close(directoryFd);
    }
    return std::nullopt;
  }

 private:
  Descriptor fd_;
  const std::string temporary_;
  const std::string path_;
  const std::string directory_;
  bool committed_ = false;
};

class PosixReadableFile final : public ReadableFile {
 public:
  PosixReadableFile(int fd, std::string path) : fd_(fd), path_(std::move(path)) {}
  OptionalError Read(size_t limit, std::string* bytes) override {
    bytes->resize(limit);
    for (;;) {
      const ssize_t got = ::read(fd_.get(), bytes->data(), limit);
      if (got >= 0) {
        bytes->resize(size_t(got));
        return std::nullopt;
      }
      if (errno != EINTR) {
        bytes->clear();
        return ErrnoError(errno, "read", path_);
      }
    }
  }

 private:
  Descriptor fd_;
  const std::string path_;
};

}  // namespace

std::unique_ptr<WritableFile> PosixFileSystem::BeginAtomicWrite(const std::string& path,
                                                                OptionalError* error) {
  const size_t slash = path.rfind('/');
  const std::string directory = slash == std::string::npos ? "" : path.substr(0, slash + 1);
  const std::string base = slash == std::string::npos ? path : path.substr(slash + 1);
  if (base.empty()) {
    *error = ErrnoError(EISDIR, "write", path);
    return nullptr;
  }
  std::string temporary;
  int fd = -1;
  for (int attempt = 0; attempt < kTemporaryNameAttempts && fd < 0; ++attempt) {
    temporary = TemporaryName(directory, base);
    fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    if (fd < 0 && errno != EEXIST) {
      *error = ErrnoError(errno, "create", temporary);
      return nullptr;
    }
  }
  if (fd < 0) {
    *error = ErrnoError(EEXIST, "create", temporary);
    return nullptr;
  }
  return std::make_unique<PosixAtomicFile>(fd, std::move(temporary), path, directory);
}

std::unique_ptr<WritableFile> PosixFileSystem::OpenForAppend(const std::string& path, unsigned mode,
                                                             OptionalError* error) {
  const int fd =
      ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, mode_t(mode & 07777));
  if (fd < 0) {
    *error = ErrnoError(errno, "open for appending", path);
    return nullptr;
  }
  return std::make_unique<PosixAppendFile>(fd, path);
}

std::unique_ptr<ReadableFile> PosixFileSystem::OpenForReading(const std::string& path,
                                                              OptionalError* error) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    *error = ErrnoError(errno, "open", path);
    return nullptr;
  }
  return std::make_unique<PosixReadableFile>(fd, path);
}

OptionalError PosixFileSystem::RemoveFile(const std::string& path) {
  if (::unlink(path.c_str()) != 0) return ErrnoError(errno, "remove", path);
  return std::nullopt;
}

std::vector<std::string> PosixFileSystem::ListFiles(const std::string& path) {
  std::vector<std::string> names;
  DIR* directory = ::opendir(path.c_str());
  if (directory == nullptr) return names;
  while (const dirent* entry = ::readdir(directory)) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    struct stat info {};
    if (::stat((path + "/" + name).c_str(), &info) == 0 && S_ISREG(info.st_mode)) {
      names.push_back(name);
    }
  }
  ::closedir(directory);
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace tavrin
