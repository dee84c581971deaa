#include "tests/fakes/FakeFileSystem.h"

namespace tavrin::testing {
namespace {

std::string Parent(const std::string& path) {
  const size_t slash = path.find_last_of('/');
  if (slash == std::string::npos || slash == 0) return "/";
  return path.substr(0, slash);
}

Error FileError(int64_t code, const std::string& what, const std::string& path) {
  return Error{FakeFileSystem::kErrorDomain, code, what + ": " + path};
}

}  // namespace

std::string FakeFileSystem::Normalize(std::string_view path) {
  std::string normalized = "/";
  size_t position = 0;
  while (position < path.size()) {
    const size_t slash = path.find('/', position);
    const size_t end = slash == std::string_view::npos ? path.size() : slash;
    if (end > position) {
      if (normalized.size() > 1) normalized += '/';
      normalized.append(path.substr(position, end - position));
    }
    position = end + 1;
  }
  return normalized;
}

OptionalError FakeFileSystem::CreateDirectories(const std::string& path, unsigned mode) {
  const std::string normalized = Normalize(path);
  std::lock_guard lock(mutex_);
  createCalls_.emplace_back(normalized, mode);
  if (createError_) return createError_;
  // Refuse if any component is a file.
  for (std::string at = normalized;; at = Parent(at)) {
    if (files_.count(at) > 0) return FileError(kNotADirectory, "Not a directory", at);
    if (at == "/") break;
  }
  AddDirectoryLocked(normalized, mode);
  return std::nullopt;
}

OptionalError FakeFileSystem::WriteFileAtomically(const std::string& path,
                                                  std::string_view contents) {
  const std::string normalized = Normalize(path);
  std::lock_guard lock(mutex_);
  writeCalls_.push_back(normalized);
  if (writeError_) return writeError_;
  if (directories_.count(normalized) > 0) {
    return FileError(kIsADirectory, "Is a directory", normalized);
  }
  if (directories_.count(Parent(normalized)) == 0) {
    return FileError(kNoSuchFile, "No such file or directory", normalized);
  }
  files_[normalized] = std::string(contents);
  return std::nullopt;
}

void FakeFileSystem::FailCreateDirectories(OptionalError error) {
  std::lock_guard lock(mutex_);
  createError_ = std::move(error);
}

void FakeFileSystem::FailWrites(OptionalError error) {
  std::lock_guard lock(mutex_);
  writeError_ = std::move(error);
}

void FakeFileSystem::AddDirectory(const std::string& path, unsigned mode) {
  std::lock_guard lock(mutex_);
  AddDirectoryLocked(Normalize(path), mode);
}

void FakeFileSystem::AddDirectoryLocked(const std::string& path, unsigned mode) {
  for (std::string at = path; directories_.count(at) == 0; at = Parent(at)) {
    directories_[at] = mode;
  }
}

std::optional<std::string> FakeFileSystem::ReadFile(const std::string& path) const {
  std::lock_guard lock(mutex_);
  const auto found = files_.find(Normalize(path));
  if (found == files_.end()) return std::nullopt;
  return found->second;
}

std::map<std::string, std::string> FakeFileSystem::Files() const {
  std::lock_guard lock(mutex_);
  return files_;
}

std::map<std::string, unsigned> FakeFileSystem::Directories() const {
  std::lock_guard lock(mutex_);
  return directories_;
}

std::vector<std::pair<std::string, unsigned>> FakeFileSystem::CreateDirectoriesCalls() const {
  std::lock_guard lock(mutex_);
  return createCalls_;
}

std::vector<std::string> FakeFileSystem::WriteCalls() const {
  std::lock_guard lock(mutex_);
  return writeCalls_;
}

}  // namespace tavrin::testing
