#pragma once

// Builds MessagePack bytes by hand, format by format, so that tests can send exactly the
// encodings a foreign client might (an int8 holding 5, a str32 claiming 4 GB, a bin8, ...),
// which no encoder in this tree writes.

#include <bit>
#include <cstdint>
#include <initializer_list>
#include <span>
#include <string_view>
#include <vector>

namespace tavrin::testing {

enum class IntFormat {
  kPositiveFixint,
  kNegativeFixint,
  kUint8,
  kUint16,
  kUint32,
  kUint64,
  kInt8,
  kInt16,
  kInt32,
  kInt64,
};

class Pack {
 public:
  const std::vector<uint8_t>& bytes() const { return bytes_; }
  // NOLINTBEGIN(google-explicit-constructor): a Pack is passed wherever bytes are expected.
  operator const std::vector<uint8_t>&() const { return bytes_; }
  operator std::span<const uint8_t>() const { return bytes_; }
  // NOLINTEND(google-explicit-constructor)

  Pack& raw(std::initializer_list<uint8_t> bytes) {
    bytes_.insert(bytes_.end(), bytes);
    return *this;
  }
  Pack& append(const std::vector<uint8_t>& bytes) {
    bytes_.insert(bytes_.end(), bytes.begin(), bytes.end());
    return *this;
  }
  Pack& nil() { return raw({0xc0}); }
  Pack& boolean(bool value) { return raw({static_cast<uint8_t>(value ? 0xc3 : 0xc2)}); }

  // `bits` is the value in two's complement; the format keeps its low bytes.
  Pack& integer(IntFormat format, uint64_t bits) {
    if (format == IntFormat::kPositiveFixint) return raw({static_cast<uint8_t>(bits & 0x7f)});
    if (format == IntFormat::kNegativeFixint) {
      return raw({static_cast<uint8_t>(0xe0 | (bits & 0x1f))});
    }
    // uint8..uint64 are 0xcc..0xcf and int8..int64 0xd0..0xd3, of 1, 2, 4 and 8 bytes.
    const int index = static_cast<int>(format) - static_cast<int>(IntFormat::kUint8);
    return big(static_cast<uint8_t>(0xcc + index), bits, 1 << (index % 4));
  }
  // Smallest unsigned or fix format for a non-negative number.
  Pack& uint(uint64_t value) {
    if (value <= 0x7f) return integer(IntFormat::kPositiveFixint, value);
    if (value <= 0xff) return integer(IntFormat::kUint8, value);
    if (value <= 0xffff) return integer(IntFormat::kUint16, value);
    if (value <= 0xffffffff) return integer(IntFormat::kUint32, value);
    return integer(IntFormat::kUint64, value);
  }
  Pack& float64(double value) { return big(0xcb, std::bit_cast<uint64_t>(value), 8); }
  Pack& float32(float value) { return big(0xca, std::bit_cast<uint32_t>(value), 4); }
  Pack& str(std::string_view text) {
    if (text.size() <= 31) {
      raw({static_cast<uint8_t>(0xa0 | text.size())});
    } else if (text.size() <= 0xff) {
      big(0xd9, text.size(), 1);
    } else if (text.size() <= 0xffff) {
      big(0xda, text.size(), 2);
    } else {
      big(0xdb, text.size(), 4);
    }
    bytes_.insert(bytes_.end(), text.begin(), text.end());
    return *this;
  }
  Pack& array(uint64_t count) {
    if (count <= 15) return raw({static_cast<uint8_t>(0x90 | count)});
    if (count <= 0xffff) return big(0xdc, count, 2);
    return big(0xdd, count, 4);
  }
  Pack& map(uint64_t pairs) {
    if (pairs <= 15) return raw({static_cast<uint8_t>(0x80 | pairs)});
    if (pairs <= 0xffff) return big(0xde, pairs, 2);
    return big(0xdf, pairs, 4);
  }
  // A format byte followed by `size` bytes of `value`, big-endian.
  Pack& big(uint8_t format, uint64_t value, int size) {  // size 1 to 8
    bytes_.push_back(format);
    for (int i = size - 1; i >= 0; --i) bytes_.push_back(static_cast<uint8_t>(value >> (8 * i)));
    return *this;
  }

 private:
  std::vector<uint8_t> bytes_;
};

}  // namespace tavrin::testing
