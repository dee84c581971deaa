#include "base/Dictionary.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

namespace tavrin {
namespace {

TEST(DictionaryTest, NumbersPrintInTheirShortestDecimalForm) {
  EXPECT_EQ(ValueText(3), "3");
  EXPECT_EQ(ValueText(2.0), "2");
  EXPECT_EQ(ValueText(-7.0), "-7");
  EXPECT_EQ(ValueText(4.9), "4.9");
  EXPECT_EQ(ValueText(1.0 / 3.0), "0.3333333333333333");
  EXPECT_EQ(ValueText(1e20), "1e+20");
  EXPECT_EQ(ValueText(1.5e-7), "1.5e-07");
  // Whole floats up to 2^53 print as integers, beyond it in exponent form.
  EXPECT_EQ(ValueText(9007199254740991.0), "9007199254740991");
  EXPECT_EQ(ValueText(std::numeric_limits<int64_t>::min()), "-9223372036854775808");
  EXPECT_EQ(ValueText(std::numeric_limits<int64_t>::max()), "9223372036854775807");
  EXPECT_EQ(ValueText(std::numeric_limits<uint64_t>::max()), "18446744073709551615");
  EXPECT_EQ(ValueText(uint64_t{1} << 63), "9223372036854775808");
}

TEST(DictionaryTest, NonFiniteFloatsPrintWithoutThrowing) {
  EXPECT_EQ(ValueText(std::numeric_limits<double>::infinity()), "inf");
  EXPECT_EQ(ValueText(-std::numeric_limits<double>::infinity()), "-inf");
  EXPECT_EQ(ValueText(std::nan("")), "nan");
}

TEST(DictionaryTest, BooleansStringsAndNullHaveTheirPlainForms) {
  EXPECT_EQ(ValueText(true), "1");
  EXPECT_EQ(ValueText(false), "0");
  EXPECT_EQ(ValueText("speaker"), "speaker");
  EXPECT_EQ(ValueText(""), "");
  EXPECT_EQ(ValueText("a \"quoted\" word"), "a \"quoted\" word");
  EXPECT_EQ(ValueText(nullptr), "(null)");
}

TEST(DictionaryTest, ContainersPrintAsCompactJsonInInsertionOrder) {
  Dictionary dictionary = MakeDictionary();
  EXPECT_TRUE(dictionary.is_object());
  EXPECT_EQ(ValueText(dictionary), "{}");
  dictionary["zeta"] = 1;  // insertion order, not sorted
  dictionary["alpha"] = Value::array({1, 2.5, "x", nullptr, false});
  dictionary["mid"] = {{"b", -1}, {"a", Value::object()}};
  const std::string expected = R"({"zeta":1,"alpha":[1,2.5,"x",null,false],"mid":{"b":-1,"a":{}}})";
  EXPECT_EQ(ValueText(dictionary), expected);
  EXPECT_EQ(JsonText(dictionary), expected);
  EXPECT_EQ(ValueText(Value::array()), "[]");
}

TEST(DictionaryTest, InvalidUtf8NeverThrows) {
  const std::string invalid = "ok\xff\xfe";
  // A plain string is shown as it is; inside JSON the bad bytes become U+FFFD.
  EXPECT_EQ(ValueText(invalid), invalid);
  EXPECT_EQ(JsonText(invalid), "\"ok\xEF\xBF\xBD\xEF\xBF\xBD\"");
  Dictionary dictionary = MakeDictionary();
  dictionary[invalid] = Value::array({invalid});
  EXPECT_NO_THROW(ValueText(dictionary));
  EXPECT_EQ(ValueText(dictionary),
            "{\"ok\xEF\xBF\xBD\xEF\xBF\xBD\":[\"ok\xEF\xBF\xBD\xEF\xBF\xBD\"]}");
}

// The service writes its own JSON text; it must be the library's, byte for byte, whatever the
// strings hold and whatever the numbers are (JSON has no NaN: both show null rather than fail).
TEST(DictionaryTest, JsonTextIsTheLibrarysCompactDump) {
  const std::vector<Value> values = {
      Value::object(
          {{"plain", "ascii text"}, {"a \"quote\"", "back\\slash"}, {"tab\t", "line\x1F"}}),
      Value::array({"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5", "bad\xC3", "\x80", "\x7F", ""}),
      Value::array(
          {2.0, -0.0, 0.1, 1e300, 5e-324, -1.5e-7, 123456789.125, 1e15, 1e16, std::nan("")}),
      Value::array({std::numeric_limits<int64_t>::min(), std::numeric_limits<uint64_t>::max(), 0}),
      Value::object({{"\xFF", Value::object({{"x", Value::array({true, false, nullptr})}})}}),
      Value::binary({1, 2, 3}),
  };
  for (const Value& value : values) {
    EXPECT_EQ(JsonText(value), value.dump(-1, ' ', false, Value::error_handler_t::replace));
  }
}

TEST(DictionaryTest, FmtPrintsAValueInItsTextForm) {
  EXPECT_EQ(fmt::format("{}", Value(2.0)), "2");
  EXPECT_EQ(fmt::format("[{}]", Value("x")), "[x]");
  EXPECT_EQ(fmt::format("{}", Value::array({1, "a"})), R"([1,"a"])");
}

}  // namespace
}  // namespace tavrin
