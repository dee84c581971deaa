#pragma once

#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "base/Dictionary.h"
#include "platform/DeviceInfoQuery.h"

namespace tavrin {

// Device facts from a TOML file (`--device-info`), e.g.
//   InternalBuild = true
//   DeviceClassNumber = 7
// The file is read once, at the first query: device facts do not change while the service runs.
// A missing file or key answers the fallback silently. A malformed file, a value of the wrong type
// or an integer outside 32 bits answers the fallback with one error line (per file, or per key and
// type). Thread-safe.
class TomlDeviceInfo final : public DeviceInfoQuery {
 public:
  explicit TomlDeviceInfo(std::string path);

  bool QueryBool(std::string_view key, bool fallback) override;
  int32_t QueryInt32(std::string_view key, int32_t fallback) override;

 private:
  // The value of `key`, or nullptr; loads the file on first use. Requires mutex_ held.
  const Value* FindLocked(std::string_view key);
  // True the first time `key` is reported as wrong for `wanted`. Requires mutex_ held.
  bool FirstComplaintLocked(std::string_view key, std::string_view wanted);

  const std::string path_;
  std::mutex mutex_;
  std::optional<Dictionary> facts_;                      // guarded by mutex_
  std::set<std::string, std::less<>> reportedProblems_;  // guarded by mutex_
};

}  // namespace tavrin
