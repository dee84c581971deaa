// tavrinctl: the command-line client of tavrind. Remote operations go through libtavrin; the
// store, the summary files and the defaults file are read (and the defaults written) directly.

#include <cstdio>
#include <cstdlib>

#include <fmt/format.h>
#include <CLI/CLI.hpp>

#include "Common.h"
#include "Defaults.h"
#include "Operations.h"
#include "Record.h"
#include "Report.h"
#include "Shell.h"
#include "Store.h"
#include "Summaries.h"

namespace {

constexpr const char* kFooter = R"(
Sessions belong to the connection that created them, and the service stops them when that
connection ends. Each command above runs on its own connection, so create, set-type, configure,
stop and destroy only reach sessions created by the same command: use 'record' (one session fed
from stdin) or 'shell' (operations typed on one connection) to run a session from start to stop.
get-type, start, send, valid and reporters reach every connection's sessions.

Paths: --socket, else TAVRIN_SOCKET, else ROOT/run/reporting.sock with --root or TAVRIN_ROOT,
else /run/tavrin/reporting.sock. The store, summary files and defaults file follow --root the same
way tavrind places them.

Exit status: 0 done; 1 the operation failed (the service's error answer, a bad input line, a file
that cannot be read or written); 2 usage error; 3 the service is not reachable or the connection
ended; 4 no answer within --timeout.)";

}  // namespace

int main(int argc, char** argv) {
  using namespace tavrin::ctl;
  CLI::App app{"tavrinctl: command-line client of the tavrin reporting service (tavrind)"};
  app.name("tavrinctl");
  app.require_subcommand(1);
  app.fallthrough();
  app.footer(kFooter);
  app.get_formatter()->column_width(28);

  GlobalOptions global;
  app.add_option("--socket", global.socket, "the service's socket [TAVRIN_SOCKET]")
      ->type_name("PATH");
  app.add_option("--root", global.root, "the root tavrind runs in (tavrind --root)")
      ->envname("TAVRIN_ROOT")
      ->type_name("DIR");
  app.add_option("--state-dir", global.stateDir, "directory of the store tavrin.db")
      ->type_name("DIR");
  app.add_option("--diagnostic-dir", global.diagnosticDir,
                 "summary files are in DIR/Audio/Reporting")
      ->type_name("DIR");
  app.add_option("--defaults", global.defaults, "the defaults file [TAVRIN_DEFAULTS]")
      ->type_name("PATH");
  app.add_option("--timeout", global.timeout,
                 "how long to wait for the service: 500ms, 5s (default), 1m")
      ->type_name("TIME");
  app.add_flag("--json", global.json, "machine-readable output: one JSON value per line");

  OperationCommands operations;
  operations.AddTo(app, true);
  RecordOptions recordOptions;
  CLI::App* record = AddRecordCommand(app, recordOptions);
  CLI::App* shell = AddShellCommand(app);
  DefaultsOptions defaultsOptions;
  CLI::App* defaults = AddDefaultsCommand(app, defaultsOptions);
  EventsOptions eventsOptions;
  CLI::App* events = AddEventsCommand(app, eventsOptions);
  SummariesOptions summariesOptions;
  CLI::App* summaries = AddSummariesCommand(app, summariesOptions);
  ReportOptions reportOptions;
  CLI::App* report = AddReportCommand(app, reportOptions);

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    // CLI11 reports a misspelt command as a missing one.
    const std::vector<std::string> left = app.remaining();
    if (app.get_subcommands().empty() && !left.empty()) {
      return Fail(kExitUsage, fmt::format("unknown command '{}'; see tavrinctl --help", left[0]));
    }
    const int status = app.exit(error);
    return status == 0 ? kExitOk : kExitUsage;
  }

  Context context;
  context.paths = ResolvePaths(global);
  context.json = global.json;
  const auto timeout = ParseSeconds(global.timeout);
  if (!timeout || *timeout <= 0 || *timeout > 24 * 3600) {
    return Fail(kExitUsage, fmt::format("--timeout '{}' is not a time such as 500ms, 5s or 1m",
                                        global.timeout));
  }
  context.timeout = std::chrono::milliseconds(std::max<int64_t>(1, int64_t(*timeout * 1000)));

  if (record->parsed()) return RunRecord(recordOptions, context, stdin);
  if (shell->parsed()) return RunShell(context, stdin);
  if (defaults->parsed()) return RunDefaults(*defaults, defaultsOptions, context);
  if (events->parsed()) return RunEvents(eventsOptions, context);
  if (summaries->parsed()) return RunSummaries(*summaries, summariesOptions, context);
  if (report->parsed()) return RunReport(reportOptions, context);
  if (operations.Selected()) {
    if (const int status = operations.Prepare(); status != kExitOk) return status;
    auto opened = Connection::Open(context);
    if (auto* status = std::get_if<int>(&opened)) return *status;
    return operations.Run(*std::get<std::unique_ptr<Connection>>(opened), context);
  }
  return Fail(kExitUsage, "no command given; see tavrinctl --help");
}
