#include "protocol/MessagePack.h"

#include <array>

namespace tavrin::protocol {
namespace {

uint64_t ReadBigEndian(const uint8_t* bytes, size_t size) {
  uint64_t value = 0;
  for (size_t i = 0; i < size; ++i) value = (value << 8) | bytes[i];
  return value;
}

// One value's header, as far as the scan needs it.
struct Header {
  enum class Kind { kScalar, kArray, kMap, kInvalid };
  Kind kind = Kind::kScalar;
  size_t headerSize = 1;   // format byte plus fixed-size fields, including the ext type byte
  size_t lengthSize = 0;   // bytes of a big-endian length after the format byte
  size_t payloadSize = 0;  // fixed payload after the header; variable ones come from the length
  bool lengthIsPayload = false;  // str, bin, ext: the length counts payload bytes
  uint64_t count = 0;            // array elements or map pairs for fix formats
  std::string_view unsupported;  // bin/ext name
  bool isString = false;
  enum class Number { kNone, kUnsigned, kSigned } number = Number::kNone;
  bool isNil = false;
};

Header Classify(uint8_t b) {
  Header h;
  if (b <= 0x7f) {
    h.number = Header::Number::kUnsigned;  // positive fixint, value in the byte
  } else if (b <= 0x8f) {
    h.kind = Header::Kind::kMap;
    h.count = b & 0x0fu;
  } else if (b <= 0x9f) {
    h.kind = Header::Kind::kArray;
    h.count = b & 0x0fu;
  } else if (b <= 0xbf) {
    h.isString = true;
    h.payloadSize = b & 0x1fu;
  } else if (b >= 0xe0) {
    h.number = Header::Number::kSigned;  // negative fixint
  } else {
    switch (b) {
      case 0xc0:
        h.isNil = true;
        break;
      case 0xc1:
        h.kind = Header::Kind::kInvalid;
        break;
      case 0xc2:
      case 0xc3:
        break;
      case 0xc4:
        h.lengthSize = 1;
        h.lengthIsPayload = true;
        h.unsupported = "bin8";
        break;
      case 0xc5:
        h.lengthSize = 2;
        h.lengthIsPayload = true;
        h.unsupported = "bin16";
        break;
      case 0xc6:
        h.lengthSize = 4;
        h.lengthIsPayload = true;
        h.unsupported = "bin32";
        break;
      case 0xc7:
        h.lengthSize = 1;
        h.headerSize = 2;
        h.lengthIsPayload = true;
        h.unsupported = "ext8";
        break;
      case 0xc8:
        h.lengthSize = 2;
        h.headerSize = 2;
        h.lengthIsPayload = true;
        h.unsupported = "ext16";
        break;
      case 0xc9:
        h.lengthSize = 4;
        h.headerSize = 2;
        h.lengthIsPayload = true;
        h.unsupported = "ext32";
        break;
      case 0xca:
        h.payloadSize = 4;
        break;
      case 0xcb:
        h.payloadSize = 8;
        break;
      case 0xcc:
        h.payloadSize = 1;
        h.number = Header::Number::kUnsigned;
        break;
      case 0xcd:
        h.payloadSize = 2;
        h.number = Header::Number::kUnsigned;
        break;
      case 0xce:
        h.payloadSize = 4;
        h.number = Header::Number::kUnsigned;
        break;
      case 0xcf:
        h.payloadSize = 8;
        h.number = Header::Number::kUnsigned;
        break;
      case 0xd0:
        h.payloadSize = 1;
        h.number = Header::Number::kSigned;
        break;
      case 0xd1:
        h.payloadSize = 2;
        h.number = Header::Number::kSigned;
        break;
      case 0xd2:
        h.payloadSize = 4;
        h.number = Header::Number::kSigned;
        break;
      case 0xd3:
        h.payloadSize = 8;
        h.number = Header::Number::kSigned;
        break;
      case 0xd4:
        h.headerSize = 2;
        h.payloadSize = 1;
        h.unsupported = "fixext1";
        break;
      case 0xd5:
        h.headerSize = 2;
        h.payloadSize = 2;
        h.unsupported = "fixext2";
        break;
      case 0xd6:
        h.headerSize = 2;
        h.payloadSize = 4;
        h.unsupported = "fixext4";
        break;
      case 0xd7:
        h.headerSize = 2;
        h.payloadSize = 8;
        h.unsupported = "fixext8";
        break;
      case 0xd8:
        h.headerSize = 2;
        h.payloadSize = 16;
        h.unsupported = "fixext16";
        break;
      case 0xd9:
        h.lengthSize = 1;
        h.lengthIsPayload = true;
        h.isString = true;
        break;
      case 0xda:
        h.lengthSize = 2;
        h.lengthIsPayload = true;
        h.isString = true;
        break;
      case 0xdb:
        h.lengthSize = 4;
        h.lengthIsPayload = true;
        h.isString = true;
        break;
      case 0xdc:
        h.kind = Header::Kind::kArray;
        h.lengthSize = 2;
        break;
      case 0xdd:
        h.kind = Header::Kind::kArray;
        h.lengthSize = 4;
        break;
      case 0xde:
        h.kind = Header::Kind::kMap;
        h.lengthSize = 2;
        break;
      case 0xdf:
        h.kind = Header::Kind::kMap;
        h.lengthSize = 4;
        break;
      default:
        break;
    }
  }
  return h;
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
    if (left < h.headerSize + h.lengthSize) return fail(ScanResult::Form::kTruncated);
    const uint64_t length = ReadBigEndian(data + pos + h.headerSize, h.lengthSize);
    pos += h.headerSize + h.lengthSize;

    uint64_t payload = h.payloadSize;
    if (h.lengthIsPayload) payload = length;
    if (payload > size - pos) return fail(ScanResult::Form::kTruncated);

    const bool isContainer = h.kind == Header::Kind::kArray || h.kind == Header::Kind::kMap;
    uint64_t children = 0;
    if (isContainer) {
      const uint64_t count = h.lengthSize > 0 ? length : h.count;
      children = h.kind == Header::Kind::kMap ? 2 * count : count;
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

DecodedValue DecodeMessagePack(std::span<const uint8_t> bytes) {
  DecodedValue decoded;
  decoded.scan = ScanMessagePack(bytes);
  if (!decoded.scan.Parsable()) return decoded;
  // The scan has bounded the depth and ruled out every input the parser rejects, so this parse
  // neither recurses deeply nor fails; a failure would still come back as "discarded".
  Value value = Value::from_msgpack(bytes.data(), bytes.data() + bytes.size(),
                                    /*strict=*/true, /*allow_exceptions=*/false);
  if (value.is_discarded()) {
    decoded.scan.form = ScanResult::Form::kTruncated;
    return decoded;
  }
  decoded.value = std::move(value);
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
