#include "base/Dictionary.h"

#include <cmath>
#include <cstdint>

namespace tavrin {

Dictionary MakeDictionary() { return Dictionary::object(); }

std::string JsonText(const Value& value) {
  // Strings from clients may hold invalid UTF-8; replace it rather than throw.
  return value.dump(-1, ' ', false, Value::error_handler_t::replace);
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
