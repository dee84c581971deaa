#include "CounterWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <system_error>

namespace tavrin::pwexport {

CounterWriter::CounterWriter(std::string root) : root_(std::move(root)) {}

std::string CounterWriter::SanitizeName(std::string_view raw) {
  std::string name;
  for (const char c : raw.substr(0, kMaxNameBytes)) {
    const bool safe = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                      c == '.' || c == '-' || c == '_';
    name.push_back(safe ? c : '_');
  }
  if (name.empty()) return "unnamed";
  if (name.front() == '.') name.front() = '_';
  return name;
}

bool CounterWriter::Write(std::string_view group, std::string_view subgroup, std::string_view name,
                          int64_t value, std::string* error) const {
  for (const std::string_view part : {group, subgroup, name}) {
    if (part.empty() || SanitizeName(part) != part) {
      *error = "unsafe counter name \"" + std::string(part) + "\"";
      return false;
    }
  }
  const std::filesystem::path dir =
      std::filesystem::path(root_) / std::string(group) / std::string(subgroup);
  std::error_code ec;
  std::filesystem::create_directories(dir, ec);
  if (ec) {
    *error = "cannot create " + dir.string() + ": " + ec.message();
    return false;
  }
  const std::string target = (dir / std::string(name)).string();
  const std::string temp = (dir / ("." + std::string(name) + ".tmp")).string();
  const std::string text = std::to_string(value) + "\n";

  const int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0644);
  if (fd < 0) {
    *error = "cannot create " + temp + ": " + std::strerror(errno);
    return false;
  }
  size_t written = 0;
  while (written < text.size()) {
    const ssize_t n = ::write(fd, text.data() + written, text.size() - written);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      *error = "cannot write " + temp + ": " + std::strerror(errno);
      ::close(fd);
      ::unlink(temp.c_str());
      return false;
    }
    written += size_t(n);
  }
  if (::close(fd) != 0) {
    *error = "cannot write " + temp + ": " + std::strerror(errno);
    ::unlink(temp.c_str());
    return false;
  }
  if (::rename(temp.c_str(), target.c_str()) != 0) {
    *error = "cannot rename " + temp + " to " + target + ": " + std::strerror(errno);
    ::unlink(temp.c_str());
    return false;
  }
  return true;
}

}  // namespace tavrin::pwexport
