#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tavrin::pwexport {

// Writes counters into a counters tree (docs/driver-statistics.md):
// <root>/<group>/<subgroup>/<name>, one decimal integer and a newline per file. Every write goes to
// a dot-named temporary file in the same directory, renamed over the counter, so a reader sees the
// old or the new value, never a torn one, and never mistakes the temporary file for a channel
// (readers skip dotfiles). Not fsync'ed: the tree lives in /run and is rebuilt by the next run
// anyway.
class CounterWriter {
 public:
  explicit CounterWriter(std::string root);

  // Creates missing directories as needed. On failure returns false and says why in *error.
  // `group`, `subgroup` and `name` must be names SanitizeName left unchanged.
  bool Write(std::string_view group, std::string_view subgroup, std::string_view name,
             int64_t value, std::string* error) const;

  const std::string& root() const { return root_; }

  // A file name safe for the tree from any text: characters other than ASCII letters, digits,
  // '.', '-' and '_' become '_'; a leading '.' becomes '_' (dotfiles are invisible to readers);
  // empty text becomes "unnamed"; at most kMaxNameBytes bytes are kept.
  static std::string SanitizeName(std::string_view raw);

  // Node names are short ("alsa_output.pci-0000_00_1f.3.analog-stereo" is 44); the cap keeps
  // every path far below NAME_MAX whatever a client calls its stream.
  static constexpr size_t kMaxNameBytes = 128;

 private:
  std::string root_;
};

}  // namespace tavrin::pwexport
