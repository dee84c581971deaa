#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tavrin {

// Kernel process information.
class ProcessInfo {
 public:
  virtual ~ProcessInfo() = default;
  virtual int32_t OwnProcessIdentifier() const = 0;
  // The running process's own name.
  virtual std::string OwnProcessName() const = 0;
  // The command name (at most 16 characters) of process `pid`, or nothing when the process is
  // gone or its record cannot be read whole.
  virtual std::optional<std::string> CommandName(int32_t pid) const = 0;
};

}  // namespace tavrin
