#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "base/Dictionary.h"

namespace tavrin::protocol {

// Deepest nesting a decoded value may have. A scalar has depth 0; an array or a map is one level
// deeper than its deepest element, so a request [call, op, reporterID] has depth 1 and a request
// carrying a message dictionary has depth 2. The bound keeps every later recursive walk over a
// value (parse, copy, dump, compare) well inside a thread's stack.
inline constexpr int kMaxNestingDepth = 64;

// What an iterative pass over MessagePack bytes found, before anything is parsed. The pass keeps
// its state in a fixed array of kMaxNestingDepth levels plus one counter, so neither stack nor
// heap grows with the input, and every declared length is checked against the bytes that remain
// before it is believed (a str32 claiming 4 GB in a 20-byte frame is a truncation, not a
// reservation).
struct ScanResult {
  enum class Form {
    kWellFormed,     // exactly one value and nothing after it
    kTruncated,      // the bytes end inside the value (or a length claims more than is left)
    kTrailingBytes,  // bytes follow the first complete value
    kInvalidByte,    // 0xc1, the one byte MessagePack never uses
  };
  // What element 0 of a top-level array is, for answering a rejected request.
  enum class First {
    kAbsent,    // the value is not an array, or the array is empty
    kNil,       // nil
    kUnsigned,  // an integer >= 0, in whichever integer format (`firstValue`)
    kOther,     // anything else (negative integer, float, string, ...)
  };

  Form form = Form::kTruncated;
  size_t offset = 0;  // where the form fault was found; the size of the input when well-formed
  // Deepest nesting seen; counting stops at kMaxNestingDepth + 1 (the first level too deep).
  int depth = 0;
  bool tooDeep = false;
  // Name of the first bin or ext format found ("bin8", "fixext4", ...), which nothing here
  // decodes; empty when there was none.
  std::string_view unsupportedType;
  // A map key that is not a string was found (dictionaries have string keys). Only tracked
  // down to kMaxNestingDepth.
  bool nonStringKey = false;
  std::optional<uint64_t> topLevelArraySize;  // set when the value is an array
  // Elements of every array plus pairs of every map, at all depths: what parsing will build.
  uint64_t entries = 0;
  // More entries than the decoder was allowed to build (DecodeMessagePack's maxEntries).
  bool tooManyEntries = false;
  First first = First::kAbsent;
  uint64_t firstValue = 0;

  bool WellFormed() const { return form == Form::kWellFormed; }
  // Well-formed and nothing in it that the parser must not see.
  bool Parsable() const {
    return WellFormed() && !tooDeep && unsupportedType.empty() && !nonStringKey && !tooManyEntries;
  }
};

// Scans `bytes` as one MessagePack value without recursing and without allocating.
ScanResult ScanMessagePack(std::span<const uint8_t> bytes);

struct DecodedValue {
  ScanResult scan;
  std::optional<Value> value;  // set exactly when scan.Parsable()
};

// Scans `bytes` and, when they are parsable and hold at most `maxEntries` entries, parses them
// into a Value (nil, boolean, signed or unsigned integer as the format said, float, string,
// array, map with string keys in wire order; a key that appears twice keeps its first place and
// its last value). Time and memory are linear in the size of the bytes whatever their shape
// (wide maps included). Never throws on bad input.
DecodedValue DecodeMessagePack(std::span<const uint8_t> bytes, uint64_t maxEntries = UINT64_MAX);

// The MessagePack bytes of a value; non-negative integers are written in the unsigned formats
// whatever their C++ type was, which every reader here accepts. The value must not hold binary.
std::vector<uint8_t> EncodeMessagePack(const Value& value);

// Name of a ScanResult::Form, for log lines and reasons ("truncated").
std::string_view FormName(ScanResult::Form form);

}  // namespace tavrin::protocol
