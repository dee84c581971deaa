#include "base/Dictionary.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <string_view>

namespace tavrin {

Dictionary MakeDictionary() { return Dictionary::object(); }

namespace {

// The library's own text of `value`. Strings from clients may hold invalid UTF-8; it is replaced
// rather than thrown on.
std::string LibraryJsonText(const Value& value) {
  return value.dump(-1, ' ', false, Value::error_handler_t::replace);
}

// Printable ASCII other than the quote and the backslash: the text goes into JSON as it is.
bool NeedsNoEscaping(std::string_view text) {
  for (const unsigned char c : text) {
    if (c < 0x20 || c >= 0x80 || c == '"' || c == '\\') return false;
  }
  return true;
}

void AppendString(std::string& out, const std::string& text) {
  if (!NeedsNoEscaping(text)) {
    out += LibraryJsonText(Value(text));
    return;
  }
  out += '"';
  out += text;
  out += '"';
}

template <typename Number>
void AppendInteger(std::string& out, Number number) {
  char digits[24];
  const char* end = std::to_chars(digits, digits + sizeof digits, number).ptr;
  out.append(digits, static_cast<size_t>(end - digits));
}

// The same text as the library's compact dump, written into one string without the library's
// character-by-character UTF-8 walk over text that needs none: every message is turned into JSON
// for the store, and most of its keys and strings are plain ASCII.
void AppendJson(std::string& out, const Value& value) {
  switch (value.type()) {
    case Value::value_t::object: {
      out += '{';
      bool first = true;
      for (const auto& [key, member] : value.get_ref<const Value::object_t&>()) {
        if (!first) out += ',';
        first = false;
        AppendString(out, key);
        out += ':';
        AppendJson(out, member);
      }
      out += '}';
      return;
    }
    case Value::value_t::array: {
      out += '[';
      bool first = true;
      for (const Value& element : value.get_ref<const Value::array_t&>()) {
        if (!first) out += ',';
        first = false;
        AppendJson(out, element);
      }
      out += ']';
      return;
    }
    case Value::value_t::string:
      AppendString(out, value.get_ref<const std::string&>());
      return;
    case Value::value_t::boolean:
      out += value.get<bool>() ? "true" : "false";
      return;
    case Value::value_t::null:
      out += "null";
      return;
    case Value::value_t::number_integer:
      AppendInteger(out, value.get<int64_t>());
      return;
    case Value::value_t::number_unsigned:
      AppendInteger(out, value.get<uint64_t>());
      return;
    case Value::value_t::number_float: {
      const double number = value.get<double>();
      if (!std::isfinite(number)) {
        out += "null";
        return;
      }
      // The library's own shortest round-trip form ("2.0", "1e+20"), which its dump writes.
      char digits[64];
      const char* end = nlohmann::detail::to_chars(digits, digits + sizeof digits, number);
      out.append(digits, static_cast<size_t>(end - digits));
      return;
    }
    default:  // binary and discarded values
      out += LibraryJsonText(value);
      return;
  }
}

}  // namespace

std::string JsonText(const Value& value) {
  std::string text;
  AppendJson(text, value);
  return text;
}

std::string ValueText(const Value& value) {
  switch (value.type()) {
    case Value::value_t::null:
      return "(null)";
    case Value::value_t::boolean:
      return value.get<bool>() ? "1" : "0";
    case Value::value_t::number_integer:
      return std::to_string(value.get<int64_t>());
    case Value::value_t::number_unsigned:
      return std::to_string(value.get<uint64_t>());
    case Value::value_t::number_float: {
      const double number = value.get<double>();
      // Whole numbers print without a fraction ("2", not "2.0"), as far as they are exact.
      constexpr double kExactIntegerLimit = 9007199254740992.0;  // 2^53
      if (std::isfinite(number) && std::trunc(number) == number &&
          std::fabs(number) < kExactIntegerLimit) {
        return std::to_string(static_cast<int64_t>(number));
      }
      return fmt::format("{}", number);
    }
    case Value::value_t::string:
      return value.get_ref<const std::string&>();
    default:
      return JsonText(value);
  }
}

}  // namespace tavrin
