#include "platform/linux/orientation/FeedOrientationRegistry.h"

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace tavrin {
namespace {

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\v' || c == '\f'; }

std::string_view Trim(std::string_view text) {
  while (!text.empty() && IsBlank(text.front())) text.remove_prefix(1);
  while (!text.empty() && IsBlank(text.back())) text.remove_suffix(1);
  return text;
}

// Well-formed UTF-8 (no overlong forms, no surrogates, nothing above U+10FFFF) without C0/C1
// control characters or DEL.
bool IsPlainText(std::string_view text) {
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const auto* end = p + text.size();
  while (p < end) {
    const unsigned char c = *p;
    if (c < 0x80) {
      if (c < 0x20 || c == 0x7f) return false;
      ++p;
      continue;
    }
    size_t length;
    uint32_t code;
    if (c >= 0xc2 && c <= 0xdf) {
      length = 2;
      code = c & 0x1f;
    } else if (c >= 0xe0 && c <= 0xef) {
      length = 3;
      code = c & 0x0f;
    } else if (c >= 0xf0 && c <= 0xf4) {
      length = 4;
      code = c & 0x07;
    } else {
      return false;
    }
    if (size_t(end - p) < length) return false;
    for (size_t i = 1; i < length; ++i) {
      if ((p[i] & 0xc0) != 0x80) return false;
      code = (code << 6) | (p[i] & 0x3f);
    }
    if ((length == 3 && code < 0x800) || (length == 4 && (code < 0x10000 || code > 0x10ffff)) ||
        (code >= 0xd800 && code <= 0xdfff) || (code >= 0x80 && code < 0xa0)) {
      return false;
    }
    p += length;
  }
  return true;
}

// A bad line as it goes into an error line: bounded, bytes outside printable ASCII as \xNN.
std::string Quoted(std::string_view line) {
  // Enough to recognise the line; the rest is noise in the log.
  constexpr size_t kShownBytes = 80;
  std::string out;
  for (size_t i = 0; i < line.size() && i < kShownBytes; ++i) {
    const auto c = static_cast<unsigned char>(line[i]);
    if (c >= 0x20 && c < 0x7f && c != '\\') {
      out += static_cast<char>(c);
    } else {
      out += fmt::format("\\x{:02x}", c);
    }
  }
  if (line.size() > kShownBytes) out += fmt::format("... ({} bytes)", line.size());
  return out;
}

}  // namespace

ParsedFeedLine ParseFeedLine(std::string_view text) {
  text = Trim(text);
  if (text.empty()) return {};
  size_t wordEnd = 0;
  while (wordEnd < text.size() && !IsBlank(text[wordEnd])) ++wordEnd;
  const std::string_view word = text.substr(0, wordEnd);
  OrientationKind kind;
  if (word == "device") {
    kind = OrientationKind::kDevice;
  } else if (word == "ui") {
    kind = OrientationKind::kUI;
  } else {
    return {std::nullopt, "unknown kind (expected \"device\" or \"ui\")"};
  }
  const std::string_view value = Trim(text.substr(wordEnd));
  if (value.empty()) return {std::nullopt, "missing value"};
  if (!IsPlainText(value)) return {std::nullopt, "value is not UTF-8 text"};
  return {FeedLine{kind, std::string(value)}, {}};
}

FeedOrientationRegistry::FeedOrientationRegistry(std::string path, LogHandle log)
    : path_(std::move(path)), log_(std::move(log)), callbacks_(log_) {
  if (!OpenFifo()) return;
  wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeFd_ < 0) {
    TLOG_ERROR(log_, "orientation feed {}: eventfd failed: {}; no orientation will be delivered",
               path_, std::strerror(errno));
    close(fifoFd_);
    fifoFd_ = -1;
    return;
  }
  listening_ = true;
  TLOG_INFO(log_, "orientation feed {}: reading{}", path_, readOnly_ ? " (read-only)" : "");
  thread_ = std::thread([this] { Run(); });
}

FeedOrientationRegistry::~FeedOrientationRegistry() {
  if (thread_.joinable()) {
    stopping_ = true;
    const uint64_t one = 1;
    if (write(wakeFd_, &one, sizeof one) < 0) {
      // An eventfd write fails only when the counter would overflow, and then it is set already.
    }
    thread_.join();
  }
  if (fifoFd_ >= 0) close(fifoFd_);
  if (wakeFd_ >= 0) close(wakeFd_);
}

void FeedOrientationRegistry::RegisterDeviceOrientation(const std::string& id, Callback callback) {
  callbacks_.Register(OrientationKind::kDevice, id, std::move(callback));
}

void FeedOrientationRegistry::RegisterUIOrientation(const std::string& id, Callback callback) {
  callbacks_.Register(OrientationKind::kUI, id, std::move(callback));
}

void FeedOrientationRegistry::UnregisterDeviceOrientation(const std::string& id) {
  callbacks_.Unregister(OrientationKind::kDevice, id);
}

void FeedOrientationRegistry::UnregisterUIOrientation(const std::string& id) {
  callbacks_.Unregister(OrientationKind::kUI, id);
}

FeedOrientationRegistry::Counts FeedOrientationRegistry::counts() const {
  return Counts{bytesRead_.load(), deliveredLines_.load(), badLines_.load(), overlongLines_.load()};
}

bool FeedOrientationRegistry::OpenFifo() {
  if (mkfifo(path_.c_str(), kFifoMode) != 0 && errno != EEXIST) {
    TLOG_ERROR(log_,
               "orientation feed {}: cannot create the FIFO: {}; no orientation will be "
               "delivered",
               path_, std::strerror(errno));
    return false;
  }
  // Checked before opening: opening a device or a tty could have effects of its own.
  struct stat st;
  if (stat(path_.c_str(), &st) != 0) {
    TLOG_ERROR(log_, "orientation feed {}: {}; no orientation will be delivered", path_,
               std::strerror(errno));
    return false;
  }
  if (!S_ISFIFO(st.st_mode)) {
    TLOG_ERROR(log_,
               "orientation feed {}: exists and is not a FIFO; leaving it alone, no "
               "orientation will be delivered",
               path_);
    return false;
  }
  fifoFd_ = open(path_.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
  if (fifoFd_ < 0 && errno == EACCES) {
    readOnly_ = true;
    fifoFd_ = open(path_.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  }
  if (fifoFd_ < 0) {
    TLOG_ERROR(log_,
               "orientation feed {}: cannot open the FIFO: {}; no orientation will be "
               "delivered",
               path_, std::strerror(errno));
    return false;
  }
  // The path may have been replaced between the stat and the open.
  if (fstat(fifoFd_, &st) != 0 || !S_ISFIFO(st.st_mode)) {
    TLOG_ERROR(log_, "orientation feed {}: is no longer a FIFO; no orientation will be delivered",
               path_);
    close(fifoFd_);
    fifoFd_ = -1;
    return false;
  }
  return true;
}

void FeedOrientationRegistry::Run() {
  pthread_setname_np(pthread_self(), kOrientationThreadName);
  while (!stopping_) {
    pollfd fds[2] = {{fifoFd_, POLLIN, 0}, {wakeFd_, POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      TLOG_ERROR(log_, "orientation feed {}: poll failed: {}; reading stops", path_,
                 std::strerror(errno));
      break;
    }
    if (fds[1].revents != 0 || stopping_) break;
    if (fds[0].revents != 0 && !ReadAvailable()) break;
  }
  if (!stopping_) listening_ = false;
}

bool FeedOrientationRegistry::ReadAvailable() {
  // One pipe buffer's worth per read; a line may span many reads.
  constexpr size_t kReadBytes = 4096;
  char buffer[kReadBytes];
  for (;;) {
    const ssize_t n = read(fifoFd_, buffer, sizeof buffer);
    if (n > 0) {
      bytesRead_ += uint64_t(n);
      Consume(std::string_view(buffer, size_t(n)));
      if (stopping_) return false;
      continue;
    }
    if (n == 0) {
      // Only when opened read-only: the last writer closed. Reopening resets the hang-up that
      // poll would otherwise report again and again.
      close(fifoFd_);
      fifoFd_ = open(path_.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
      if (fifoFd_ < 0) {
        TLOG_ERROR(log_, "orientation feed {}: cannot reopen the FIFO: {}; reading stops", path_,
                   std::strerror(errno));
        return false;
      }
      return true;
    }
    if (errno == EINTR) continue;
    if (errno == EAGAIN || errno == EWOULDBLOCK) return true;
    TLOG_ERROR(log_, "orientation feed {}: read failed: {}; reading stops", path_,
               std::strerror(errno));
    return false;
  }
}

void FeedOrientationRegistry::Consume(std::string_view bytes) {
  while (!bytes.empty()) {
    const size_t newline = bytes.find('\n');
    const std::string_view piece = bytes.substr(0, newline);
    if (!discarding_) {
      if (pending_.size() + piece.size() > kMaxLineBytes) {
        ++overlongLines_;
        ReportDroppedLine("longer than the limit of " + std::to_string(kMaxLineBytes) + " bytes",
                          pending_ + std::string(piece));
        pending_.clear();
        discarding_ = true;
      } else {
        pending_.append(piece);
      }
    }
    if (newline == std::string_view::npos) return;
    if (!discarding_) HandleLine(pending_);
    pending_.clear();
    discarding_ = false;
    bytes.remove_prefix(newline + 1);
  }
}

void FeedOrientationRegistry::HandleLine(std::string_view line) {
  const ParsedFeedLine parsed = ParseFeedLine(line);
  if (!parsed.line) {
    if (!parsed.error.empty()) {
      ++badLines_;
      ReportDroppedLine(parsed.error, line);
    }
    return;
  }
  ++deliveredLines_;
  callbacks_.Deliver(parsed.line->kind, parsed.line->value);
}

void FeedOrientationRegistry::ReportDroppedLine(std::string_view why, std::string_view line) {
  const uint64_t dropped = badLines_.load() + overlongLines_.load();
  if (dropped <= kLoggedBadLines) {
    TLOG_ERROR(
        log_, "orientation feed {}: line dropped, {}: \"{}\"{}", path_, why, Quoted(line),
        dropped == kLoggedBadLines
            ? fmt::format("; further dropped lines are logged once per {}", kBadLineLogInterval)
            : "");
  } else if (dropped % kBadLineLogInterval == 0) {
    TLOG_ERROR(log_,
               "orientation feed {}: {} lines dropped so far ({} bad, {} over-long); "
               "latest {}",
               path_, dropped, badLines_.load(), overlongLines_.load(), why);
  }
}

}  // namespace tavrin
