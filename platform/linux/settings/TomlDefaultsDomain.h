#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "base/Dictionary.h"
#include "platform/DefaultsDomain.h"

namespace tavrin {

// A defaults file is a few settings; anything larger is a mistake, not something to parse.
inline constexpr size_t kMaxTomlFileBytes = 1 << 20;

// The result of loading one TOML file.
struct TomlFileLoad {
  enum class Status { kOk, kMissing, kFailed };
  Status status = Status::kMissing;
  Dictionary values = MakeDictionary();  // kOk: every key; otherwise empty
  std::string error;                     // kFailed: what went wrong, naming the file
  // kFailed: identifies the file's state (inode, size, times) so a caller can tell whether the
  // file changed since an earlier failure.
  std::string fileState;
};

// Reads and parses `path`. Tables become nested dictionaries in the file's key order, arrays
// arrays, dates and times their TOML text. A missing file (or missing directory) is kMissing.
TomlFileLoad LoadTomlFile(const std::string& path);

// The defaults domain over a TOML file (`--defaults`). Read() parses the file afresh on every
// call. A missing file reads as empty, silently. An unreadable or malformed one fails closed: it
// reads as the last settings that parsed, or, when none ever did, as {"disable_reporting": true},
// so that a typo never silently turns reporting back on. Either way one error line goes to the
// default system log, not repeated until the file changes. Thread-safe.
class TomlDefaultsDomain final : public DefaultsDomain {
 public:
  explicit TomlDefaultsDomain(std::string path);

  Dictionary Read() override;

  const std::string& Path() const { return path_; }

 private:
  const std::string path_;
  std::mutex mutex_;
  std::optional<std::string> lastLoggedFailure_;  // guarded by mutex_
  std::optional<Dictionary> lastGood_;            // guarded by mutex_
};

}  // namespace tavrin
