// tavrinctl as its users run it: the real binary, through /bin/sh, against the real tavrind.
// Every operation is exercised through the client library's own e2e suite; here only what the
// tool adds: reading stdin, the exit statuses, the store and summary readers, the defaults edits
// the service picks up, and the shell.

#include <gtest/gtest.h>

#ifdef TAVRINCTL_PATH

#include <sys/wait.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using Json = nlohmann::ordered_json;
using testing::QueryStore;
using testing::QueryStoreColumn;
using testing::TavrindProcess;
using testing::WaitUntil;

struct Outcome {
  int status = -1;
  std::string out;
  std::string err;
};

std::string Quote(const std::string& text) {
  std::string quoted = "'";
  for (char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

// Runs `command` with /bin/sh -c, stdin empty, stdout and stderr captured, in an environment
// without the variables that would point tavrinctl elsewhere; killed when it outlives the e2e
// time-out.
Outcome Sh(const std::string& command) {
  const std::string directory = testing::MakeTempDirectory("tavrinctl-run-");
  const int status = std::system(
      ("env -u TAVRIN_SOCKET -u TAVRIN_ROOT -u TAVRIN_DEFAULTS timeout -s KILL 20 /bin/sh -c " +
       Quote(command) + " </dev/null >" + directory + "/out 2>" + directory + "/err")
          .c_str());
  Outcome run{WIFEXITED(status) ? WEXITSTATUS(status) : -1, testing::ReadFile(directory + "/out"),
              testing::ReadFile(directory + "/err")};
  EXPECT_NE(run.status, 128 + SIGKILL) << "did not finish in time: " << command;
  // A sanitizer's report may come with the very exit status a test expects.
  for (const char* report : {"Sanitizer", "runtime error:"}) {
    if (run.err.find(report) != std::string::npos) ADD_FAILURE() << command << "\n" << run.err;
  }
  std::filesystem::remove_all(directory);
  return run;
}

std::vector<Json> JsonLines(const std::string& text) {
  std::vector<Json> values;
  std::istringstream lines(text);
  std::string line;
  while (std::getline(lines, line)) {
    values.push_back(Json::parse(line, nullptr, false));
    EXPECT_FALSE(values.back().is_discarded()) << "not JSON: " << line;
  }
  return values;
}

std::string Ctl(const std::string& root) {
  return Quote(TAVRINCTL_PATH) + " --root " + Quote(root);
}

std::string Describe(const Outcome& run) {
  return "status " + std::to_string(run.status) + "\nstdout:\n" + run.out + "stderr:\n" + run.err;
}

size_t RowCount(const TavrindProcess& service, const std::string& where) {
  return QueryStore(service.DatabasePath(), "SELECT 1 FROM session_messages WHERE " + where).size();
}

TEST(TavrinctlE2eTest, RecordFromAHereDocumentLeavesRowsAndASummaryThatEventsAndSummariesShow) {
  // An internal build's device, so the stopped session leaves a summary file.
  TavrindProcess service;
  testing::WriteFileAtomically(service.root() + "/etc/device.toml", "InternalBuild = true\n");
  ASSERT_TRUE(service.Start()) << service.Log();
  const std::string ctl = Ctl(service.root());

  // Blank lines are skipped, not errors.
  const Outcome record = Sh(ctl +
                            " --json record --service-type haptics --category 2 --type 1 "
                            "--configuration '{\"HostApplicationDisplayID\": \"player\"}' <<'EOF'\n"
                            "{\"level\": 3}\n\n   \n{\"level\": 5, \"route\": \"speaker\"}\nEOF\n");
  ASSERT_EQ(record.status, 0) << Describe(record);
  const Json result = Json::parse(record.out);
  EXPECT_EQ(result["sent"], 2);
  EXPECT_EQ(result["stopped"], true);
  const std::string id = std::to_string(result["reporterID"].get<int64_t>());
  ASSERT_NE(id, "0");

  // The store commits on its own thread after the answers: two messages and the summary event.
  ASSERT_TRUE(WaitUntil([&] { return RowCount(service, "reporter_id = " + id) >= 3; }))
      << service.Log();
  const Outcome events = Sh(ctl + " events --json --table session_messages --reporter " + id);
  ASSERT_EQ(events.status, 0) << Describe(events);
  const std::vector<Json> rows = JsonLines(events.out);
  ASSERT_EQ(rows.size(), 3u) << events.out;
  EXPECT_EQ(rows[0]["category"], 2);
  EXPECT_EQ(rows[0]["type"], 1);
  // Payloads are objects in the output, not JSON text inside a string.
  EXPECT_EQ(rows[0]["payload"], Json({{"level", 3}}));
  EXPECT_EQ(rows[1]["payload"], Json({{"level", 5}, {"route", "speaker"}}));
  EXPECT_EQ(rows[2]["payload"]["level"], "3,5");

  // The summary file is written on the session's queue, not in step with the store.
  std::vector<Json> files;
  ASSERT_TRUE(WaitUntil([&] {
    return (files = JsonLines(Sh(ctl + " --json summaries").out)).size() == 1;
  })) << files.size();
  const std::string name = files[0]["name"];
  EXPECT_NE(name.find("-tavrin-player-haptics.json"), std::string::npos) << name;
  const Outcome show = Sh(ctl + " summaries show latest");
  ASSERT_EQ(show.status, 0) << Describe(show);
  const Json summary = Json::parse(show.out);
  ASSERT_TRUE(summary.is_array() && summary.size() >= 3u) << show.out;
  EXPECT_EQ(summary[0]["HostApplicationDisplayID"], "player");  // the user info comes first
  EXPECT_EQ(summary[1]["Record_Start_1"], Json({{"level", 3}}));
  EXPECT_EQ(Sh(ctl + " summaries show " + Quote(name)).out, show.out);
  EXPECT_EQ(Sh(ctl + " summaries show nothing.json").status, 1);
}

TEST(TavrinctlE2eTest, ABadLineEndsTheRecordingWithItsNumberAndTheSessionStillStops) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  const std::string ctl = Ctl(service.root());

  const Outcome record =
      Sh(ctl + " record --reporter 4242 <<'EOF'\n{\"ok\": 1}\nnot json\n{\"never\": 1}\nEOF\n");
  EXPECT_EQ(record.status, 1) << Describe(record);
  EXPECT_NE(record.err.find("stdin line 2 is not JSON"), std::string::npos) << record.err;
  EXPECT_NE(record.out.find("sent 1 message "), std::string::npos) << record.out;
  // The stop sent the summary event, with the one message sent before the bad line.
  ASSERT_TRUE(WaitUntil([&] {
    return RowCount(service, "reporter_id = 4242 AND category = 65535") == 1;
  })) << service.Log();
  EXPECT_EQ(QueryStoreColumn(service.DatabasePath(),
                             "SELECT payload FROM session_messages WHERE reporter_id = 4242 "
                             "ORDER BY row"),
            (std::vector<std::string>{"{\"ok\":1}",
                                      "{\"Ruvo_Session_Summary_Event\":\"65535\",\"ok\":\"1\"}"}));

  // Valid JSON that is not an object is refused the same way.
  const Outcome array = Sh(ctl + " record <<'EOF'\n[1, 2]\nEOF\n");
  EXPECT_EQ(array.status, 1) << Describe(array);
  EXPECT_NE(array.err.find("stdin line 1 is a JSON array, not an object"), std::string::npos);
}

TEST(TavrinctlE2eTest, WithoutAServiceTheStatusAndMessageSayWhatToDo) {
  const std::string root = testing::MakeTempDirectory("tavrinctl-root-");
  const std::string ctl = Ctl(root);
  Outcome run = Sh(ctl + " reporters");
  EXPECT_EQ(run.status, 3) << Describe(run);
  EXPECT_NE(
      run.err.find("no service at " + root + "/run/reporting.sock (the socket does not exist)"),
      std::string::npos)
      << run.err;
  EXPECT_NE(run.err.find("./scripts/run.sh"), std::string::npos) << run.err;
  // record gives up before reading its input.
  run = Sh(ctl + " record <<'EOF'\n{\"a\": 1}\nEOF\n");
  EXPECT_EQ(run.status, 3) << Describe(run);

  // Usage errors are found before connecting, whatever the service's state.
  for (const char* usage : {" send '{\"a\":'", " send '{}' --to x", " get-type twelve",
                            " --timeout 0 reporters", " nosuchcommand", " events --since 5y"}) {
    run = Sh(ctl + usage);
    EXPECT_EQ(run.status, 2) << usage << "\n" << Describe(run);
  }
  std::filesystem::remove_all(root);
}

TEST(TavrinctlE2eTest, DisablingReportingInTheDefaultsMakesSendsFailUntilItIsDeleted) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  const std::string ctl = Ctl(service.root());
  const std::string send = ctl + " send '{\"a\": 1}'";
  ASSERT_EQ(Sh(send).status, 0);

  const Outcome written = Sh(ctl + " defaults write disable_reporting true");
  ASSERT_EQ(written.status, 0) << Describe(written);
  EXPECT_EQ(Sh(ctl + " defaults read disable_reporting").out, "true\n");
  // The service re-reads the file when its watch sees the rename.
  Outcome refused;
  ASSERT_TRUE(WaitUntil([&] { return (refused = Sh(send)).status != 0; })) << service.Log();
  EXPECT_EQ(refused.status, 1) << Describe(refused);
  EXPECT_NE(refused.err.find("reporting is disabled (com.quorvex.audio.reporting error 1)"),
            std::string::npos)
      << refused.err;
  // A recording's first message is refused; its session is still stopped.
  const Outcome record = Sh(ctl + " --json record <<'EOF'\n{\"a\": 1}\nEOF\n");
  EXPECT_EQ(record.status, 1) << Describe(record);
  EXPECT_EQ(Json::parse(record.out, nullptr, false)["stopped"], true) << record.out;
  // Every refusal is in the ledger that status shows, by its reason.
  const Outcome status = Sh(ctl + " --json status");
  ASSERT_EQ(status.status, 0) << Describe(status);
  const Json totals = Json::parse(status.out)["status"]["totals"];
  EXPECT_GE(totals["dropped"]["reporting_disabled"].get<int>(), 2) << status.out;
  EXPECT_EQ(totals["in_flight"], 0) << status.out;
  EXPECT_NE(Sh(ctl + " status").out.find("reporting_disabled"), std::string::npos);

  const Outcome removed = Sh(ctl + " --json defaults delete disable_reporting");
  ASSERT_EQ(removed.status, 0) << Describe(removed);
  EXPECT_EQ(Json::parse(removed.out)["deleted"], true);
  EXPECT_TRUE(WaitUntil([&] { return Sh(send).status == 0; })) << service.Log();
}

TEST(TavrinctlE2eTest, TheShellRunsPipedCommandsOnOneConnection) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  const Outcome shell = Sh(Ctl(service.root()) +
                           " shell <<'EOF'\n"
                           "create 42\n"
                           "set-type 42 telephony\n"
                           "start 42\n"
                           "send --to 42 {\"x\": 1}\n"
                           "stop 42\n"
                           "bogus\n"
                           "# 43 is left running at the end\n"
                           "create 43\n"
                           "start 43\n"
                           "EOF\n");
  // The status of the last line that failed.
  EXPECT_EQ(shell.status, 2) << Describe(shell);
  EXPECT_EQ(shell.err, "tavrinctl: line 6: unknown command 'bogus'; type help\n");
  EXPECT_EQ(shell.out,
            "created session 42\n"
            "set-type 42: true\n"
            "started 42; the service answers this start when the session stops\n"
            "sent to 42: accepted\n"
            "stop 42: true\n"
            "the start of 42 was answered true (its session stopped)\n"
            "created session 43\n"
            "started 43; the service answers this start when the session stops\n"
            "stopped 43, still running at the end\n");
  EXPECT_TRUE(WaitUntil([&] {
    return RowCount(service, "reporter_id = 42 AND payload = '{\"x\":1}'") == 1 &&
           service.LogCount("stopping 43") == 1;
  })) << service.Log();

  // With --json everything it prints is a JSON line, late answers included.
  const Outcome json =
      Sh(Ctl(service.root()) + " --json shell <<'EOF'\ncreate 44\nstart 44\nstop 44\nEOF\n");
  EXPECT_EQ(json.status, 0) << Describe(json);
  const std::vector<Json> lines = JsonLines(json.out);
  ASSERT_EQ(lines.size(), 4u) << json.out;
  EXPECT_EQ(lines[1]["held"], true) << json.out;
  EXPECT_EQ(lines[3]["answeredAtStop"], true) << json.out;
}

}  // namespace
}  // namespace tavrin

#else

TEST(TavrinctlE2eTest, NeedsTheTavrinctlBinary) {
  GTEST_SKIP() << "tavrinctl is not part of this build";
}

#endif
