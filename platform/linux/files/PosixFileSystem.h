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
  // Writes a temporary file beside `path` (created with 0666 less the umask), syncs it and renames
  // it over `path`. On failure the temporary file is removed and `path` is untouched.
  OptionalError WriteFileAtomically(const std::string& path, std::string_view contents) override;
};

}  // namespace tavrin
