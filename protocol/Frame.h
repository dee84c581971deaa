#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace tavrin::protocol {

// Bytes of the big-endian length that starts every frame.
inline constexpr size_t kFrameHeaderSize = 4;

// Largest frame body accepted unless the caller sets another limit: far above any real message
// (a message dictionary is a few KB) and small enough that one connection cannot pin much memory.
inline constexpr uint32_t kDefaultFrameLimit = 1024 * 1024;

// The frame holding `body`: its length as 4 bytes big-endian, then the body. The body must hold
// 1 to 2^32-1 bytes (callers encode MessagePack, which is never empty); a body outside that range
// is a programming error and throws std::length_error.
std::vector<uint8_t> EncodeFrame(std::span<const uint8_t> body);

// Splits a byte stream into frame bodies. Feed it whatever the stream delivered, in any chunks,
// and take the complete frames out with Next() until it answers kNeedMore. An owner that drains
// after every Append() holds at most one frame plus one chunk: a length above the limit is refused
// as soon as its 4 bytes are in, before any of its body is kept.
//
// A bad length (0 or above the limit) is final: the stream cannot be resynchronised, so every
// later Next() answers kBadLength again and the owner closes the connection.
// One thread at a time.
class FrameReader {
 public:
  enum class Status {
    kFrame,      // Body() holds the next frame body
    kNeedMore,   // no complete frame buffered
    kBadLength,  // the stream announced a length of 0 or above the limit
  };

  explicit FrameReader(uint32_t frameLimit = kDefaultFrameLimit);

  // Appends bytes received from the stream. Invalidates the span of the last frame.
  void Append(std::span<const uint8_t> bytes);

  // Takes the next complete frame out of the buffer.
  Status Next();

  // The body of the next complete frame, left in place for Next(); empty when no frame is
  // complete. Valid until the next call of Append() or Next().
  std::span<const uint8_t> Peek() const;

  // The body of the frame that the last Next() answered kFrame for; valid until the next call of
  // Append() or Next().
  std::span<const uint8_t> Body() const { return body_; }

  // True when buffered bytes start a frame that is not complete (a partial length or body): a
  // stream that ends now ended inside a frame. False at a frame boundary, and after a bad length
  // (the owner closed the connection for that; this says nothing more).
  bool InsideFrame() const;

  // The length that made the reader fail; 0 unless Next() answered kBadLength.
  uint32_t BadLength() const { return badLength_; }
  bool Failed() const { return failed_; }

  uint32_t FrameLimit() const { return frameLimit_; }
  // Bytes held and not yet handed out as frames.
  size_t Buffered() const { return buffer_.size() - start_; }

 private:
  // The length in the next header, once all of its bytes are buffered.
  std::optional<uint32_t> NextLength() const;

  uint32_t frameLimit_;
  std::vector<uint8_t> buffer_;
  size_t start_ = 0;  // first byte not yet handed out
  std::span<const uint8_t> body_;
  bool failed_ = false;
  uint32_t badLength_ = 0;
};

}  // namespace tavrin::protocol
