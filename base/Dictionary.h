#pragma once

#include <nlohmann/json.hpp>

#include <memory>
#include <string>

#include <fmt/format.h>

namespace tavrin {

// The service's dictionary and value type. Insertion order is the enumeration order, so a payload
// keeps the order its client wrote it in (summary events and message keys depend on that).
// A value is one of: null, boolean, signed or unsigned integer, double, string, array, dictionary.
using Value = nlohmann::ordered_json;
using Dictionary = nlohmann::ordered_json;  // holds an object whenever it is called a dictionary
// A client message once decoded never changes, so every session, record and sink it goes to
// shares this one copy.
using PayloadPtr = std::shared_ptr<const Dictionary>;

// An empty dictionary (a JSON object, not null).
Dictionary MakeDictionary();

// The text form of a value, as used in message keys, summary values and log lines:
//  - numbers in their shortest decimal form ("3", "-1", "4.9", "2" for 2.0, "1e+20");
//  - booleans as "1" and "0";
//  - strings as they are (no quotes);
//  - null as "(null)";
//  - arrays and dictionaries as compact JSON with keys in their stored order, which is
//    deterministic for equal values.
std::string ValueText(const Value& value);

// Compact JSON text of any value (strings quoted); what "%@" shows for dictionaries and arrays.
std::string JsonText(const Value& value);

}  // namespace tavrin

// Lets fmt print a Value with "{}" in its text form.
template <>
struct fmt::formatter<tavrin::Value> : fmt::formatter<std::string> {
  template <typename FormatContext>
  auto format(const tavrin::Value& value, FormatContext& ctx) const {
    return fmt::formatter<std::string>::format(tavrin::ValueText(value), ctx);
  }
};
