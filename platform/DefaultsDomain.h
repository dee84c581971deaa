#pragma once

#include "base/Dictionary.h"

namespace tavrin {

inline constexpr const char* kDefaultsDomainName = "com.quorvex.tavrin";

// A defaults domain: settings by key. Read() opens the domain afresh every time.
class DefaultsDomain {
 public:
  virtual ~DefaultsDomain() = default;
  // Every key of the domain with its value (strings, booleans, integers, doubles, arrays, tables).
  // A missing domain reads as an empty dictionary; an unreadable one too, with one error line.
  virtual Dictionary Read() = 0;
};

}  // namespace tavrin
