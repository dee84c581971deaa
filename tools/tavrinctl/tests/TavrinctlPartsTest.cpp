// The pieces of tavrinctl that can go wrong without a service: the parsers of the command line,
// the defaults file edits, the shell's word splitting and the store reader (on a real SQLite
// file).

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <utime.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include <fmt/format.h>

#include "Common.h"
#include "Defaults.h"
#include "Operations.h"
#include "Report.h"
#include "Shell.h"
#include "Store.h"
#include "Summaries.h"
#include "tests/support/TempCountersTree.h"

namespace tavrin::ctl {
namespace {

using tavrin::testing::TempCountersTree;

// Runs `sql` on the store at `path`, creating it, as the service's writer would leave it.
void ExecSql(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql;
  sqlite3_close(db);
}

constexpr const char* kMessagesTable =
    "CREATE TABLE session_messages(row INTEGER PRIMARY KEY, session_row INTEGER, reporter_id "
    "INTEGER, category INTEGER, type INTEGER, payload TEXT, received_at REAL);";

TEST(TavrinctlParsersTest, TimeBoundsAreAbsoluteWithoutAUnitAndRelativeToNowWithOne) {
  const double now = 1'700'000'000.0;
  std::string error;
  const std::pair<const char*, double> good[] = {
      {"1600000000", 1'600'000'000.0},
      {"1600000000.25", 1'600'000'000.25},
      {"10m", now - 600},
      {"2h", now - 7200},
      {"1.5d", now - 1.5 * 86400},
      {"30s", now - 30},
      {"250ms", now - 0.25},
  };
  for (const auto& [text, seconds] : good) EXPECT_EQ(ParseTimeBound(text, now, &error), seconds);
  for (const char* bad : {"", "m", "10x", "10 m", "-5m", "ten", "1e9", "5mm", "inf"}) {
    error.clear();
    EXPECT_FALSE(ParseTimeBound(bad, now, &error).has_value()) << bad;
    EXPECT_FALSE(error.empty()) << bad;
  }
  (void)ParseTimeBound("10y", now, &error);
  EXPECT_NE(error.find("unknown unit 'y'"), std::string::npos) << error;
}

TEST(TavrinctlParsersTest, IntegersCoverTheirWholeRangeAndNothingMore) {
  EXPECT_EQ(ParseSigned("9223372036854775807"), INT64_MAX);
  EXPECT_EQ(ParseSigned("-9223372036854775808"), INT64_MIN);
  EXPECT_EQ(ParseSigned("-0x10"), -16);
  EXPECT_EQ(ParseSigned("+7"), 7);
  for (const char* bad : {"", "-", "0x", "--1", "+-1", "1 ", " 1", "12a", "0x-1", "1.0",
                          "9223372036854775808", "-9223372036854775809"}) {
    EXPECT_FALSE(ParseSigned(bad).has_value()) << bad;
  }
  EXPECT_EQ(ParseUnsigned("0xFFFFFFFF", UINT32_MAX), UINT32_MAX);
  EXPECT_FALSE(ParseUnsigned("0x100000000", UINT32_MAX).has_value());
  EXPECT_EQ(ParseUnsigned("65535", UINT16_MAX), 65535u);
  EXPECT_FALSE(ParseUnsigned("65536", UINT16_MAX).has_value());
  EXPECT_FALSE(ParseUnsigned("-1", UINT16_MAX).has_value());
}

TEST(TavrinctlParsersTest, ReadBoundedLineSplitsStripsAndSkipsOverlongLines) {
  std::string input = "one\r\n\n" + std::string(40, 'x') + "\nlast";
  std::FILE* in = ::fmemopen(input.data(), input.size(), "r");
  ASSERT_NE(in, nullptr);
  std::string line;
  const char* const expected[] = {"one", "", nullptr, "last"};  // nullptr: too long, left empty
  for (const char* text : expected) {
    EXPECT_EQ(ReadBoundedLine(in, &line, 16), text ? LineStatus::kLine : LineStatus::kTooLong);
    EXPECT_EQ(line, text ? text : "");
  }
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kEnd);
  std::fclose(in);
}

TEST(TavrinctlParsersTest, PathsComeFromFlagsThenTheEnvironmentThenTheRootThenTheDefaults) {
  ::unsetenv("TAVRIN_SOCKET");
  ::unsetenv("TAVRIN_DEFAULTS");
  GlobalOptions options;
  EXPECT_EQ(ResolvePaths(options).socketSource, "the default");
  options.root = "/srv/t/";
  Paths paths = ResolvePaths(options);
  EXPECT_EQ(paths.socket, "/srv/t/run/reporting.sock");
  EXPECT_EQ(paths.stateDir, "/srv/t/lib");
  EXPECT_EQ(paths.diagnosticDir, "/srv/t/log/DiagnosticLogs");
  EXPECT_EQ(paths.defaults, "/srv/t/etc/com.quorvex.tavrin.toml");

  // The environment beats the root, as it does for tavrind.
  ::setenv("TAVRIN_SOCKET", "/env.sock", 1);
  ::setenv("TAVRIN_DEFAULTS", "/env.toml", 1);
  paths = ResolvePaths(options);
  EXPECT_EQ(paths.socket, "/env.sock");
  EXPECT_EQ(paths.socketSource, "TAVRIN_SOCKET");
  EXPECT_EQ(paths.defaults, "/env.toml");
  // ... and the flags beat the environment.
  options.socket = "/flag.sock";
  options.defaults = "/flag.toml";
  paths = ResolvePaths(options);
  EXPECT_EQ(paths.socket, "/flag.sock");
  EXPECT_EQ(paths.defaults, "/flag.toml");
  ::unsetenv("TAVRIN_SOCKET");
  ::unsetenv("TAVRIN_DEFAULTS");

  // A relative root is taken from the working directory, like tavrind's.
  options = GlobalOptions{};
  options.root = "rel";
  EXPECT_EQ(ResolvePaths(options).socket,
            (std::filesystem::current_path() / "rel/run/reporting.sock").string());
}

TEST(TavrinctlDefaultsTest, ValuesAreTypedLikeTomlAndEverythingElseIsAString) {
  const std::pair<const char*, TomlishKind> typed[] = {
      {"true", TomlishKind::kBoolean},         {"false", TomlishKind::kBoolean},
      {"-7", TomlishKind::kInteger},           {"2.5", TomlishKind::kFloat},
      {"[\"a\", \"b\"]", TomlishKind::kArray},
  };
  for (const auto& [text, kind] : typed) EXPECT_EQ(ParseTomlishValue(text).kind, kind) << text;
  // Words a person means as words, though TOML would read some of them otherwise.
  for (const char* word :
       {"True", "speaker", "nan", "inf", "007", "2024-01-01", "", "1 2", "a = b", "[unclosed"}) {
    EXPECT_EQ(ParseTomlishValue(word).kind, TomlishKind::kString) << word;
  }
  EXPECT_EQ(ParseTomlishValue("'quoted'").toml, "'quoted'");
}

TEST(TavrinctlDefaultsTest, EditsKeepCommentsOrderTheOtherKeysAndTheTopLevelTable) {
  const std::string text =
      "# settings\nname = \"k\"  # shown\nlist = [\n  1,\n]\n\n# last\nv = 5\n";
  const struct {
    std::string before, key, value, after;
    bool found;
  } sets[] = {
      {text, "name", "'h'", "# settings\nname = 'h'  # shown\nlist = [\n  1,\n]\n\n# last\nv = 5\n",
       true},
      // A value over several lines is replaced whole.
      {text, "list", "[2]", "# settings\nname = \"k\"  # shown\nlist = [2]\n\n# last\nv = 5\n",
       true},
      // New keys go after the last top-level setting, never under a [table]...
      {text, "c", "true", text + "c = true\n", false},
      {"a = 1\n\n[extra]\nb = 2\n", "c", "true", "a = 1\nc = true\n\n[extra]\nb = 2\n", false},
      // ... and without one after the leading comments, before the first table.
      {"# header\n\n[extra]\nb = 2\n", "c", "true", "# header\n\nc = true\n[extra]\nb = 2\n",
       false},
      {"", "c", "true", "c = true\n", false},
      {"a = 1", "b", "2", "a = 1\nb = 2\n", false},
      // An inline table is a value like any other.
      {"extra = { b = 2 }\n", "extra", "1", "extra = 1\n", true},
  };
  for (const auto& edit : sets) {
    const TomlEdit result = SetTomlKey(edit.before, edit.key, edit.value, "f.toml");
    ASSERT_TRUE(result.ok) << edit.key << ": " << result.error;
    EXPECT_EQ(result.text, edit.after) << edit.key;
    EXPECT_EQ(result.found, edit.found) << edit.key;
  }

  const std::string listed = "a = 1\nb = [\n  1,\n]\nc = 3\n";
  TomlEdit edit = DeleteTomlKey(listed, "b", "f");
  EXPECT_TRUE(edit.ok && edit.found) << edit.error;
  EXPECT_EQ(edit.text, "a = 1\nc = 3\n");
  edit = DeleteTomlKey(listed, "missing", "f");
  EXPECT_TRUE(edit.ok && !edit.found) << edit.error;
  EXPECT_EQ(edit.text, listed);
}

TEST(TavrinctlDefaultsTest, EditsThatCouldLoseSomethingAreRefused) {
  // A broken file is left for its owner to fix, not rewritten.
  TomlEdit edit = SetTomlKey("a = \n", "b", "1", "broken.toml");
  EXPECT_FALSE(edit.ok);
  EXPECT_NE(edit.error.find("broken.toml does not parse"), std::string::npos) << edit.error;
  EXPECT_FALSE(DeleteTomlKey("a = [\n", "a", "broken.toml").ok);
  // Tables are not settings.
  edit = SetTomlKey("[extra]\nb = 2\n", "extra", "1", "f");
  EXPECT_FALSE(edit.ok);
  EXPECT_NE(edit.error.find("is a table"), std::string::npos) << edit.error;
  EXPECT_FALSE(DeleteTomlKey("extra.b = 2\n", "extra", "f").ok);
  EXPECT_FALSE(DeleteTomlKey("[[extra]]\nb = 2\n", "extra", "f").ok);
  // Keys that are not plain names.
  for (const char* key : {"", "a.b", "a b", "\"a\"", "a=b", "ü"}) {
    EXPECT_FALSE(SetTomlKey("", key, "1", "f").ok) << key;
  }
}

TEST(TavrinctlShellTest, WordsSplitOnBlanksWithQuotesEscapesAndBareJson) {
  std::string error;
  auto words = SplitShellWords(
      R"(send {"a b": "x } y", "n": [1, {"c": "]"}]} --to 1,2  'single quoted' "dq \"x\" \n" a\ b)",
      &error);
  ASSERT_TRUE(words) << error;
  EXPECT_EQ(*words,
            (std::vector<std::string>{"send", R"({"a b": "x } y", "n": [1, {"c": "]"}]})", "--to",
                                      "1,2", "single quoted", R"(dq "x" \n)", "a b"}));
  EXPECT_EQ(SplitShellWords(R"(send {"quote \" and }": 1})", &error),
            (std::vector<std::string>{"send", R"({"quote \" and }": 1})"}));
  EXPECT_EQ(SplitShellWords("   \t ", &error), std::vector<std::string>{});

  // Unfinished quotes and brackets are errors, not guesses.
  for (const char* line : {R"(send {"a": 1)", R"(send {"a": "1})", "send [1, 2}", "say 'hi",
                           R"(say "hi)", "send {\"a\": 1}}"}) {
    error.clear();
    EXPECT_FALSE(SplitShellWords(line, &error).has_value()) << line;
    EXPECT_FALSE(error.empty()) << line;
  }
}

// A store with the service's tables and a few rows, one of them with a payload that is not JSON.
class TavrinctlStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = directory_.path("tavrin.db");
    ExecSql(
        path_,
        "CREATE TABLE sessions(row INTEGER PRIMARY KEY, reporter_id INTEGER, session_info "
        "TEXT, user_info TEXT, created_at REAL, flushed_at REAL);" +
            std::string(kMessagesTable) +
            "CREATE TABLE single_messages(row INTEGER PRIMARY KEY, session_info TEXT, user_info "
            "TEXT, category INTEGER, type INTEGER, payload TEXT, received_at REAL);"
            "CREATE TABLE analytics_events(row INTEGER PRIMARY KEY, name TEXT, payload TEXT, "
            "received_at REAL);"
            "CREATE TABLE power_events(row INTEGER PRIMARY KEY, agent INTEGER, name TEXT, "
            "payload TEXT, received_at REAL);"
            "INSERT INTO sessions VALUES(1, 7, '{\"ServiceName\":\"generic\"}', '{}', 100, NULL);"
            "INSERT INTO session_messages VALUES(1, 1, 7, 1, 0, '{\"level\":3}', 101.0);"
            "INSERT INTO session_messages VALUES(2, 1, 8, 1, 0, 'not json', 104.0);"
            "INSERT INTO single_messages VALUES(1, '{}', '{}', 2, 0, '{\"alone\":1}', 102.0);"
            "INSERT INTO analytics_events VALUES(1, 'com.quorvex.tavrin.x', '{\"n\":1}', 103);"
            "INSERT INTO power_events VALUES(1, 4, 'Mediane_Haptics', '{}', 101.0);");
  }

  // The rows a query set up by `setup` answers, as table#row.
  template <typename Setup>
  std::vector<std::string> Rows(Setup setup) {
    EventQuery query;
    setup(query);
    const EventsAnswer answer = QueryEvents(path_, query);
    EXPECT_TRUE(answer.ok) << answer.error;
    std::vector<std::string> rows;
    for (const EventRow& row : answer.rows)
      rows.push_back(row.table + "#" + std::to_string(row.row));
    return rows;
  }

  TempCountersTree directory_;
  std::string path_;
};

TEST_F(TavrinctlStoreTest, RowsOfAllTablesMergeByTimeAndFiltersAndTheLimitPickThem) {
  // Same time (101): table order decides.
  EXPECT_EQ(
      Rows([](EventQuery& query) { query.limit = 0; }),
      (std::vector<std::string>{"sessions#1", "session_messages#1", "power_events#1",
                                "single_messages#1", "analytics_events#1", "session_messages#2"}));
  // The limit keeps the newest.
  EXPECT_EQ(Rows([](EventQuery& query) { query.limit = 2; }),
            (std::vector<std::string>{"analytics_events#1", "session_messages#2"}));
  EXPECT_EQ(Rows([](EventQuery& query) { query.reporterID = 7; }),
            (std::vector<std::string>{"sessions#1", "session_messages#1"}));
  EXPECT_EQ(Rows([](EventQuery& query) {
              query.since = 102.0;
              query.until = 103.0;
            }),
            (std::vector<std::string>{"single_messages#1", "analytics_events#1"}));
}

TEST_F(TavrinctlStoreTest, QueriesThatCannotBeAnsweredSayWhy) {
  EventQuery query;
  query.tables = {"messages"};
  EventsAnswer answer = QueryEvents(path_, query);
  EXPECT_FALSE(answer.ok);
  EXPECT_TRUE(answer.usageError);
  query.tables = {"analytics_events"};
  query.reporterID = 7;
  answer = QueryEvents(path_, query);
  EXPECT_FALSE(answer.ok);
  EXPECT_TRUE(answer.usageError);
  EXPECT_NE(answer.error.find("analytics_events has no reporter ID"), std::string::npos);

  answer = QueryEvents(directory_.path("missing.db"), EventQuery{});
  EXPECT_FALSE(answer.ok);
  EXPECT_FALSE(answer.usageError);
  EXPECT_NE(answer.error.find("no store at"), std::string::npos) << answer.error;
  // Reading never creates the file.
  EXPECT_FALSE(std::filesystem::exists(directory_.path("missing.db")));
}

TEST_F(TavrinctlStoreTest, AReportOfAStoreWithoutTheRecoveredColumnCallsNothingRecovered) {
  const SessionAnswer answer = LoadReportSession(path_, SessionPick{1, {}, {}});
  ASSERT_EQ(answer.status, kExitOk) << answer.error;
  EXPECT_FALSE(answer.session.recovered);
  EXPECT_EQ(answer.session.serviceName, "generic");  // from session_info when user_info lacks it
}

// Reporter 7: a stopped, recovered session with lanes past and under the cap, its counter deltas
// and summary; then a session still open.
class TavrinctlReportTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string sql =
        "BEGIN; CREATE TABLE sessions(row INTEGER PRIMARY KEY, reporter_id INTEGER, session_info "
        "TEXT, user_info TEXT, created_at REAL, flushed_at REAL, recovered INTEGER);" +
        std::string(kMessagesTable) +
        "INSERT INTO sessions VALUES(1, 7, '{}', '{\"ServiceName\":\"a_session\"}', 1000, 1100, 1);"
        "INSERT INTO sessions VALUES(2, 7, '{}', '{}', 2000, NULL, 0);";
    auto message = [&](int session, int category, int type, std::string_view payload, double at) {
      sql += fmt::format(
          "INSERT INTO session_messages(session_row, reporter_id, category, type, payload, "
          "received_at) VALUES({}, 7, {}, {}, '{}', {});",
          session, category, type, payload, at);
    };
    for (int i = 0; i < 2500; ++i)
      message(1, 1, 0, fmt::format(R"({{"level":{}}})", i % 7), 1000 + i * 0.01);
    for (int i = 0; i < 900; ++i) message(1, 7, 2, R"({"<script>":1})", 1050 + i * 0.01);
    message(1, 9, 0, R"({"Speaker_xruns":4,"MCA_underruns":12})", 1099);
    message(1, 65535, 65535,
            R"({"Ruvo_Session_Summary_Event":"2","device_orientation":"portrait,face-up",)"
            R"("device_orientation_time":"2,50"})",
            1099.5);
    message(2, 1, 0, R"({"level":1})", 2001);
    ExecSql(directory_.path("tavrin.db"), sql + "COMMIT;");
  }

  ReportSession Session(int64_t row) {
    SessionAnswer answer =
        LoadReportSession(directory_.path("tavrin.db"), SessionPick{row, {}, {}});
    EXPECT_EQ(answer.status, kExitOk) << answer.error;
    return answer.session;
  }

  TempCountersTree directory_;
};

TEST_F(TavrinctlReportTest, SessionsArePickedByRowByTheLatestOfAReporterOrByTheTimeTheyCover) {
  const std::pair<SessionPick, int64_t> picks[] = {
      // 0: no such session
      {{1, {}, {}}, 1},    {{{}, 7, {}}, 2},
      {{{}, 7, 1050}, 1},  {{{}, 7, 9e9}, 2},  // not flushed: still open
      {{{}, {}, 1100}, 1}, {{{}, 7, 1500}, 0},
      {{3, {}, {}}, 0},    {{{}, 8, {}}, 0},
  };
  for (const auto& [pick, row] : picks) {
    const SessionAnswer answer = LoadReportSession(directory_.path("tavrin.db"), pick);
    EXPECT_EQ(answer.status, row ? kExitOk : kExitFailed) << row << answer.error;
    if (row) {
      EXPECT_EQ(answer.session.row, row);
    }
  }
  const ReportSession first = Session(1);
  EXPECT_TRUE(first.recovered);
  EXPECT_EQ(first.serviceName, "a_session");
  EXPECT_EQ(first.messages.size(), 3402u);
  EXPECT_EQ(Session(2).messages.size(), 1u);
}

TEST_F(TavrinctlReportTest, TheTimelineMarksEveryMessageUpToTheCapAndSaysWhatItLeftOut) {
  const std::string svg = RenderTimelineSvg(Session(1));
  std::vector<size_t> marks;  // per lane, in (category, type) order
  for (size_t at = 0; (at = svg.find(R"(class="marks" stroke="#1f5fa8" d=")", at)) != svg.npos;) {
    const size_t end = svg.find('"', at + 34);
    marks.push_back(size_t(std::count(svg.begin() + at, svg.begin() + end, 'M')));
    at = end;
  }
  EXPECT_EQ(marks, (std::vector<size_t>{2000, 900, 1, 1}));
  EXPECT_NE(svg.find("1/0 Generic · Generic: 2000 of 2500 marks shown"), svg.npos);
  EXPECT_EQ(svg.find("of 900"), svg.npos);
  for (const char* band : {"<title>portrait</title>", "<title>face-up</title>"}) {
    EXPECT_NE(svg.find(band), svg.npos) << band;
  }
}

TEST_F(TavrinctlReportTest, ThePageEscapesClientTextAndShowsPlotsDeltasAndTheSummary) {
  const std::string html = RenderReportHtml(Session(1));
  EXPECT_EQ(html.find("<script"), html.npos);
  EXPECT_NE(html.find("&lt;script&gt;"), html.npos);
  EXPECT_NE(html.find("2000 of 2500 points shown"), html.npos);
  // Largest delta first.
  EXPECT_LT(html.find("MCA_underruns"), html.find("Speaker_xruns"));
  EXPECT_NE(html.find("<tr><td>Ruvo_Session_Summary_Event</td><td>2</td></tr>"), html.npos);
  EXPECT_NE(html.find("<th>recovered</th><td>yes"), html.npos);
}

TEST_F(TavrinctlReportTest, TheCommandWritesTheFileOrExitsLikeTheOtherCommands) {
  Context context;
  context.paths.stateDir = directory_.root();
  const std::string output = directory_.path("out.svg");
  const std::pair<ReportOptions, int> runs[] = {
      {{"1", "", "", output, true}, kExitOk},     {{"9", "", "", output, false}, kExitFailed},
      {{"", "seven", "", "", false}, kExitUsage}, {{"", "", "later", "", false}, kExitUsage},
      {{"", "", "", output, false}, kExitUsage},
  };
  for (const auto& [options, status] : runs) EXPECT_EQ(RunReport(options, context), status);
  std::ifstream file(output);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(file), {}).rfind("<svg ", 0), 0u);
  context.paths.stateDir = directory_.path("missing");
  EXPECT_EQ(RunReport({"1", "", "", output, false}, context), kExitFailed);
}

TEST(TavrinctlSummariesTest, OnlyFinishedSummaryFilesAreListedOldestFirst) {
  TempCountersTree directory;
  const std::string older = "20240101-100000+0000-tavrin-b-generic.json";
  const std::string newer = "20240101-090000+0000-tavrin-a-generic.json";
  directory.write(older, "[]");
  directory.write(newer, "[{}]");
  directory.write(".20240101-110000+0000-tavrin-c-generic.json.1.2.ab.tmp", "[");
  directory.write("notes.txt", "x");
  std::filesystem::create_directory(directory.path("sub.json"));
  // Modification times decide, not names.
  const utimbuf olderTime{1000, 1000};
  const utimbuf newerTime{2000, 2000};
  ::utime(directory.path(older).c_str(), &olderTime);
  ::utime(directory.path(newer).c_str(), &newerTime);
  std::string error;
  const auto files = ListSummaries(directory.root(), &error);
  EXPECT_TRUE(error.empty()) << error;
  ASSERT_EQ(files.size(), 2u);
  EXPECT_EQ(files[0].name, older);
  EXPECT_EQ(files[0].size, 2u);
  EXPECT_DOUBLE_EQ(files[0].time, 1000.0);
  EXPECT_EQ(files[1].name, newer);

  EXPECT_TRUE(ListSummaries(directory.path("none"), &error).empty());
  EXPECT_TRUE(error.empty());
}

// Dropped messages show their total and each reason; a client without a name and keys of the
// wrong type do not break the table.
TEST(TavrinctlStatusTest, TheTableShowsTotalsClientsAndEveryDropReason) {
  const auto status = client::Dictionary::parse(R"({
    "uptime_s": 61.4, "rss_bytes": 15728640, "sessions": 2, "store_backlog": 7,
    "totals": {"received": 84, "delivered": 71, "in_flight": 0,
               "dropped": {"no_session": 2, "test_session": 10, "reporting_disabled": 1}},
    "clients": [{"pid": 42, "uid": 1000, "name": "", "sessions": "two",
                 "received": 64, "delivered": 51, "in_flight": 0, "dropped": {}}]})");
  const std::string table = StatusTable(status);
  for (const char* line : {"up 61 s, 15.0 MiB resident, 2 sessions, 7 records waiting",
                           "71          0         13 (no_session 2, test_session 10, "
                           "reporting_disabled 1)",
                           "pid 42 uid 1000 ?", "51          0          0\n"}) {
    EXPECT_NE(table.find(line), std::string::npos) << line << "\n" << table;
  }
}

}  // namespace
}  // namespace tavrin::ctl
