#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/FileSystem.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Files and directories in memory, with errors that can be injected per operation. Like a real
// file system, a write needs its parent directory, and a path
// cannot be both a file and a directory. Paths are absolute; repeated and trailing "/" are
// ignored. Thread-safe.
class FakeFileSystem final : public FileSystem, private GuardedState {
 public:
  static constexpr const char* kErrorDomain = "com.quorvex.tavrin.fake.files";
  static constexpr int64_t kNoSuchFile = 2;      // ENOENT
  static constexpr int64_t kNotADirectory = 20;  // ENOTDIR
  static constexpr int64_t kIsADirectory = 21;   // EISDIR

  OptionalError CreateDirectories(const std::string& path, unsigned mode) override;
  // The file appears whole at Commit, which is where write errors are reported.
  std::unique_ptr<WritableFile> BeginAtomicWrite(const std::string& path,
                                                 OptionalError* error) override;
  std::unique_ptr<WritableFile> OpenForAppend(const std::string& path, unsigned mode,
                                              OptionalError* error) override;
  // Reads the file as it was when opened.
  std::unique_ptr<ReadableFile> OpenForReading(const std::string& path,
                                               OptionalError* error) override;
  OptionalError RemoveFile(const std::string& path) override;
  std::vector<std::string> ListFiles(const std::string& path) override;

  // Every CreateDirectories call, or every committed write, fails with `error` while it is set (and
  // changes nothing).
  void FailCreateDirectories(OptionalError error) { Set(createError_, std::move(error)); }
  void FailWrites(OptionalError error) { Set(writeError_, std::move(error)); }

  // Adds a directory (and its parents) directly, as if it had been there before.
  void AddDirectory(const std::string& path, unsigned mode = 0755);

  std::optional<std::string> ReadFile(const std::string& path) const;
  // Every file by path.
  std::map<std::string, std::string> Files() const { return Locked(files_); }
  // Every directory by path, with its mode.
  std::map<std::string, unsigned> Directories() const { return Locked(directories_); }
  std::vector<std::pair<std::string, unsigned>> CreateDirectoriesCalls() const {
    return Locked(createCalls_);
  }
  std::vector<std::string> WriteCalls() const { return Locked(writeCalls_); }

 private:
  class Writer;
  void AddDirectoryLocked(const std::string& path, unsigned mode);
  // Checks a write of `path` and records the call.
  OptionalError CheckWriteLocked(const std::string& path);

  std::map<std::string, std::string> files_;                   // guarded by mutex_
  std::map<std::string, unsigned> directories_{{"/", 0755}};   // guarded by mutex_
  OptionalError createError_;                                  // guarded by mutex_
  OptionalError writeError_;                                   // guarded by mutex_
  std::vector<std::pair<std::string, unsigned>> createCalls_;  // guarded by mutex_
  std::vector<std::string> writeCalls_;                        // guarded by mutex_
};

}  // namespace tavrin::testing
