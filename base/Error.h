#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tavrin {

// A platform error: a domain, a numeric code and a human-readable description. Platform errors
// are logged with their code or their description and go no further.
struct Error {
  std::string domain;
  int64_t code = 0;
  std::string description;

  const std::string& LocalizedDescription() const { return description; }
};

// The domain of general platform errors (code -1 with a failure reason, for example).
inline constexpr const char* kGeneralErrorDomain = "com.quorvex.tavrin.general";

using OptionalError = std::optional<Error>;

}  // namespace tavrin
