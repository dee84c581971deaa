#include "Common.h"

#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <system_error>

#include <fmt/format.h>

namespace tavrin::ctl {
namespace {

std::string EnvironmentValue(const char* name) {
  const char* value = std::getenv(name);
  return value ? std::string(value) : std::string();
}

std::string UnderRoot(const std::string& root, std::string_view relative) {
  std::error_code ignored;
  std::filesystem::path base = std::filesystem::absolute(root, ignored);
  if (base.empty()) base = root;
  return (base / relative).lexically_normal().string();
}

// A number and what follows it; nothing when the text does not start with a number.
std::optional<std::pair<double, std::string_view>> LeadingNumber(std::string_view text) {
  double value = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value, std::chars_format::fixed);
  if (error != std::errc() || !std::isfinite(value)) return std::nullopt;
  return std::pair(value, text.substr(size_t(end - text.data())));
}

std::optional<double> UnitSeconds(std::string_view unit) {
  if (unit == "ms") return 0.001;
  if (unit == "s") return 1.0;
  if (unit == "m") return 60.0;
  if (unit == "h") return 3600.0;
  if (unit == "d") return 86400.0;
  return std::nullopt;
}

}  // namespace

Paths ResolvePaths(const GlobalOptions& options) {
  Paths paths;
  const std::string environmentSocket = EnvironmentValue("TAVRIN_SOCKET");
  const std::string environmentDefaults = EnvironmentValue("TAVRIN_DEFAULTS");
  const bool rooted = !options.root.empty();

  if (!options.socket.empty()) {
    paths.socket = options.socket;
    paths.socketSource = "--socket";
  } else if (!environmentSocket.empty()) {
    paths.socket = environmentSocket;
    paths.socketSource = "TAVRIN_SOCKET";
  } else if (rooted) {
    paths.socket = UnderRoot(options.root, "run/reporting.sock");
    paths.socketSource = "--root";
  } else {
    paths.socket = "/run/tavrin/reporting.sock";
    paths.socketSource = "the default";
  }

  if (!options.defaults.empty()) {
    paths.defaults = options.defaults;
  } else if (!environmentDefaults.empty()) {
    paths.defaults = environmentDefaults;
  } else {
    paths.defaults = rooted ? UnderRoot(options.root, "etc/com.quorvex.tavrin.toml")
                            : std::string(kDefaultDefaultsPath);
  }

  if (!options.stateDir.empty()) {
    paths.stateDir = options.stateDir;
  } else {
    paths.stateDir = rooted ? UnderRoot(options.root, "lib") : std::string(kDefaultStateDir);
  }

  if (!options.diagnosticDir.empty()) {
    paths.diagnosticDir = options.diagnosticDir;
  } else {
    paths.diagnosticDir =
        rooted ? UnderRoot(options.root, "log/DiagnosticLogs") : std::string(kDefaultDiagnosticDir);
  }
  return paths;
}

namespace {
std::string& FailPrefix() {
  static std::string prefix;
  return prefix;
}
}  // namespace

int Fail(int status, std::string_view message) {
  std::fflush(stdout);  // keeps the order of what came before, when both go to one place
  std::fprintf(stderr, "tavrinctl: %s%.*s\n", FailPrefix().c_str(), int(message.size()),
               message.data());
  return status;
}

void SetFailPrefix(std::string prefix) { FailPrefix() = std::move(prefix); }

std::optional<int64_t> ParseSigned(std::string_view text) {
  bool negative = false;
  if (!text.empty() && (text.front() == '-' || text.front() == '+')) {
    negative = text.front() == '-';
    text.remove_prefix(1);
  }
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty() || text.front() == '-' || text.front() == '+') return std::nullopt;
  uint64_t magnitude = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  // The magnitude of INT64_MIN is one more than INT64_MAX.
  const uint64_t limit = negative ? uint64_t(INT64_MAX) + 1 : uint64_t(INT64_MAX);
  if (magnitude > limit) return std::nullopt;
  if (!negative) return int64_t(magnitude);
  return magnitude == limit ? INT64_MIN : -int64_t(magnitude);
}

std::optional<uint64_t> ParseUnsigned(std::string_view text, uint64_t max) {
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty() || text.front() == '-' || text.front() == '+') return std::nullopt;
  uint64_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (error != std::errc() || end != text.data() + text.size() || value > max) return std::nullopt;
  return value;
}

std::optional<double> ParseSeconds(std::string_view text) {
  const auto number = LeadingNumber(text);
  if (!number || number->first < 0) return std::nullopt;
  if (number->second.empty()) return number->first;
  const auto unit = UnitSeconds(number->second);
  if (!unit) return std::nullopt;
  return number->first * *unit;
}

std::optional<double> ParseTimeBound(std::string_view text, double now, std::string* error) {
  const auto number = LeadingNumber(text);
  if (!number || number->first < 0) {
    *error = fmt::format(
        "'{}' is not a time: give seconds since the epoch (1700000000) or how long ago (10m, 2h)",
        text);
    return std::nullopt;
  }
  if (number->second.empty()) return number->first;
  const auto unit = UnitSeconds(number->second);
  if (!unit) {
    *error =
        fmt::format("'{}' has an unknown unit '{}': use ms, s, m, h or d", text, number->second);
    return std::nullopt;
  }
  return now - number->first * *unit;
}

LineStatus ReadBoundedLine(std::FILE* in, std::string* line, size_t maxBytes) {
  line->clear();
  bool tooLong = false;
  bool any = false;
  for (;;) {
    const int c = std::fgetc(in);
    if (c == EOF) {
      if (!any) return LineStatus::kEnd;
      break;
    }
    any = true;
    if (c == '\n') break;
    if (line->size() >= maxBytes) {
      tooLong = true;
      continue;
    }
    line->push_back(char(c));
  }
  if (tooLong) {
    line->clear();
    return LineStatus::kTooLong;
  }
  if (!line->empty() && line->back() == '\r') line->pop_back();
  return LineStatus::kLine;
}

bool IsBlank(std::string_view line) {
  return line.find_first_not_of(" \t\r\f\v") == std::string_view::npos;
}

double WallNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::string FormatLocalTime(double secondsSinceEpoch, bool withMilliseconds) {
  const double whole = std::floor(secondsSinceEpoch);
  const std::time_t seconds = std::time_t(whole);
  std::tm local{};
  localtime_r(&seconds, &local);
  char text[64];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &local);
  if (!withMilliseconds) return text;
  const int milliseconds = std::min(999, int((secondsSinceEpoch - whole) * 1000.0));
  return fmt::format("{}.{:03}", text, milliseconds);
}

}  // namespace tavrin::ctl
