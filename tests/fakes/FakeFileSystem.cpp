#include "tests/fakes/FakeFileSystem.h"

#include <algorithm>
#include <string_view>

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

// The path made absolute, without repeated or trailing "/".
std::string Normalize(std::string_view path) {
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

}  // namespace

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

class FakeFileSystem::Writer final : public WritableFile {
 public:
  Writer(FakeFileSystem& files, std::string path, bool atomic)
      : files_(files), path_(std::move(path)), atomic_(atomic) {}

  OptionalError Append(std::string_view bytes) override {
    if (atomic_) {
      contents_.append(bytes);
      return std::nullopt;
    }
    std::lock_guard lock(files_.mutex_);
    files_.files_[path_].append(bytes);
    return std::nullopt;
  }

  OptionalError Commit() override {
    if (!atomic_) return std::nullopt;
    std::lock_guard lock(files_.mutex_);
    if (OptionalError error = files_.CheckWriteLocked(path_)) return error;
    files_.files_[path_] = std::move(contents_);
    return std::nullopt;
  }

 private:
  FakeFileSystem& files_;
  const std::string path_;
  const bool atomic_;
  std::string contents_;
};

OptionalError FakeFileSystem::CheckWriteLocked(const std::string& path) {
  writeCalls_.push_back(path);
  if (writeError_) return writeError_;
  if (directories_.count(path) > 0) return FileError(kIsADirectory, "Is a directory", path);
  if (directories_.count(Parent(path)) == 0) {
    return FileError(kNoSuchFile, "No such file or directory", path);
  }
  return std::nullopt;
}

std::unique_ptr<WritableFile> FakeFileSystem::BeginAtomicWrite(const std::string& path,
                                                               OptionalError* /*error*/) {
  return std::make_unique<Writer>(*this, Normalize(path), true);
}

std::unique_ptr<WritableFile> FakeFileSystem::OpenForAppend(const std::string& path,
                                                            unsigned /*mode*/,
                                                            OptionalError* error) {
  const std::string normalized = Normalize(path);
  std::lock_guard lock(mutex_);
  if (directories_.count(normalized) > 0 || directories_.count(Parent(normalized)) == 0) {
    *error = FileError(kNoSuchFile, "No such file or directory", normalized);
    return nullptr;
  }
  files_[normalized];
  return std::make_unique<Writer>(*this, normalized, false);
}

std::unique_ptr<ReadableFile> FakeFileSystem::OpenForReading(const std::string& path,
                                                             OptionalError* error) {
  class Reader final : public ReadableFile {
   public:
    explicit Reader(std::string contents) : contents_(std::move(contents)) {}
    OptionalError Read(size_t limit, std::string* bytes) override {
      *bytes = contents_.substr(std::min(position_, contents_.size()), limit);
      position_ += bytes->size();
      return std::nullopt;
    }

   private:
    const std::string contents_;
    size_t position_ = 0;
  };
  std::optional<std::string> contents = ReadFile(path);
  if (!contents) {
    *error = FileError(kNoSuchFile, "No such file or directory", Normalize(path));
    return nullptr;
  }
  return std::make_unique<Reader>(std::move(*contents));
}

OptionalError FakeFileSystem::RemoveFile(const std::string& path) {
  std::lock_guard lock(mutex_);
  if (files_.erase(Normalize(path)) == 0) {
    return FileError(kNoSuchFile, "No such file or directory", Normalize(path));
  }
  return std::nullopt;
}

std::vector<std::string> FakeFileSystem::ListFiles(const std::string& path) {
  const std::string directory = Normalize(path);
  std::lock_guard lock(mutex_);
  std::vector<std::string> names;
  for (const auto& [name, contents] : files_) {
    if (Parent(name) == directory) names.push_back(name.substr(name.find_last_of('/') + 1));
  }
  return names;
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

}  // namespace tavrin::testing
