#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"

namespace tavrin {

// A file written a piece at a time. Closed when destroyed.
class WritableFile {
 public:
  virtual ~WritableFile() = default;
  virtual OptionalError Append(std::string_view bytes) = 0;
  // For a file opened by BeginAtomicWrite: syncs it and puts it in place of the target. Without
  // a successful Commit the target is left as it was and the partial file is removed.
  virtual OptionalError Commit() = 0;
};

// A file read from start to end a piece at a time. Closed when destroyed.
class ReadableFile {
 public:
  virtual ~ReadableFile() = default;
  // Replaces `bytes` with the next at most `limit` bytes; empty at the end of the file.
  virtual OptionalError Read(size_t limit, std::string* bytes) = 0;
};

// The file operations the core performs, behind an interface so tests can make them fail.
class FileSystem {
 public:
  virtual ~FileSystem() = default;
  // Creates `path` and any missing parents with permission bits `mode` (not reduced by the umask).
  // Succeeds when the directory already exists.
  virtual OptionalError CreateDirectories(const std::string& path, unsigned mode) = 0;
  // Writes `contents` to `path` atomically: readers see the old file or the whole new one.
  OptionalError WriteFileAtomically(const std::string& path, std::string_view contents);
  // The same, for contents appended in pieces; null with `error` set when the file cannot be made.
  virtual std::unique_ptr<WritableFile> BeginAtomicWrite(const std::string& path,
                                                         OptionalError* error) = 0;
  // Opens `path` for appending, creating it with permission bits `mode` when missing; every
  // Append reaches the file (not a buffer of this process) before it returns, and Commit does
  // nothing. Null with `error` set on failure.
  virtual std::unique_ptr<WritableFile> OpenForAppend(const std::string& path, unsigned mode,
                                                      OptionalError* error) = 0;
  virtual std::unique_ptr<ReadableFile> OpenForReading(const std::string& path,
                                                       OptionalError* error) = 0;
  virtual OptionalError RemoveFile(const std::string& path) = 0;
  // The names of the files in `path`, sorted; none when it does not exist.
  virtual std::vector<std::string> ListFiles(const std::string& path) = 0;
};

}  // namespace tavrin
