#pragma once

// What every tavrinctl command shares: exit statuses, the global options and the paths they
// resolve to, the parsers of numbers, times and durations, and error printing.

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>

namespace tavrin::ctl {

// Exit statuses, listed in --help and docs/tavrinctl.md.
inline constexpr int kExitOk = 0;
inline constexpr int kExitFailed = 1;       // the service's error answer, bad input, a file problem
inline constexpr int kExitUsage = 2;        // a command line that cannot be used
inline constexpr int kExitUnreachable = 3;  // no service at the socket, or the connection ended
inline constexpr int kExitTimedOut = 4;     // no answer within --timeout

// The paths of the service's installed layout, and where --root puts them.
inline constexpr std::string_view kDefaultStateDir = "/var/lib/tavrin";
inline constexpr std::string_view kDefaultDiagnosticDir = "/var/log/tavrin/DiagnosticLogs";
inline constexpr std::string_view kDefaultDefaultsPath = "/etc/tavrin/com.quorvex.tavrin.toml";
inline constexpr std::string_view kStoreFileName = "tavrin.db";
inline constexpr std::string_view kSummarySubdirectory = "Audio/Reporting";

struct GlobalOptions {
  std::string socket;
  std::string root;
  std::string stateDir;
  std::string diagnosticDir;
  std::string defaults;
  std::string timeout = "5s";
  bool json = false;
};

// Where the service's files are for this invocation.
struct Paths {
  std::string socket;
  std::string stateDir;
  std::string diagnosticDir;
  std::string defaults;
  // How the socket was chosen ("--socket", "TAVRIN_SOCKET", "--root", "the default"), for error
  // messages that say what to change.
  std::string socketSource;
};

// An explicit flag wins, then the environment (TAVRIN_SOCKET, TAVRIN_DEFAULTS), then the place
// under the root, then the installed default. `options.root` already holds TAVRIN_ROOT when the
// flag was not given.
Paths ResolvePaths(const GlobalOptions& options);

// What a command needs besides its own arguments.
struct Context {
  Paths paths;
  std::chrono::milliseconds timeout{5000};
  bool json = false;
};

// Prints "tavrinctl: <message>" on stderr and returns `status`.
int Fail(int status, std::string_view message);
// Text put before every later message of Fail ("line 3: " in a scripted shell).
void SetFailPrefix(std::string prefix);

// A signed 64-bit integer, decimal or 0x-hexadecimal ("-12", "0x1f"). Nothing on any other text.
std::optional<int64_t> ParseSigned(std::string_view text);
// An unsigned integer no larger than `max`, decimal or 0x-hexadecimal.
std::optional<uint64_t> ParseUnsigned(std::string_view text, uint64_t max);

// A length of time: a non-negative number with an optional unit ms, s, m, h or d ("500ms",
// "1.5h"); a bare number is seconds. Nothing on anything else.
std::optional<double> ParseSeconds(std::string_view text);

// A bound of a time range, in seconds since the epoch: a bare number is a time since the epoch
// ("1700000000.5"); a number with a unit is that long before `now` ("10m", "2h", "30s").
// `error` says what is wrong when nothing is answered.
std::optional<double> ParseTimeBound(std::string_view text, double now, std::string* error);

// Reading stdin a line at a time, with a bound: one line is one message or one command, and no
// message the service accepts by default (1 MiB frames) comes near it.
inline constexpr size_t kMaxLineBytes = 4 << 20;
enum class LineStatus { kLine, kEnd, kTooLong };
// The next line without its "\n" (and "\r"). kTooLong skips the rest of the line; kEnd comes at
// the end of input (a last line without "\n" is a line).
LineStatus ReadBoundedLine(std::FILE* in, std::string* line, size_t maxBytes = kMaxLineBytes);
// Whether `line` holds nothing but blanks.
bool IsBlank(std::string_view line);

// Seconds since the epoch, now.
double WallNow();

// "2024-05-01 12:00:01.123" in local time.
std::string FormatLocalTime(double secondsSinceEpoch, bool withMilliseconds);

}  // namespace tavrin::ctl
