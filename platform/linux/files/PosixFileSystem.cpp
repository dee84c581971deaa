#include "platform/linux/files/PosixFileSystem.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>

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

OptionalError PosixFileSystem::WriteFileAtomically(const std::string& path,
                                                   std::string_view contents) {
  const size_t slash = path.rfind('/');
  const std::string directory = slash == std::string::npos ? "" : path.substr(0, slash + 1);
  const std::string base = slash == std::string::npos ? path : path.substr(slash + 1);
  if (base.empty()) return ErrnoError(EISDIR, "write", path);

  std::string temporary;
  int fd = -1;
  for (int attempt = 0; attempt < kTemporaryNameAttempts && fd < 0; ++attempt) {
    temporary = TemporaryName(directory, base);
    fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    if (fd < 0 && errno != EEXIST) return ErrnoError(errno, "create", temporary);
  }
  if (fd < 0) return ErrnoError(EEXIST, "create", temporary);

  OptionalError error = WriteAll(fd, contents, temporary);
  if (!error && ::fsync(fd) != 0) error = ErrnoError(errno, "sync", temporary);
  if (::close(fd) != 0 && !error) error = ErrnoError(errno, "close", temporary);
  if (!error && ::rename(temporary.c_str(), path.c_str()) != 0) {
    error = ErrnoError(errno, "rename over", path);
  }
  if (error) {
    ::unlink(temporary.c_str());
    return error;
  }
  // Makes the rename itself durable; the file is in place either way, so a failure here is not
  // the caller's concern.
  const int directoryFd =
      ::open(directory.empty() ? "." : directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (directoryFd >= 0) {
    ::fsync(directoryFd);
    ::close(directoryFd);
  }
  return std::nullopt;
}

}  // namespace tavrin
