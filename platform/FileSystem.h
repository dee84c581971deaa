#pragma once

#include <string>
#include <string_view>

#include "base/Error.h"

namespace tavrin {

// The few file operations the core performs, behind an interface so tests can make them fail.
class FileSystem {
 public:
  virtual ~FileSystem() = default;
  // Creates `path` and any missing parents with permission bits `mode` (not reduced by the umask).
  // Succeeds when the directory already exists.
  virtual OptionalError CreateDirectories(const std::string& path, unsigned mode) = 0;
  // Writes `contents` to `path` atomically: readers see the old file or the whole new one.
  virtual OptionalError WriteFileAtomically(const std::string& path, std::string_view contents) = 0;
};

}  // namespace tavrin
