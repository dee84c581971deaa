#include "protocol/Frame.h"

#include <limits>
#include <stdexcept>

namespace tavrin::protocol {

std::vector<uint8_t> EncodeFrame(std::span<const uint8_t> body) {
  if (body.empty() || body.size() > std::numeric_limits<uint32_t>::max()) {
    throw std::length_error("frame body must hold 1 to 2^32-1 bytes");
  }
  const auto length = static_cast<uint32_t>(body.size());
  std::vector<uint8_t> frame;
  frame.reserve(kFrameHeaderSize + body.size());
  frame.push_back(static_cast<uint8_t>(length >> 24));
  frame.push_back(static_cast<uint8_t>(length >> 16));
  frame.push_back(static_cast<uint8_t>(length >> 8));
  frame.push_back(static_cast<uint8_t>(length));
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

FrameReader::FrameReader(uint32_t frameLimit) : frameLimit_(frameLimit) {}

void FrameReader::Append(std::span<const uint8_t> bytes) {
  body_ = {};
  if (failed_ || bytes.empty()) return;
  // Drop the frames already handed out before growing, so the buffer stays near one frame.
  if (start_ > 0) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<std::ptrdiff_t>(start_));
    start_ = 0;
  }
  buffer_.insert(buffer_.end(), bytes.begin(), bytes.end());
}

FrameReader::Status FrameReader::Next() {
  body_ = {};
  if (failed_) return Status::kBadLength;
  const std::optional<uint32_t> length = NextLength();
  if (!length) return Status::kNeedMore;
  if (*length == 0 || *length > frameLimit_) {
    failed_ = true;
    badLength_ = *length;
    buffer_.clear();
    buffer_.shrink_to_fit();
    start_ = 0;
    return Status::kBadLength;
  }
  if (buffer_.size() - start_ - kFrameHeaderSize < *length) return Status::kNeedMore;
  body_ = std::span<const uint8_t>(buffer_.data() + start_ + kFrameHeaderSize, *length);
  start_ += kFrameHeaderSize + *length;
  return Status::kFrame;
}

std::span<const uint8_t> FrameReader::Peek() const {
  const std::optional<uint32_t> length = failed_ ? std::nullopt : NextLength();
  if (!length || *length == 0 || *length > frameLimit_ ||
      buffer_.size() - start_ - kFrameHeaderSize < *length) {
    return {};
  }
  return std::span<const uint8_t>(buffer_.data() + start_ + kFrameHeaderSize, *length);
}

std::optional<uint32_t> FrameReader::NextLength() const {
  if (buffer_.size() - start_ < kFrameHeaderSize) return std::nullopt;
  const uint8_t* header = buffer_.data() + start_;
  return (uint32_t{header[0]} << 24) | (uint32_t{header[1]} << 16) | (uint32_t{header[2]} << 8) |
         uint32_t{header[3]};
}

bool FrameReader::InsideFrame() const { return !failed_ && buffer_.size() > start_; }

}  // namespace tavrin::protocol
