#include "platform/linux/settings/TomlDefaultsDomain.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <toml++/toml.h>
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <sstream>
#include <utility>
#include <vector>

#include "platform/LogSystem.h"

namespace tavrin {
namespace {

template <typename T>
std::string TomlText(const T& value) {
  std::ostringstream text;
  text << value;
  return text.str();
}

Value NodeToValue(const toml::node& node);

Dictionary TableToDictionary(const toml::table& table) {
  // toml::table keeps its keys sorted; the file's own order is the one a person expects to see.
  std::vector<std::pair<const toml::key*, const toml::node*>> entries;
  entries.reserve(table.size());
  for (const auto& [key, node] : table) entries.emplace_back(&key, &node);
  std::stable_sort(entries.begin(), entries.end(), [](const auto& a, const auto& b) {
    const auto& left = a.second->source().begin;
    const auto& right = b.second->source().begin;
    return std::pair(left.line, left.column) < std::pair(right.line, right.column);
  });
  Dictionary dictionary = MakeDictionary();
  for (const auto& [key, node] : entries) dictionary[std::string(key->str())] = NodeToValue(*node);
  return dictionary;
}

Value NodeToValue(const toml::node& node) {
  switch (node.type()) {
    case toml::node_type::table:
      return TableToDictionary(*node.as_table());
    case toml::node_type::array: {
      Value array = Value::array();
      for (const auto& element : *node.as_array()) array.push_back(NodeToValue(element));
      return array;
    }
    case toml::node_type::string:
      return Value(node.as_string()->get());
    case toml::node_type::integer:
      return Value(node.as_integer()->get());
    case toml::node_type::floating_point:
      return Value(node.as_floating_point()->get());
    case toml::node_type::boolean:
      return Value(node.as_boolean()->get());
    case toml::node_type::date:
      return Value(TomlText(node.as_date()->get()));
    case toml::node_type::time:
      return Value(TomlText(node.as_time()->get()));
    case toml::node_type::date_time:
      return Value(TomlText(node.as_date_time()->get()));
    case toml::node_type::none:
      break;
  }
  return Value();
}

std::string FileState(const struct stat& info) {
  return fmt::format("{}:{}:{}:{}.{}:{}.{}", info.st_dev, info.st_ino, info.st_size,
                     info.st_mtim.tv_sec, info.st_mtim.tv_nsec, info.st_ctim.tv_sec,
                     info.st_ctim.tv_nsec);
}

TomlFileLoad Failed(std::string error, std::string state) {
  TomlFileLoad load;
  load.status = TomlFileLoad::Status::kFailed;
  load.error = std::move(error);
  load.fileState = std::move(state);
  return load;
}

class FileCloser {
 public:
  explicit FileCloser(int fd) : fd_(fd) {}
  ~FileCloser() { ::close(fd_); }
  FileCloser(const FileCloser&) = delete;
  FileCloser& operator=(const FileCloser&) = delete;

 private:
  int fd_;
};

}  // namespace

TomlFileLoad LoadTomlFile(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY);
  if (fd < 0) {
    const int error = errno;
    if (error == ENOENT) return TomlFileLoad{};
    struct stat info {};
    const std::string state =
        ::stat(path.c_str(), &info) == 0 ? FileState(info) : fmt::format("errno {}", error);
    return Failed(fmt::format("cannot open {}: {}", path, std::strerror(error)), state);
  }
  FileCloser closer(fd);

  struct stat info {};
  if (::fstat(fd, &info) != 0) {
    const int error = errno;
    return Failed(fmt::format("cannot read {}: {}", path, std::strerror(error)),
                  fmt::format("errno {}", error));
  }
  const std::string state = FileState(info);
  if (!S_ISREG(info.st_mode)) return Failed(fmt::format("{} is not a regular file", path), state);
  if (info.st_size > off_t(kMaxTomlFileBytes)) {
    return Failed(fmt::format("{} is {} bytes, more than the limit of {}", path, info.st_size,
                              kMaxTomlFileBytes),
                  state);
  }

  std::string text;
  char buffer[8192];
  for (;;) {
    const ssize_t count = ::read(fd, buffer, sizeof buffer);
    if (count < 0) {
      if (errno == EINTR) continue;
      return Failed(fmt::format("cannot read {}: {}", path, std::strerror(errno)), state);
    }
    if (count == 0) break;
    text.append(buffer, size_t(count));
    // The file may have grown since fstat.
    if (text.size() > kMaxTomlFileBytes) {
      return Failed(fmt::format("{} is more than the limit of {} bytes", path, kMaxTomlFileBytes),
                    state);
    }
  }

  TomlFileLoad load;
#if TOML_EXCEPTIONS
  try {
    const toml::table table = toml::parse(text, path);
    load.values = TableToDictionary(table);
  } catch (const toml::parse_error& error) {
    return Failed(fmt::format("cannot parse {}: {} (line {}, column {})", path, error.description(),
                              error.source().begin.line, error.source().begin.column),
                  state);
  }
#else
  const toml::parse_result result = toml::parse(text, path);
  if (!result) {
    const auto& error = result.error();
    return Failed(fmt::format("cannot parse {}: {} (line {}, column {})", path, error.description(),
                              error.source().begin.line, error.source().begin.column),
                  state);
  }
  load.values = TableToDictionary(result.table());
#endif
  load.status = TomlFileLoad::Status::kOk;
  return load;
}

TomlDefaultsDomain::TomlDefaultsDomain(std::string path) : path_(std::move(path)) {}

Dictionary TomlDefaultsDomain::Read() {
  TomlFileLoad load = LoadTomlFile(path_);
  std::lock_guard lock(mutex_);
  if (load.status != TomlFileLoad::Status::kFailed) {
    lastLoggedFailure_.reset();
    lastGood_ = load.values;
    return std::move(load.values);
  }
  // Every Read of an unchanged broken file would repeat the same line.
  std::string failure = load.fileState + "\n" + load.error;
  const bool repeated = lastLoggedFailure_ == failure;
  lastLoggedFailure_ = std::move(failure);
  if (!repeated) {
    TLOG_ERROR(nullptr, "defaults domain {} unreadable, {}: {}", kDefaultsDomainName,
               lastGood_ ? "keeping the last settings that parsed"
                         : "reporting disabled until the file parses",
               load.error);
  }
  if (lastGood_) return *lastGood_;
  Dictionary closed = MakeDictionary();
  closed["disable_reporting"] = true;
  return closed;
}

}  // namespace tavrin
