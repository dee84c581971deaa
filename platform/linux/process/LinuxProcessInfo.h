#pragma once

#include <optional>
#include <string>

#include "platform/ProcessInfo.h"

namespace tavrin {

// Process information from /proc: the command name is /proc/<pid>/comm (at most 15 characters
// and a newline, which is stripped).
class LinuxProcessInfo final : public ProcessInfo {
 public:
  int32_t OwnProcessIdentifier() const override;
  // /proc/self/comm; the program's short invocation name if that cannot be read.
  std::string OwnProcessName() const override;
  // Nothing for pid 0 or below, a process that is gone, or an empty or unreadable record.
  std::optional<std::string> CommandName(int32_t pid) const override;
};

}  // namespace tavrin
