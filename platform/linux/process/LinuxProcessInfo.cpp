#include "platform/linux/process/LinuxProcessInfo.h"

#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include <fmt/format.h>

namespace tavrin {
namespace {

// The kernel's TASK_COMM_LEN is 16 with the terminator; a little slack shows a longer record.
constexpr size_t kCommandNameReadBytes = 64;

std::optional<std::string> ReadCommandName(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  char buffer[kCommandNameReadBytes];
  ssize_t count;
  do {
    count = ::read(fd, buffer, sizeof buffer);
  } while (count < 0 && errno == EINTR);
  ::close(fd);
  if (count <= 0) return std::nullopt;
  std::string name(buffer, size_t(count));
  if (!name.empty() && name.back() == '\n') name.pop_back();
  if (name.empty()) return std::nullopt;
  return name;
}

}  // namespace

int32_t LinuxProcessInfo::OwnProcessIdentifier() const { return int32_t(::getpid()); }

std::string LinuxProcessInfo::OwnProcessName() const {
  if (auto name = ReadCommandName("/proc/self/comm")) return *name;
  return program_invocation_short_name;
}

std::optional<std::string> LinuxProcessInfo::CommandName(int32_t pid) const {
  if (pid <= 0) return std::nullopt;
  return ReadCommandName(fmt::format("/proc/{}/comm", pid));
}

}  // namespace tavrin
