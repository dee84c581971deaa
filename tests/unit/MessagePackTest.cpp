#include "protocol/MessagePack.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "tests/support/MessagePackBytes.h"

namespace tavrin::protocol {
namespace {

using Bytes = std::vector<uint8_t>;
using Form = ScanResult::Form;
using tavrin::testing::IntFormat;
using tavrin::testing::Pack;

// `levels` arrays, each holding the next, around a nil.
Bytes NestedArrays(int levels) {
  Pack pack;
  for (int i = 0; i < levels; ++i) pack.array(1);
  pack.nil();
  return pack;
}

// A value using every format that the parser accepts, nested a few levels.
Bytes Mixed() {
  Pack map;  // one entry per statement
  map.map(3).str("a").integer(IntFormat::kInt16, static_cast<uint64_t>(-300));
  map.str("nested").array(3).float64(4.5).float32(0.25f).boolean(false);
  map.str(std::string(40, 'x')).array(2).nil().boolean(true);
  Pack value;  // [7, map, str16, uint64, negative fixint]
  value.array(5).uint(7).append(map).str(std::string(300, 'y'));
  value.integer(IntFormat::kUint64, std::numeric_limits<uint64_t>::max());
  return value.integer(IntFormat::kNegativeFixint, static_cast<uint64_t>(-5));
}

TEST(MessagePackTest, MixedValueDecodesWithWireOrderAndSignedness) {
  const DecodedValue decoded = DecodeMessagePack(Mixed());
  ASSERT_TRUE(decoded.scan.Parsable()) << FormName(decoded.scan.form);
  ASSERT_TRUE(decoded.value);
  const Value& v = *decoded.value;
  EXPECT_EQ(decoded.scan.depth, 3);
  EXPECT_EQ(decoded.scan.topLevelArraySize, 5u);
  ASSERT_EQ(v.size(), 5u);
  EXPECT_TRUE(v[0].is_number_unsigned());
  EXPECT_EQ(v[1].begin().key(), "a");
  EXPECT_EQ(v[1]["a"].get<int64_t>(), -300);
  EXPECT_EQ(v[1]["nested"][1].get<double>(), 0.25);
  EXPECT_EQ(v[1][std::string(40, 'x')], Value::array({nullptr, true}));
  EXPECT_EQ(v[2].get<std::string>().size(), 300u);
  EXPECT_EQ(v[3].get<uint64_t>(), std::numeric_limits<uint64_t>::max());
  EXPECT_EQ(v[4].get<int64_t>(), -5);
}

TEST(MessagePackTest, DepthCountsArraysAndMapsOneLevelEach) {
  EXPECT_EQ(ScanMessagePack(Pack().nil()).depth, 0);
  EXPECT_EQ(ScanMessagePack(Pack().array(0)).depth, 1);
  EXPECT_EQ(ScanMessagePack(Pack().map(0)).depth, 1);
  EXPECT_EQ(ScanMessagePack(Pack().array(2).uint(1).array(0)).depth, 2);
  // The deepest branch counts, not the last one.
  EXPECT_EQ(ScanMessagePack(Pack().array(2).map(1).str("k").array(1).nil().uint(1)).depth, 3);
  // An empty container past the limit is too deep. (The limit itself and one more, through a
  // request, are in CodecTest's nesting case.)
  Pack pack;
  for (int i = 0; i < kMaxNestingDepth; ++i) pack.array(1);
  pack.map(0);
  EXPECT_TRUE(ScanMessagePack(pack).tooDeep);
}

// 12 KB of nested arrays would overflow the stack of a recursive parser in a debug build; the
// scan must refuse it without parsing, and still check the form of what follows.
TEST(MessagePackTest, TwelveKilobytesOfNestingIsTooDeepNotACrash) {
  const Bytes deep = NestedArrays(12 * 1024);
  const DecodedValue decoded = DecodeMessagePack(deep);
  EXPECT_TRUE(decoded.scan.WellFormed());
  EXPECT_TRUE(decoded.scan.tooDeep);
  EXPECT_EQ(decoded.scan.depth, kMaxNestingDepth + 1);
  EXPECT_FALSE(decoded.value);

  // The same nesting of maps, each with a key and a sibling after the nested value.
  Pack maps;
  for (int i = 0; i < 4000; ++i) maps.map(2).str("k");
  maps.nil();
  for (int i = 0; i < 4000; ++i) maps.str("s").uint(1);
  const ScanResult scan = ScanMessagePack(maps);
  EXPECT_TRUE(scan.WellFormed());
  EXPECT_TRUE(scan.tooDeep);

  // Cut one byte short: a form fault, which the depth must not hide.
  Bytes cut = maps.bytes();
  cut.pop_back();
  EXPECT_EQ(ScanMessagePack(cut).form, Form::kTruncated);
}

TEST(MessagePackTest, EveryPrefixOfAValueIsTruncated) {
  const Bytes whole = Mixed();
  for (size_t size = 0; size < whole.size(); ++size) {
    const DecodedValue decoded = DecodeMessagePack({whole.data(), size});
    EXPECT_EQ(decoded.scan.form, Form::kTruncated) << "prefix of " << size << " bytes";
    EXPECT_FALSE(decoded.value);
  }
}

// Declared lengths are checked against what is left before anything is believed.
TEST(MessagePackTest, FormFaultsAreFoundAndNothingIsBuilt) {
  Bytes trailing = Pack().array(1).uint(1);
  trailing.push_back(0xc0);
  const std::vector<std::pair<Bytes, Form>> cases = {
      {trailing, Form::kTrailingBytes},
      {Pack().array(2).uint(1).raw({0xc1}), Form::kInvalidByte},
      {Pack().big(0xdb, 0xffffffff, 4).str("abc"), Form::kTruncated},        // str32 of 4 GB
      {Pack().big(0xdd, 0xffffffff, 4).nil(), Form::kTruncated},             // array32, 4G elements
      {Pack().big(0xdf, 0xffffffff, 4).str("k").nil(), Form::kTruncated},    // map32 of 4G pairs
      {Pack().array(2).uint(1).big(0xc6, 0xfffffff0, 4), Form::kTruncated},  // bin32
      {Pack().array(2).uint(1).big(0xc9, 0xfffffff0, 4).raw({1}), Form::kTruncated},  // ext32
      {Pack().big(0xdc, 3, 2).nil().nil(), Form::kTruncated},  // one element short
      {Pack().map(1).str("k"), Form::kTruncated},              // a key without its value
  };
  for (size_t i = 0; i < cases.size(); ++i) {
    const DecodedValue decoded = DecodeMessagePack(cases[i].first);
    EXPECT_EQ(decoded.scan.form, cases[i].second) << "case " << i;
    EXPECT_FALSE(decoded.value) << "case " << i;
  }
  EXPECT_EQ(ScanMessagePack(trailing).offset, 2u);
}

TEST(MessagePackTest, BinAndExtAreNamedAndNotParsed) {
  struct Case {
    Bytes bytes;
    std::string_view name;
  };
  const std::vector<Case> cases = {
      {Pack().big(0xc4, 2, 1).raw({1, 2}), "bin8"},
      {Pack().big(0xc6, 0, 4), "bin32"},
      {Pack().big(0xc7, 1, 1).raw({5, 9}), "ext8"},
      {Pack().big(0xc9, 2, 4).raw({5, 9, 9}), "ext32"},
      {Pack().raw({0xd4, 5, 1}), "fixext1"},
      {Pack().raw({0xd6, 5, 1, 2, 3, 4}), "fixext4"},
      {Pack().raw({0xd8, 5}).append(Bytes(16, 0)), "fixext16"},
  };
  for (const Case& c : cases) {
    // Inside a request, after other elements, so the scan must skip over it correctly.
    const Bytes wrapped = Pack().array(3).uint(4).map(1).str("k").append(c.bytes).uint(9);
    const DecodedValue decoded = DecodeMessagePack(wrapped);
    EXPECT_TRUE(decoded.scan.WellFormed()) << c.name;
    EXPECT_EQ(decoded.scan.unsupportedType, c.name);
    EXPECT_FALSE(decoded.value) << c.name;
    EXPECT_EQ(decoded.scan.firstValue, 4u);
  }
}

TEST(MessagePackTest, NonStringMapKeysAreFoundAtAnyDepth) {
  EXPECT_TRUE(ScanMessagePack(Pack().map(1).uint(1).nil()).nonStringKey);
  EXPECT_TRUE(
      ScanMessagePack(Pack().array(2).uint(1).map(2).str("a").nil().uint(2).nil()).nonStringKey);
  // Values may be anything; only keys must be strings.
  const DecodedValue ok =
      DecodeMessagePack(Pack().map(2).str("a").uint(1).str("b").map(1).str("c").array(0));
  EXPECT_FALSE(ok.scan.nonStringKey);
  EXPECT_TRUE(ok.value);
}

// Integers of every format as the call, with their values, are in CodecTest's integer table.
TEST(MessagePackTest, FirstElementOfTopLevelArrayIsClassified) {
  using First = ScanResult::First;
  struct Case {
    Bytes bytes;
    First first;
    uint64_t value;
  };
  const std::vector<Case> cases = {
      {Pack().array(2).uint(0).nil(), First::kUnsigned, 0},
      {Pack().array(1).integer(IntFormat::kInt8, 5), First::kUnsigned, 5},
      {Pack().array(1).nil(), First::kNil, 0},
      {Pack().array(1).float64(1.0), First::kOther, 0},
      {Pack().array(1).array(1).uint(1), First::kOther, 0},
      {Pack().array(0), First::kAbsent, 0},
      {Pack().map(1).str("a").uint(1), First::kAbsent, 0},
      {Pack().uint(3), First::kAbsent, 0},
  };
  for (size_t i = 0; i < cases.size(); ++i) {
    const ScanResult scan = ScanMessagePack(cases[i].bytes);
    EXPECT_EQ(scan.first, cases[i].first) << "case " << i;
    if (cases[i].first == First::kUnsigned) {
      EXPECT_EQ(scan.firstValue, cases[i].value) << "case " << i;
    }
  }
}

TEST(MessagePackTest, InvalidUtf8StringsDecodeAndReencode) {
  const Bytes bytes = Pack().array(1).raw({0xa2, 0xff, 0xfe});
  const DecodedValue decoded = DecodeMessagePack(bytes);
  ASSERT_TRUE(decoded.value);
  EXPECT_EQ(EncodeMessagePack(*decoded.value), bytes);
}

// A wide map is built by appending with a hash index: the same value as inserting key by key
// (repeats keep their first place and take their last value), in time linear in its size.
// 200,000 keys took tens of seconds when each insert searched the keys before it.
Bytes WideMap(int keys) {
  Pack pack;
  pack.map(static_cast<uint32_t>(keys + 2));
  for (int i = 0; i < keys; ++i) pack.str("key number " + std::to_string(i)).uint(uint64_t(i));
  pack.str("key number 0").str("last").str("key number 1").nil();
  return pack;
}

TEST(MessagePackTest, WideMapsDecodeLikeKeyByKeyInsertsInLinearTime) {
  for (int keys : {15, 16, 100}) {  // both sides of the width where the index starts
    Value expected = Value::object();
    for (int i = 0; i < keys; ++i) expected["key number " + std::to_string(i)] = i;
    expected["key number 0"] = "last";
    expected["key number 1"] = nullptr;
    DecodedValue decoded = DecodeMessagePack(WideMap(keys));
    ASSERT_TRUE(decoded.value) << keys;
    EXPECT_EQ(decoded.value->dump(), expected.dump()) << keys;
    EXPECT_EQ(decoded.scan.entries, uint64_t(keys + 2));
  }
  const Bytes wide = WideMap(200'000);
  const auto started = std::chrono::steady_clock::now();
  DecodedValue decoded = DecodeMessagePack(wide);
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
  ASSERT_TRUE(decoded.value);
  EXPECT_EQ(decoded.value->size(), 200'000u);
  EXPECT_EQ(decoded.value->begin().value(), "last");
  EXPECT_EQ(decoded.value->back(), 199'999);
  EXPECT_FALSE(DecodeMessagePack(wide, 200'001).value) << "over the entry limit is not built";
  EXPECT_TRUE(DecodeMessagePack(wide, 200'002).value);
}

}  // namespace
}  // namespace tavrin::protocol
