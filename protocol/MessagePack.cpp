#include "protocol/MessagePack.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <string>
#include <unordered_map>

namespace tavrin::protocol {
namespace {

uint64_t ReadBigEndian(const uint8_t* bytes, size_t size) {
  uint64_t value = 0;
  for (size_t i = 0; i < size; ++i) value = (value << 8) | bytes[i];
  return value;
}

// What the scan needs to know about a format byte.
struct Header {
  enum class Kind { kScalar, kArray, kMap, kInvalid };
  enum class Number { kNone, kUnsigned, kSigned };
  Kind kind = Kind::kScalar;
  size_t lengthSize = 0;   // bytes of a big-endian length after the format byte
  size_t typeSize = 0;     // the ext type byte, after the length
  size_t payloadSize = 0;  // fixed payload; str, bin and ext take theirs from the length
  bool lengthIsPayload = false;
  uint64_t count = 0;  // elements or pairs of a fixarray or fixmap
  Number number = Number::kNone;
  bool isString = false;
  bool isNil = false;
  std::string_view unsupported;  // name of a bin or ext format
};

constexpr Header Scalar(size_t payload) {
  Header h;
  h.payloadSize = payload;
  return h;
}
constexpr Header Integer(size_t payload, Header::Number number) {
  Header h = Scalar(payload);
  h.number = number;
  return h;
}
constexpr Header Nil() {
  Header h;
  h.isNil = true;
  return h;
}
constexpr Header Invalid() {
  Header h;
  h.kind = Header::Kind::kInvalid;
  return h;
}
constexpr Header Str(size_t lengthSize) {
  Header h;
  h.lengthSize = lengthSize;
  h.lengthIsPayload = true;
  h.isString = true;
  return h;
}
constexpr Header FixStr(size_t payload) {
  Header h = Scalar(payload);
  h.isString = true;
  return h;
}
constexpr Header Bin(size_t lengthSize, std::string_view name) {
  Header h;
  h.lengthSize = lengthSize;
  h.lengthIsPayload = true;
  h.unsupported = name;
  return h;
}
constexpr Header Ext(size_t lengthSize, std::string_view name) {
  Header h = Bin(lengthSize, name);
  h.typeSize = 1;
  return h;
}
constexpr Header FixExt(size_t payload, std::string_view name) {
  Header h = Scalar(payload);
  h.typeSize = 1;
  h.unsupported = name;
  return h;
}
constexpr Header Container(Header::Kind kind, size_t lengthSize, uint64_t count = 0) {
  Header h;
  h.kind = kind;
  h.lengthSize = lengthSize;
  h.count = count;
  return h;
}

constexpr auto kUnsigned = Header::Number::kUnsigned;
constexpr auto kSigned = Header::Number::kSigned;

// Formats 0xc0 to 0xdf, in byte order.
constexpr std::array<Header, 32> kFormats = {
    Nil(),                               // c0 nil
    Invalid(),                           // c1 never used
    Scalar(0),                           // c2 false
    Scalar(0),                           // c3 true
    Bin(1, "bin8"),                      // c4
    Bin(2, "bin16"),                     // c5
    Bin(4, "bin32"),                     // c6
    Ext(1, "ext8"),                      // c7
    Ext(2, "ext16"),                     // c8
    Ext(4, "ext32"),                     // c9
    Scalar(4),                           // ca float32
    Scalar(8),                           // cb float64
    Integer(1, kUnsigned),               // cc uint8
    Integer(2, kUnsigned),               // cd uint16
    Integer(4, kUnsigned),               // ce uint32
    Integer(8, kUnsigned),               // cf uint64
    Integer(1, kSigned),                 // d0 int8
    Integer(2, kSigned),                 // d1 int16
    Integer(4, kSigned),                 // d2 int32
    Integer(8, kSigned),                 // d3 int64
    FixExt(1, "fixext1"),                // d4
    FixExt(2, "fixext2"),                // d5
    FixExt(4, "fixext4"),                // d6
    FixExt(8, "fixext8"),                // d7
    FixExt(16, "fixext16"),              // d8
    Str(1),                              // d9 str8
    Str(2),                              // da str16
    Str(4),                              // db str32
    Container(Header::Kind::kArray, 2),  // dc array16
    Container(Header::Kind::kArray, 4),  // dd array32
    Container(Header::Kind::kMap, 2),    // de map16
    Container(Header::Kind::kMap, 4),    // df map32
};

Header Classify(uint8_t b) {
  if (b <= 0x7f) return Integer(0, kUnsigned);  // positive fixint, the value in the byte
  if (b <= 0x8f) return Container(Header::Kind::kMap, 0, b & 0x0fu);
  if (b <= 0x9f) return Container(Header::Kind::kArray, 0, b & 0x0fu);
  if (b <= 0xbf) return FixStr(b & 0x1fu);
  if (b >= 0xe0) return Integer(0, kSigned);  // negative fixint
  return kFormats[b - 0xc0];
}

// Whether element 0 of an integer value is >= 0, and its value then. `format` is the format
// byte, `payload` the bytes after it (already checked to be there).
std::optional<uint64_t> NonNegativeInteger(uint8_t format, const uint8_t* payload,
                                           const Header& h) {
  if (format <= 0x7f) return format;
  if (h.number == Header::Number::kUnsigned) return ReadBigEndian(payload, h.payloadSize);
  if (h.number != Header::Number::kSigned || format >= 0xe0) return std::nullopt;
  const uint64_t raw = ReadBigEndian(payload, h.payloadSize);
  const uint64_t signBit = uint64_t{1} << (h.payloadSize * 8 - 1);
  if ((raw & signBit) != 0) return std::nullopt;
  return raw;
}

// Builds a Value from bytes that ScanMessagePack found parsable. Maps are filled by appending,
// with a hash index of their keys only when they are wide enough for a linear search to matter,
// so a map of n keys costs O(n) rather than the O(n^2) of inserting key by key.
struct TrustedParser {
  const uint8_t* at;

  static constexpr size_t kIndexedMapSize = 16;

  uint64_t Take(size_t size) {
    const uint64_t value = ReadBigEndian(at, size);
    at += size;
    return value;
  }
  std::string_view TakeString(size_t length) {
    std::string_view text(reinterpret_cast<const char*>(at), length);
    at += length;
    return text;
  }
  template <typename Float, typename Bits>
  Float TakeFloat() {
    const auto bits = static_cast<Bits>(Take(sizeof(Bits)));
    Float value;
    std::memcpy(&value, &bits, sizeof(value));
    return value;
  }

  Value Parse() {
    const uint8_t format = *at++;
    if (format <= 0x7f) return Value(static_cast<uint64_t>(format));
    if (format >= 0xe0) return Value(static_cast<int64_t>(static_cast<int8_t>(format)));
    if (format <= 0x8f) return ParseMap(format & 0x0fu);
    if (format <= 0x9f) return ParseArray(format & 0x0fu);
    if (format <= 0xbf) return Value(std::string(TakeString(format & 0x1fu)));
    switch (format) {
      case 0xc0:
        return Value(nullptr);
      case 0xc2:
        return Value(false);
      case 0xc3:
        return Value(true);
      case 0xca:
        return Value(static_cast<double>(TakeFloat<float, uint32_t>()));
      case 0xcb:
        return Value(TakeFloat<double, uint64_t>());
      case 0xcc:
        return Value(Take(1));
      case 0xcd:
        return Value(Take(2));
      case 0xce:
        return Value(Take(4));
      case 0xcf:
        return Value(Take(8));
      case 0xd0:
        return Value(static_cast<int64_t>(static_cast<int8_t>(Take(1))));
      case 0xd1:
        return Value(static_cast<int64_t>(static_cast<int16_t>(Take(2))));
      case 0xd2:
        return Value(static_cast<int64_t>(static_cast<int32_t>(Take(4))));
      case 0xd3:
        return Value(static_cast<int64_t>(Take(8)));
      case 0xd9:
        return Value(std::string(TakeString(Take(1))));
      case 0xda:
        return Value(std::string(TakeString(Take(2))));
      case 0xdb:
        return Value(std::string(TakeString(Take(4))));
      case 0xdc:
        return ParseArray(Take(2));
      case 0xdd:
        return ParseArray(Take(4));
      case 0xde:
        return ParseMap(Take(2));
      default:  // 0xdf; the scan let nothing else through
        return ParseMap(Take(4));
    }
  }

  Value ParseArray(uint64_t count) {
    Value array = Value::array();
    auto& elements = array.get_ref<Value::array_t&>();
    elements.reserve(count);
    for (uint64_t i = 0; i < count; ++i) elements.push_back(Parse());
    return array;
  }

  Value ParseMap(uint64_t count) {
    Value map = Value::object();
    auto& pairs = map.get_ref<Value::object_t&>();
    pairs.reserve(count);
    std::unordered_map<std::string_view, size_t> index;
    if (count >= kIndexedMapSize) index.reserve(count);
    for (uint64_t i = 0; i < count; ++i) {
      std::string key = Parse().get<std::string>();
      Value value = Parse();
      if (count >= kIndexedMapSize) {
        // The index points into `pairs`, whose keys never move: the vector was reserved up front
        // and a repeated key only ever removes the pair just added.
        pairs.emplace_back(std::move(key), std::move(value));
        auto [found, inserted] =
            index.try_emplace(std::string_view(pairs.back().first), pairs.size() - 1);
        if (!inserted) {
          (pairs.begin() + static_cast<std::ptrdiff_t>(found->second))->second =
              std::move(pairs.back().second);
          pairs.pop_back();
        }
      } else {
        auto existing = std::find_if(pairs.begin(), pairs.end(),
                                     [&](const auto& pair) { return pair.first == key; });
        if (existing != pairs.end()) {
          existing->second = std::move(value);
        } else {
          pairs.emplace_back(std::move(key), std::move(value));
        }
      }
    }
    return map;
  }
};

}  // namespace

ScanResult ScanMessagePack(std::span<const uint8_t> bytes) {
  ScanResult result;
  const uint8_t* data = bytes.data();
  const size_t size = bytes.size();

  // Open containers down to the depth limit: items (map keys and values counted apart) still to
  // come in each. Beyond the limit only `pending` is kept, which is enough to check the form.
  struct Level {
    uint64_t remaining;
    bool isMap;
  };
  std::array<Level, kMaxNestingDepth> levels{};
  int open = 0;
  bool tracking = true;
  // Values still to read before the top-level value is complete; each needs at least one byte,
  // which bounds it by the bytes left and lets a huge declared count fail at once.
  uint64_t pending = 1;
  size_t pos = 0;

  auto fail = [&](ScanResult::Form form) {
    result.form = form;
    result.offset = pos;
    return result;
  };

  while (pending > 0) {
    if (pos >= size) return fail(ScanResult::Form::kTruncated);
    const size_t itemStart = pos;
    const uint8_t format = data[pos];
    const Header h = Classify(format);
    if (h.kind == Header::Kind::kInvalid) return fail(ScanResult::Form::kInvalidByte);
    const size_t left = size - pos;
    if (left < 1 + h.lengthSize + h.typeSize) return fail(ScanResult::Form::kTruncated);
    const uint64_t length = ReadBigEndian(data + pos + 1, h.lengthSize);
    pos += 1 + h.lengthSize + h.typeSize;

    uint64_t payload = h.payloadSize;
    if (h.lengthIsPayload) payload = length;
    if (payload > size - pos) return fail(ScanResult::Form::kTruncated);

    const bool isContainer = h.kind == Header::Kind::kArray || h.kind == Header::Kind::kMap;
    uint64_t children = 0;
    if (isContainer) {
      const uint64_t count = h.lengthSize > 0 ? length : h.count;
      children = h.kind == Header::Kind::kMap ? 2 * count : count;
      result.entries += count;
    }
    pending -= 1;
    if (children > size - pos || pending + children > size - pos) {
      return fail(ScanResult::Form::kTruncated);
    }
    pending += children;

    if (result.unsupportedType.empty() && !h.unsupported.empty()) {
      result.unsupportedType = h.unsupported;
    }

    if (itemStart == 0 && h.kind == Header::Kind::kArray) result.topLevelArraySize = children;

    if (tracking) {
      if (open > 0) {
        Level& parent = levels[open - 1];
        const bool isKey = parent.isMap && parent.remaining % 2 == 0;
        if (isKey && !h.isString) result.nonStringKey = true;
        const bool isFirstOfTop = open == 1 && !parent.isMap && result.topLevelArraySize &&
                                  parent.remaining == *result.topLevelArraySize;
        if (isFirstOfTop) {
          if (h.isNil) {
            result.first = ScanResult::First::kNil;
          } else if (auto value = NonNegativeInteger(format, data + pos, h)) {
            result.first = ScanResult::First::kUnsigned;
            result.firstValue = *value;
          } else {
            result.first = ScanResult::First::kOther;
          }
        }
        parent.remaining -= 1;
      }
      if (isContainer) {
        const int depth = open + 1;
        if (depth > result.depth) result.depth = depth;
        if (depth > kMaxNestingDepth) {
          result.tooDeep = true;
          tracking = false;
        } else if (children > 0) {
          levels[open++] = Level{children, h.kind == Header::Kind::kMap};
        }
      }
      while (open > 0 && levels[open - 1].remaining == 0) --open;
    }
    pos += payload;
  }
  if (pos != size) return fail(ScanResult::Form::kTrailingBytes);
  result.form = ScanResult::Form::kWellFormed;
  result.offset = size;
  return result;
}

DecodedValue DecodeMessagePack(std::span<const uint8_t> bytes, uint64_t maxEntries) {
  DecodedValue decoded;
  decoded.scan = ScanMessagePack(bytes);
  decoded.scan.tooManyEntries = decoded.scan.entries > maxEntries;
  if (!decoded.scan.Parsable()) return decoded;
  // The scan has checked every length against the bytes, bounded the depth and ruled out every
  // format the parser does not build, so the parse can trust what it reads.
  TrustedParser parser{bytes.data()};
  decoded.value = parser.Parse();
  return decoded;
}

std::vector<uint8_t> EncodeMessagePack(const Value& value) { return Value::to_msgpack(value); }

std::string_view FormName(ScanResult::Form form) {
  switch (form) {
    case ScanResult::Form::kWellFormed:
      return "well-formed";
    case ScanResult::Form::kTruncated:
      return "truncated";
    case ScanResult::Form::kTrailingBytes:
      return "bytes after the value";
    case ScanResult::Form::kInvalidByte:
      return "invalid byte 0xc1";
  }
  return "unknown";
}

}  // namespace tavrin::protocol
