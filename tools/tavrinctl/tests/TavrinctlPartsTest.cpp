// The pieces of tavrinctl that can go wrong without a service: the parsers of the command line,
// the defaults file edits, the shell's word splitting and the store reader (on a real SQLite
// file).

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <utime.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "Common.h"
#include "Defaults.h"
#include "Shell.h"
#include "Store.h"
#include "Summaries.h"
#include "platform/linux/settings/TomlDefaultsDomain.h"

namespace tavrin::ctl {
namespace {

class TempDirectory {
 public:
  TempDirectory() {
    std::string pattern =
        (std::filesystem::temp_directory_path() / "tavrinctl-test-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path_ = pattern;
  }
  ~TempDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary);
  out << text;
}

// ---------------------------------------------------------------------------------------------

TEST(TavrinctlParsersTest, TimeBoundsAreAbsoluteWithoutAUnitAndRelativeToNowWithOne) {
  const double now = 1'700'000'000.0;
  std::string error;
  EXPECT_EQ(ParseTimeBound("1600000000", now, &error), 1'600'000'000.0);
  EXPECT_EQ(ParseTimeBound("1600000000.25", now, &error), 1'600'000'000.25);
  EXPECT_EQ(ParseTimeBound("10m", now, &error), now - 600);
  EXPECT_EQ(ParseTimeBound("2h", now, &error), now - 7200);
  EXPECT_EQ(ParseTimeBound("1.5d", now, &error), now - 1.5 * 86400);
  EXPECT_EQ(ParseTimeBound("30s", now, &error), now - 30);
  EXPECT_EQ(ParseTimeBound("250ms", now, &error), now - 0.25);

  for (const char* bad : {"", "m", "10x", "10 m", "-5m", "ten", "1e9", "5mm", "inf"}) {
    error.clear();
    EXPECT_FALSE(ParseTimeBound(bad, now, &error).has_value()) << bad;
    EXPECT_FALSE(error.empty()) << bad;
  }
  error.clear();
  (void)ParseTimeBound("10y", now, &error);
  EXPECT_NE(error.find("unknown unit 'y'"), std::string::npos) << error;
}

TEST(TavrinctlParsersTest, IntegersCoverTheirWholeRangeAndNothingMore) {
  EXPECT_EQ(ParseSigned("9223372036854775807"), INT64_MAX);
  EXPECT_EQ(ParseSigned("-9223372036854775808"), INT64_MIN);
  EXPECT_FALSE(ParseSigned("9223372036854775808").has_value());
  EXPECT_FALSE(ParseSigned("-9223372036854775809").has_value());
  EXPECT_EQ(ParseSigned("0x1f"), 31);
  EXPECT_EQ(ParseSigned("-0x10"), -16);
  EXPECT_EQ(ParseSigned("+7"), 7);
  for (const char* bad : {"", "-", "0x", "--1", "+-1", "1 ", " 1", "12a", "0x-1", "1.0"}) {
    EXPECT_FALSE(ParseSigned(bad).has_value()) << bad;
  }
  EXPECT_EQ(ParseUnsigned("0xFFFFFFFF", UINT32_MAX), UINT32_MAX);
  EXPECT_FALSE(ParseUnsigned("0x100000000", UINT32_MAX).has_value());
  EXPECT_EQ(ParseUnsigned("65535", UINT16_MAX), 65535u);
  EXPECT_FALSE(ParseUnsigned("65536", UINT16_MAX).has_value());
  EXPECT_FALSE(ParseUnsigned("-1", UINT16_MAX).has_value());
}

TEST(TavrinctlParsersTest, ReadBoundedLineSplitsStripsAndSkipsOverlongLines) {
  TempDirectory directory;
  const std::string path = directory.path() + "/input";
  WriteFile(path, "one\r\n\n" + std::string(40, 'x') + "\nlast");
  std::FILE* in = std::fopen(path.c_str(), "rb");
  ASSERT_NE(in, nullptr);
  std::string line;
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kLine);
  EXPECT_EQ(line, "one");
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kLine);
  EXPECT_EQ(line, "");
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kTooLong);
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kLine);
  EXPECT_EQ(line, "last");
  EXPECT_EQ(ReadBoundedLine(in, &line, 16), LineStatus::kEnd);
  std::fclose(in);
}

TEST(TavrinctlParsersTest, PathsComeFromFlagsThenTheEnvironmentThenTheRootThenTheDefaults) {
  ::unsetenv("TAVRIN_SOCKET");
  ::unsetenv("TAVRIN_DEFAULTS");
  GlobalOptions options;
  Paths paths = ResolvePaths(options);
  EXPECT_EQ(paths.socket, "/run/tavrin/reporting.sock");
  EXPECT_EQ(paths.socketSource, "the default");
  EXPECT_EQ(paths.stateDir, "/var/lib/tavrin");
  EXPECT_EQ(paths.diagnosticDir, "/var/log/tavrin/DiagnosticLogs");
  EXPECT_EQ(paths.defaults, "/etc/tavrin/com.quorvex.tavrin.toml");

  options.root = "/srv/t/";
  paths = ResolvePaths(options);
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
  EXPECT_EQ(paths.stateDir, "/srv/t/lib");

  options.socket = "/flag.sock";
  options.defaults = "/flag.toml";
  options.stateDir = "/state";
  paths = ResolvePaths(options);
  EXPECT_EQ(paths.socket, "/flag.sock");
  EXPECT_EQ(paths.defaults, "/flag.toml");
  EXPECT_EQ(paths.stateDir, "/state");
  ::unsetenv("TAVRIN_SOCKET");
  ::unsetenv("TAVRIN_DEFAULTS");

  // A relative root is taken from the working directory, like tavrind's.
  options = GlobalOptions{};
  options.root = "rel";
  EXPECT_EQ(ResolvePaths(options).socket,
            (std::filesystem::current_path() / "rel/run/reporting.sock").string());
}

// ---------------------------------------------------------------------------------------------

TEST(TavrinctlDefaultsTest, ValuesAreTypedLikeTomlAndEverythingElseIsAString) {
  auto kind = [](const char* text) { return ParseTomlishValue(text).kind; };
  EXPECT_EQ(kind("true"), TomlishKind::kBoolean);
  EXPECT_EQ(kind("false"), TomlishKind::kBoolean);
  EXPECT_EQ(kind("42"), TomlishKind::kInteger);
  EXPECT_EQ(kind("-7"), TomlishKind::kInteger);
  EXPECT_EQ(kind("0x10"), TomlishKind::kInteger);
  EXPECT_EQ(kind("2.5"), TomlishKind::kFloat);
  EXPECT_EQ(kind("1e3"), TomlishKind::kFloat);
  EXPECT_EQ(kind("[\"a\", \"b\"]"), TomlishKind::kArray);
  // Words a person means as words, though TOML would read some of them otherwise.
  for (const char* word :
       {"True", "speaker", "nan", "inf", "007", "2024-01-01", "", "1 2", "a = b", "[unclosed"}) {
    EXPECT_EQ(kind(word), TomlishKind::kString) << word;
  }
  EXPECT_EQ(ParseTomlishValue("42").toml, "42");
  EXPECT_EQ(ParseTomlishValue("'quoted'").toml, "'quoted'");
}

TEST(TavrinctlDefaultsTest, SettingAKeyKeepsCommentsOrderAndTheOtherKeys) {
  const std::string text =
      "# tavrin settings\n"
      "device_name = \"kitchen\"  # shown in summaries\n"
      "prefixes = [\n"
      "  \"a\",\n"
      "  \"b\",\n"
      "]\n"
      "\n"
      "# last\n"
      "reporting_session_verbose = 5\n";
  TomlEdit edit = SetTomlKey(text, "device_name", "'hall'", "f.toml");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_TRUE(edit.found);
  EXPECT_EQ(edit.text,
            "# tavrin settings\n"
            "device_name = 'hall'  # shown in summaries\n"
            "prefixes = [\n"
            "  \"a\",\n"
            "  \"b\",\n"
            "]\n"
            "\n"
            "# last\n"
            "reporting_session_verbose = 5\n");

  // A value over several lines is replaced whole.
  edit = SetTomlKey(text, "prefixes", "[\"c\"]", "f.toml");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text,
            "# tavrin settings\n"
            "device_name = \"kitchen\"  # shown in summaries\n"
            "prefixes = [\"c\"]\n"
            "\n"
            "# last\n"
            "reporting_session_verbose = 5\n");

  // A new key goes after the last setting.
  edit = SetTomlKey(text, "disable_reporting", "true", "f.toml");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_FALSE(edit.found);
  EXPECT_EQ(edit.text, text + "disable_reporting = true\n");
}

TEST(TavrinctlDefaultsTest, NewKeysStayInTheTopLevelTableWhereTheServiceReadsThem) {
  // After the last top-level setting, never under a [table].
  TomlEdit edit = SetTomlKey("a = 1\n\n[extra]\nb = 2\n", "disable_reporting", "true", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text, "a = 1\ndisable_reporting = true\n\n[extra]\nb = 2\n");
  // Without one: after the leading comments, before the first table.
  edit = SetTomlKey("# header\n\n[extra]\nb = 2\n", "disable_reporting", "true", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text, "# header\n\ndisable_reporting = true\n[extra]\nb = 2\n");
  // An empty or missing file.
  edit = SetTomlKey("", "disable_reporting", "true", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text, "disable_reporting = true\n");
  // A last line without a newline.
  edit = SetTomlKey("a = 1", "b", "2", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text, "a = 1\nb = 2\n");
}

TEST(TavrinctlDefaultsTest, DeletingRemovesOnlyTheKeysLines) {
  const std::string text = "a = 1\nb = [\n  1,\n]\nc = 3\n";
  TomlEdit edit = DeleteTomlKey(text, "b", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_TRUE(edit.found);
  EXPECT_EQ(edit.text, "a = 1\nc = 3\n");
  edit = DeleteTomlKey(text, "missing", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_FALSE(edit.found);
  EXPECT_EQ(edit.text, text);
}

TEST(TavrinctlDefaultsTest, EditsThatCouldLoseSomethingAreRefused) {
  // A broken file is left for its owner to fix, not rewritten.
  TomlEdit edit = SetTomlKey("a = \n", "b", "1", "broken.toml");
  EXPECT_FALSE(edit.ok);
  EXPECT_NE(edit.error.find("broken.toml does not parse"), std::string::npos) << edit.error;
  edit = DeleteTomlKey("a = [\n", "a", "broken.toml");
  EXPECT_FALSE(edit.ok);
  // Tables are not settings.
  edit = SetTomlKey("[extra]\nb = 2\n", "extra", "1", "f");
  EXPECT_FALSE(edit.ok);
  EXPECT_NE(edit.error.find("is a table"), std::string::npos) << edit.error;
  edit = DeleteTomlKey("extra.b = 2\n", "extra", "f");
  EXPECT_FALSE(edit.ok);
  edit = DeleteTomlKey("[[extra]]\nb = 2\n", "extra", "f");
  EXPECT_FALSE(edit.ok);
  // Keys that are not plain names.
  for (const char* key : {"", "a.b", "a b", "\"a\"", "a=b", "ü"}) {
    edit = SetTomlKey("", key, "1", "f");
    EXPECT_FALSE(edit.ok) << key;
  }
  // An inline table is a value like any other.
  edit = SetTomlKey("extra = { b = 2 }\n", "extra", "1", "f");
  ASSERT_TRUE(edit.ok) << edit.error;
  EXPECT_EQ(edit.text, "extra = 1\n");
}

// ---------------------------------------------------------------------------------------------

TEST(TavrinctlShellTest, WordsSplitOnBlanksWithQuotesEscapesAndBareJson) {
  std::string error;
  auto words = SplitShellWords(
      R"(send {"a b": "x } y", "n": [1, {"c": "]"}]} --to 1,2  'single quoted' "dq \"x\" \n" a\ b)",
      &error);
  ASSERT_TRUE(words) << error;
  EXPECT_EQ(*words,
            (std::vector<std::string>{"send", R"({"a b": "x } y", "n": [1, {"c": "]"}]})", "--to",
                                      "1,2", "single quoted", R"(dq "x" \n)", "a b"}));
  words = SplitShellWords(R"(send {"quote \" and }": 1})", &error);
  ASSERT_TRUE(words) << error;
  EXPECT_EQ(words->at(1), R"({"quote \" and }": 1})");
  words = SplitShellWords("   \t ", &error);
  ASSERT_TRUE(words);
  EXPECT_TRUE(words->empty());
}

TEST(TavrinctlShellTest, UnfinishedQuotesAndBracketsAreErrorsNotGuesses) {
  std::string error;
  for (const char* line : {R"(send {"a": 1)", R"(send {"a": "1})", "send [1, 2}", "say 'hi",
                           R"(say "hi)", "send {\"a\": 1}}"}) {
    error.clear();
    EXPECT_FALSE(SplitShellWords(line, &error).has_value()) << line;
    EXPECT_FALSE(error.empty()) << line;
  }
}

// ---------------------------------------------------------------------------------------------

// A store with the service's tables, filled by the test.
class StoreFile {
 public:
  explicit StoreFile(const std::string& path) : path_(path) {
    EXPECT_EQ(sqlite3_open(path.c_str(), &db_), SQLITE_OK);
    Execute(
        "CREATE TABLE sessions(row INTEGER PRIMARY KEY, reporter_id INTEGER, session_info TEXT, "
        "user_info TEXT, created_at REAL, flushed_at REAL);"
        "CREATE TABLE session_messages(row INTEGER PRIMARY KEY, session_row INTEGER, "
        "reporter_id INTEGER, category INTEGER, type INTEGER, payload TEXT, received_at REAL);"
        "CREATE TABLE single_messages(row INTEGER PRIMARY KEY, session_info TEXT, user_info "
        "TEXT, category INTEGER, type INTEGER, payload TEXT, received_at REAL);"
        "CREATE TABLE analytics_events(row INTEGER PRIMARY KEY, name TEXT, payload TEXT, "
        "received_at REAL);"
        "CREATE TABLE power_events(row INTEGER PRIMARY KEY, agent INTEGER, name TEXT, payload "
        "TEXT, received_at REAL);");
  }
  ~StoreFile() { sqlite3_close(db_); }
  void Execute(const std::string& sql) {
    char* error = nullptr;
    EXPECT_EQ(sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &error), SQLITE_OK)
        << (error ? error : "") << "\n"
        << sql;
    sqlite3_free(error);
  }

 private:
  std::string path_;
  sqlite3* db_ = nullptr;
};

std::vector<std::string> Rows(const EventsAnswer& answer) {
  std::vector<std::string> rows;
  for (const EventRow& row : answer.rows) rows.push_back(row.table + "#" + std::to_string(row.row));
  return rows;
}

class TavrinctlStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = directory_.path() + "/tavrin.db";
    StoreFile store(path_);
    store.Execute(
        "INSERT INTO sessions VALUES(1, 7, '{\"ServiceName\":\"generic\"}', '{}', 100.0, NULL);"
        "INSERT INTO session_messages VALUES(1, 1, 7, 1, 0, '{\"level\":3}', 101.0);"
        "INSERT INTO session_messages VALUES(2, 1, 8, 1, 0, 'not json', 104.0);"
        "INSERT INTO single_messages VALUES(1, '{}', '{}', 2, 0, '{\"alone\":1}', 102.0);"
        "INSERT INTO analytics_events VALUES(1, 'com.quorvex.tavrin.x', '{\"n\":1}', 103.0);"
        "INSERT INTO power_events VALUES(1, 4, 'Mediane_Haptics', '{}', 101.0);");
  }
  TempDirectory directory_;
  std::string path_;
};

TEST_F(TavrinctlStoreTest, RowsOfAllTablesMergeByTimeAndTheLimitKeepsTheNewest) {
  EventQuery query;
  query.limit = 0;
  EventsAnswer answer = QueryEvents(path_, query);
  ASSERT_TRUE(answer.ok) << answer.error;
  // Same time (101): table order decides.
  EXPECT_EQ(Rows(answer), (std::vector<std::string>{"sessions#1", "session_messages#1",
                                                    "power_events#1", "single_messages#1",
                                                    "analytics_events#1", "session_messages#2"}));
  query.limit = 2;
  answer = QueryEvents(path_, query);
  ASSERT_TRUE(answer.ok) << answer.error;
  EXPECT_EQ(Rows(answer), (std::vector<std::string>{"analytics_events#1", "session_messages#2"}));
}

TEST_F(TavrinctlStoreTest, FiltersByReporterAndTime) {
  EventQuery query;
  query.reporterID = 7;
  EventsAnswer answer = QueryEvents(path_, query);
  ASSERT_TRUE(answer.ok) << answer.error;
  EXPECT_EQ(Rows(answer), (std::vector<std::string>{"sessions#1", "session_messages#1"}));

  query = EventQuery{};
  query.since = 102.0;
  query.until = 103.0;
  answer = QueryEvents(path_, query);
  ASSERT_TRUE(answer.ok) << answer.error;
  EXPECT_EQ(Rows(answer), (std::vector<std::string>{"single_messages#1", "analytics_events#1"}));
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

  answer = QueryEvents(directory_.path() + "/missing.db", EventQuery{});
  EXPECT_FALSE(answer.ok);
  EXPECT_FALSE(answer.usageError);
  EXPECT_NE(answer.error.find("no store at"), std::string::npos) << answer.error;
  // Reading never creates the file.
  EXPECT_FALSE(std::filesystem::exists(directory_.path() + "/missing.db"));
}

// ---------------------------------------------------------------------------------------------

TEST(TavrinctlSummariesTest, OnlyFinishedSummaryFilesAreListedOldestFirst) {
  TempDirectory directory;
  const std::string& dir = directory.path();
  WriteFile(dir + "/20240101-100000+0000-tavrin-b-generic.json", "[]");
  WriteFile(dir + "/20240101-090000+0000-tavrin-a-generic.json", "[{}]");
  WriteFile(dir + "/.20240101-110000+0000-tavrin-c-generic.json.1.2.ab.tmp", "[");
  WriteFile(dir + "/notes.txt", "x");
  std::filesystem::create_directory(dir + "/sub.json");
  // Modification times decide, not names.
  utimbuf older{1000, 1000};
  utimbuf newer{2000, 2000};
  ::utime((dir + "/20240101-100000+0000-tavrin-b-generic.json").c_str(), &older);
  ::utime((dir + "/20240101-090000+0000-tavrin-a-generic.json").c_str(), &newer);
  std::string error;
  const auto files = ListSummaries(dir, &error);
  EXPECT_TRUE(error.empty()) << error;
  ASSERT_EQ(files.size(), 2u);
  EXPECT_EQ(files[0].name, "20240101-100000+0000-tavrin-b-generic.json");
  EXPECT_EQ(files[0].size, 2u);
  EXPECT_DOUBLE_EQ(files[0].time, 1000.0);
  EXPECT_EQ(files[1].name, "20240101-090000+0000-tavrin-a-generic.json");

  EXPECT_TRUE(ListSummaries(dir + "/none", &error).empty());
  EXPECT_TRUE(error.empty());
}

}  // namespace
}  // namespace tavrin::ctl
