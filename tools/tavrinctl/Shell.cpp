#include "Shell.h"

#include <editline/readline.h>
#include <unistd.h>

#include <cstdlib>

#include <fmt/format.h>

#include "Operations.h"

namespace tavrin::ctl {
namespace {

// Lines kept in the history file between shells: enough for a day's work, small to load.
constexpr int kHistoryLines = 1000;
constexpr const char* kPrompt = "tavrin> ";

bool IsSpace(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; }

std::string HistoryPath() {
  const char* home = std::getenv("HOME");
  return home && *home ? std::string(home) + "/.tavrinctl_history" : std::string();
}

// The next command line; false at the end of input.
class LineSource {
 public:
  LineSource(std::FILE* in) : in_(in), interactive_(::isatty(::fileno(in)) == 1) {
    if (!interactive_) return;
    rl_instream = in;
    using_history();
    stifle_history(kHistoryLines);
    history_ = HistoryPath();
    if (!history_.empty()) read_history(history_.c_str());
  }
  ~LineSource() {
    if (interactive_ && !history_.empty()) write_history(history_.c_str());
  }
  LineSource(const LineSource&) = delete;
  LineSource& operator=(const LineSource&) = delete;

  bool interactive() const { return interactive_; }

  bool Next(std::string* line, bool* tooLong) {
    *tooLong = false;
    if (!interactive_) {
      const LineStatus status = ReadBoundedLine(in_, line);
      *tooLong = status == LineStatus::kTooLong;
      return status != LineStatus::kEnd;
    }
    char* read = readline(kPrompt);
    if (read == nullptr) return false;
    line->assign(read);
    std::free(read);
    if (!IsBlank(*line)) add_history(line->c_str());
    return true;
  }

 private:
  std::FILE* in_;
  bool interactive_;
  std::string history_;
};

CLI::App* FindCommand(CLI::App& app, std::string_view name) {
  for (CLI::App* command : app.get_subcommands({})) {
    if (command->get_name() == name) return command;
  }
  return nullptr;
}

void PrintShellHelp(CLI::App& app) {
  std::printf("Commands (each runs on this shell's one connection):\n");
  for (const CLI::App* command : app.get_subcommands({})) {
    std::printf("  %-10s %s\n", command->get_name().c_str(), command->get_description().c_str());
  }
  std::printf("  %-10s %s\n", "help", "this list; 'help COMMAND' or 'COMMAND --help' for one");
  std::printf("  %-10s %s\n", "quit", "stop the sessions still running here and leave (or Ctrl-D)");
  std::printf("JSON arguments need no quotes: send {\"level\": 3} --to 42\n");
}

}  // namespace

std::optional<std::vector<std::string>> SplitShellWords(std::string_view line, std::string* error) {
  std::vector<std::string> words;
  const size_t n = line.size();
  size_t i = 0;
  for (;;) {
    while (i < n && IsSpace(line[i])) ++i;
    if (i >= n) break;
    std::string word;
    if (line[i] == '{' || line[i] == '[') {
      const size_t start = i;
      std::string closers;
      bool inString = false;
      for (; i < n; ++i) {
        const char c = line[i];
        if (inString) {
          if (c == '\\') {
            ++i;
          } else if (c == '"') {
            inString = false;
          }
          continue;
        }
        if (c == '"') {
          inString = true;
        } else if (c == '{' || c == '[') {
          closers.push_back(c == '{' ? '}' : ']');
        } else if (c == '}' || c == ']') {
          if (closers.empty() || closers.back() != c) {
            *error = fmt::format("'{}' at column {} closes nothing that is open", c, i + 1);
            return std::nullopt;
          }
          closers.pop_back();
          if (closers.empty()) {
            ++i;
            break;
          }
        }
      }
      if (!closers.empty() || inString) {
        *error = fmt::format("the JSON that starts at column {} is not finished", start + 1);
        return std::nullopt;
      }
      if (i < n && !IsSpace(line[i])) {
        *error = fmt::format(
            "the JSON that starts at column {} ends at column {}, but '{}' follows "
            "it",
            start + 1, i, line[i]);
        return std::nullopt;
      }
      words.emplace_back(line.substr(start, i - start));
      continue;
    }
    while (i < n && !IsSpace(line[i])) {
      const char c = line[i];
      if (c == '\'') {
        const size_t close = line.find('\'', i + 1);
        if (close == std::string_view::npos) {
          *error = fmt::format("the ' at column {} is not closed", i + 1);
          return std::nullopt;
        }
        word.append(line.substr(i + 1, close - i - 1));
        i = close + 1;
      } else if (c == '"') {
        const size_t open = i++;
        while (i < n && line[i] != '"') {
          // As in sh: inside "...", a backslash escapes only " and itself.
          if (line[i] == '\\' && i + 1 < n && (line[i + 1] == '"' || line[i + 1] == '\\')) ++i;
          word.push_back(line[i++]);
        }
        if (i >= n) {
          *error = fmt::format("the \" at column {} is not closed", open + 1);
          return std::nullopt;
        }
        ++i;
      } else if (c == '\\' && i + 1 < n) {
        word.push_back(line[i + 1]);
        i += 2;
      } else {
        word.push_back(c);
        ++i;
      }
    }
    words.push_back(std::move(word));
  }
  return words;
}

CLI::App* AddShellCommand(CLI::App& app) {
  CLI::App* shell = app.add_subcommand(
      "shell", "type operations interactively on one connection (help lists them)");
  shell->footer(
      "Sessions created in the shell live until they are stopped, destroyed or the shell ends; "
      "at the end the shell stops those still running. When stdin is not a terminal, commands "
      "are read one per line without prompts, so the shell can be scripted.");
  return shell;
}

int RunShell(const Context& context, std::FILE* in) {
  auto opened = Connection::Open(context);
  if (auto* status = std::get_if<int>(&opened)) return *status;
  Connection& connection = *std::get<std::unique_ptr<Connection>>(opened);
  LineSource lines(in);
  if (lines.interactive()) {
    std::printf(
        "tavrinctl shell on %s. Sessions created here live until stopped or until the "
        "shell ends. Type help.\n",
        context.paths.socket.c_str());
  }

  int lastFailure = kExitOk;
  auto failed = [&](int status, std::string_view message) {
    lastFailure = status;
    return Fail(status, message);
  };
  bool killed = false;
  std::string line;
  size_t lineNumber = 0;
  bool tooLong = false;
  bool ended = false;
  while (!killed && !(ended = !lines.Next(&line, &tooLong))) {
    ++lineNumber;
    // A script's errors say which line they come from.
    if (!lines.interactive()) SetFailPrefix(fmt::format("line {}: ", lineNumber));
    if (tooLong) {
      failed(kExitUsage, fmt::format("longer than {} bytes; skipped", kMaxLineBytes));
      continue;
    }
    std::string error;
    auto words = SplitShellWords(line, &error);
    if (!words) {
      failed(kExitUsage, error);
      continue;
    }
    if (words->empty() || words->front().starts_with("#")) continue;
    const std::string& name = words->front();
    if (name == "quit" || name == "exit") break;

    CLI::App app{"tavrinctl shell", ""};
    app.set_help_flag("--help,-h", "this help");
    OperationCommands operations;
    operations.AddTo(app, false);
    if (name == "help" || name == "?") {
      if (words->size() > 1) {
        if (CLI::App* command = FindCommand(app, (*words)[1])) {
          std::printf("%s", command->help().c_str());
          continue;
        }
      }
      PrintShellHelp(app);
      continue;
    }
    if (FindCommand(app, name) == nullptr) {
      failed(kExitUsage, fmt::format("unknown command '{}'; type help", name));
      continue;
    }
    std::vector<std::string> arguments(words->rbegin(), words->rend());
    try {
      app.parse(arguments);
    } catch (const CLI::CallForHelp&) {
      std::printf("%s", app.get_subcommand(name)->help().c_str());
      continue;
    } catch (const CLI::ParseError& parseError) {
      failed(kExitUsage, fmt::format("{}: {}", name, parseError.what()));
      continue;
    }
    const int status = operations.Run(connection, context);
    std::fflush(stdout);
    if (status != kExitOk) lastFailure = status;
    for (const std::string& note : connection.TakeNotes()) std::printf("%s\n", note.c_str());
    if (name == "kill" && status == kExitOk) killed = true;
    if (!killed && !connection.client().connected()) {
      failed(kExitUnreachable, "the connection to the service ended; leaving the shell");
      return lastFailure;
    }
  }

  SetFailPrefix("");
  // Ctrl-D leaves the cursor after the prompt.
  if (ended && lines.interactive()) std::printf("\n");
  if (!killed) {
    for (int64_t reporterID : connection.RunningOwnSessions()) {
      auto stopped = connection.client().stopReportingSessionForID(reporterID, context.timeout);
      if (!stopped) {
        lastFailure = ReportError(stopped.error(), context, fmt::format("stop {}", reporterID));
        continue;
      }
      if (context.json) {
        PrintJsonLine({{"operation", "stop"},
                       {"reporterID", reporterID},
                       {"answer", stopped.value()},
                       {"atEnd", true}});
      } else {
        std::printf("stopped %lld, still running at the end\n", static_cast<long long>(reporterID));
      }
    }
  }
  return lastFailure;
}

}  // namespace tavrin::ctl
