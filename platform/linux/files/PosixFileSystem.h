#pragma once

#include <string>
#include <string_view>

#include "platform/FileSystem.h"

namespace tavrin {

// Errors of PosixFileSystem: the code is errno's, the description names the operation, the path
// and strerror's text.
inline constexpr const char* kPosixErrorDomain = "com.quorvex.tavrin.posix";

class PosixFileSystem final : public FileSystem {
 public:
  // Every directory it creates gets exactly `mode` (chmod after mkdir, since the umask reduces
  // mkdir's mode); directories that exist already are left as they are.
  OptionalError CreateDirectories(const std::string& path, unsigned mode) override;
  // Writes a temporary file beside `path` (created with 0666 less the umask); Commit syncs it and
  // renames it over `path`. On failure the temporary file is removed and `path` is untouched.
  std::unique_ptr<WritableFile> BeginAtomicWrite(const std::string& path,
                                                 OptionalError* error) override;
  // Appends with one write(2) per piece (O_APPEND), so what a call wrote survives the process.
  std::unique_ptr<WritableFile> OpenForAppend(const std::string& path, unsigned mode,
                                              OptionalError* error) override;
  std::unique_ptr<ReadableFile> OpenForReading(const std::string& path,
                                               OptionalError* error) override;
  OptionalError RemoveFile(const std::string& path) override;
  std::vector<std::string> ListFiles(const std::string& path) override;
};

}  // namespace tavrin
