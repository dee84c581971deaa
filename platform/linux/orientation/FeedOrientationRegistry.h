#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"
#include "platform/linux/orientation/OrientationCallbacks.h"

namespace tavrin {

// One good line of an orientation feed.
struct FeedLine {
  OrientationKind kind;
  std::string value;
};

// What ParseFeedLine made of a line: `line` for a good one; otherwise `error` says why, and is
// empty for a blank line (which is not an error: writers may send bare newlines).
struct ParsedFeedLine {
  std::optional<FeedLine> line;
  std::string_view error;
};

// Parses one feed line (without its newline): "device VALUE" or "ui VALUE", the kind word in lower
// case, separated from VALUE by spaces or tabs. VALUE is the rest of the line with white space
// trimmed at both ends; it must be valid UTF-8 without control characters, since it ends up in
// JSON summaries and log lines.
ParsedFeedLine ParseFeedLine(std::string_view text);

// OrientationRegistry fed through a FIFO (`--orientation feed:PATH`), for machines whose
// orientation comes from somewhere tavrin has no driver for, and for tests.
//
// The constructor creates a FIFO at PATH (mode kFifoMode less the umask), or uses the FIFO found
// there, and opens it read-write so that it never sees end-of-file when the last writer closes:
// writers may come and go, and a writer's non-blocking open always succeeds. If only read access
// is allowed it opens read-only and reopens after each end-of-file (a writer that opens, writes
// and closes in the instant between the two may then be lost). When PATH exists and is not a
// FIFO, or cannot be created or opened, it writes one error line and delivers nothing
// (listening() is false); it never removes or changes what it found at PATH, and it leaves the
// FIFO in place when destroyed.
//
// Each complete line (up to a newline) is parsed by ParseFeedLine and its value handed to every
// callback registered for its kind, on the registry's one thread (kOrientationThreadName). Text
// after the last newline waits for the rest of its line. Bad lines and lines longer than
// kMaxLineBytes are dropped and counted (counts()); the first kLoggedBadLines of them get an error
// line each, later ones one error line per kBadLineLogInterval.
//
// Callbacks and unregistration follow OrientationCallbacks. OrientationToString returns the value
// as written.
class FeedOrientationRegistry final : public OrientationRegistry {
 public:
  explicit FeedOrientationRegistry(std::string path, LogHandle log = nullptr);
  // Wakes the thread and joins it; a callback that is running finishes first.
  ~FeedOrientationRegistry() override;
  FeedOrientationRegistry(const FeedOrientationRegistry&) = delete;
  FeedOrientationRegistry& operator=(const FeedOrientationRegistry&) = delete;

  void RegisterDeviceOrientation(const std::string& id, Callback callback) override;
  void RegisterUIOrientation(const std::string& id, Callback callback) override;
  void UnregisterDeviceOrientation(const std::string& id) override;
  void UnregisterUIOrientation(const std::string& id) override;
  std::string OrientationToString(const OrientationValue& value) override { return value; }

  const std::string& path() const { return path_; }
  bool listening() const { return listening_.load(); }

  struct Counts {
    uint64_t bytesRead = 0;
    uint64_t deliveredLines = 0;  // good lines, whether or not any callback was registered
    uint64_t badLines = 0;        // unknown kind, missing value, not text
    uint64_t overlongLines = 0;   // longer than kMaxLineBytes
  };
  Counts counts() const;

  // Orientation names are a word or two; a longer line is a confused writer, and the bound keeps
  // one from growing the buffer without limit.
  static constexpr size_t kMaxLineBytes = 1024;
  // Enough error lines to diagnose a bad writer without letting it flood the log.
  static constexpr uint64_t kLoggedBadLines = 10;
  static constexpr uint64_t kBadLineLogInterval = 1000;
  // Owner and group may write: the feeding program usually runs as another user of the group.
  static constexpr mode_t kFifoMode = 0660;

 private:
  bool OpenFifo();
  void Run();
  // Reads what the FIFO holds now; false when reading must stop for good.
  bool ReadAvailable();
  void Consume(std::string_view bytes);
  void HandleLine(std::string_view line);
  void ReportDroppedLine(std::string_view why, std::string_view line);

  const std::string path_;
  const LogHandle log_;
  OrientationCallbacks callbacks_;
  std::atomic<bool> listening_{false};
  int fifoFd_ = -1;
  bool readOnly_ = false;  // opened read-only: end-of-file means reopen
  int wakeFd_ = -1;        // eventfd that stops the thread
  std::atomic<bool> stopping_{false};
  // Touched only by the thread.
  std::string pending_;      // the line read so far
  bool discarding_ = false;  // the current line is over-long: drop up to its newline
  std::atomic<uint64_t> bytesRead_{0};
  std::atomic<uint64_t> deliveredLines_{0};
  std::atomic<uint64_t> badLines_{0};
  std::atomic<uint64_t> overlongLines_{0};
  std::thread thread_;
};

}  // namespace tavrin
