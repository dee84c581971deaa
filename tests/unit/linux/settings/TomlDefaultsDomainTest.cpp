#include "platform/linux/settings/TomlDefaultsDomain.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

// What a domain that never parsed reads as: reporting off.
const Dictionary kClosed = Dictionary::parse(R"({"disable_reporting": true})");

namespace fs = std::filesystem;

class TomlDefaultsDomainTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-toml-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    path_ = (dir_ / "com.quorvex.tavrin.toml").string();
  }
  void TearDown() override { fs::remove_all(dir_); }

  void WriteFile(const std::string& text) {
    std::ofstream out(path_, std::ios::trunc);
    out << text;
  }

  testing::FakeLogSystem log_;
  fs::path dir_;
  std::string path_;
};

TEST_F(TomlDefaultsDomainTest, ReadsKeysOfEveryTypeInFileOrder) {
  WriteFile(R"(
device_name = "kitchen speaker"
reporting_server_verbose = 5
disable_reporting = true
gain = 0.25
mixed = [1, "two", 3.5, false]
nested = [[1, 2], []]
inline = { b = 2, a = 1 }
born = 1979-05-27T07:32:00Z
day = 2024-02-29
alarm = 07:30:00

[table]
zeta = "z"
alpha = { deep = [ { x = 1 } ] }

[[servers]]
name = "one"

[[servers]]
name = "two"
)");
  TomlDefaultsDomain domain(path_);
  const Dictionary values = domain.Read();
  const Dictionary expected = Dictionary::parse(R"({
    "device_name": "kitchen speaker",
    "reporting_server_verbose": 5,
    "disable_reporting": true,
    "gain": 0.25,
    "mixed": [1, "two", 3.5, false],
    "nested": [[1, 2], []],
    "inline": {"b": 2, "a": 1},
    "born": "1979-05-27T07:32:00Z",
    "day": "2024-02-29",
    "alarm": "07:30:00",
    "table": {"zeta": "z", "alpha": {"deep": [{"x": 1}]}},
    "servers": [{"name": "one"}, {"name": "two"}]
  })");
  EXPECT_EQ(values, expected) << values.dump();
  // ordered_json compares order too; make the intent explicit.
  EXPECT_EQ(values.dump(), expected.dump());
  EXPECT_TRUE(values["reporting_server_verbose"].is_number_integer());
  EXPECT_TRUE(values["disable_reporting"].is_boolean());
  EXPECT_TRUE(log_.Lines().empty());
}

TEST_F(TomlDefaultsDomainTest, MissingFileOrDirectoryReadsEmptyWithoutAnErrorLine) {
  TomlDefaultsDomain missingFile(path_);
  TomlDefaultsDomain missingDirectory((dir_ / "absent" / "defaults.toml").string());
  for (auto* domain : {&missingFile, &missingDirectory}) {
    const Dictionary values = domain->Read();
    EXPECT_TRUE(values.is_object());
    EXPECT_TRUE(values.empty());
  }
  WriteFile("");
  EXPECT_TRUE(missingFile.Read().is_object()) << "an empty file is an empty domain";
  EXPECT_TRUE(log_.Lines().empty());
}

TEST_F(TomlDefaultsDomainTest, ChangesShowOnTheNextRead) {
  WriteFile("device_name = \"a\"\ndisable_reporting = true\n");
  TomlDefaultsDomain domain(path_);
  EXPECT_EQ(domain.Read().size(), 2u);
  WriteFile("device_name = \"b\"\n");
  const Dictionary values = domain.Read();
  EXPECT_EQ(values, Dictionary::parse(R"({"device_name": "b"})"));
  fs::remove(path_);
  EXPECT_TRUE(domain.Read().empty());
}

TEST_F(TomlDefaultsDomainTest, MalformedFileLogsOneErrorUntilTheFileChanges) {
  WriteFile("device_name = \"kitchen\"\ndisable_reporting = \n");
  TomlDefaultsDomain domain(path_);
  for (int i = 0; i < 3; ++i) {
    const Dictionary values = domain.Read();
    EXPECT_EQ(values, kClosed)
        << "a half-read file must not yield some of its keys, nor leave reporting on";
  }
  auto errors = log_.Matching("unreadable");
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_EQ(errors[0].scope, "default");
  EXPECT_EQ(errors[0].level, LogLevel::kError);
  EXPECT_NE(errors[0].text.find(path_), std::string::npos) << errors[0].text;
  EXPECT_NE(errors[0].text.find("line 2"), std::string::npos) << errors[0].text;
  EXPECT_EQ(errors[0].text.find("TomlDefaultsDomain.cpp:"), 0u) << errors[0].text;

  WriteFile("disable_reporting = [\n");
  domain.Read();
  domain.Read();
  EXPECT_EQ(log_.Count("unreadable"), 2u) << "a changed file that is still broken is new news";

  WriteFile("disable_reporting = false\n");
  EXPECT_EQ(domain.Read(), Dictionary::parse(R"({"disable_reporting": false})"));
  WriteFile("disable_reporting = [\n");
  EXPECT_EQ(domain.Read(), Dictionary::parse(R"({"disable_reporting": false})"))
      << "a broken file keeps the last settings that parsed";
  EXPECT_EQ(log_.Count("unreadable"), 3u) << "breaking a repaired file is logged again";
}

TEST_F(TomlDefaultsDomainTest, DuplicateKeysAreMalformed) {
  WriteFile("a = 1\na = 2\n");
  TomlDefaultsDomain domain(path_);
  EXPECT_FALSE(domain.Read().contains("a"));
  EXPECT_EQ(log_.Count("unreadable"), 1u);
}

TEST_F(TomlDefaultsDomainTest, UnreadablePathsFailClosedWithOneErrorLine) {
  fs::create_directory(path_);
  TomlDefaultsDomain directory(path_);
  EXPECT_EQ(directory.Read(), kClosed);
  EXPECT_EQ(directory.Read(), kClosed);
  ASSERT_EQ(log_.Count("not a regular file"), 1u);

  const std::string underFile = (dir_ / "plain").string();
  { std::ofstream(underFile) << "x"; }
  TomlDefaultsDomain notADirectory(underFile + "/defaults.toml");
  EXPECT_EQ(notADirectory.Read(), kClosed);
  EXPECT_EQ(log_.Count("Not a directory"), 1u);
}

TEST_F(TomlDefaultsDomainTest, OversizedFileIsRefused) {
  WriteFile("padding = \"" + std::string(kMaxTomlFileBytes, 'x') + "\"\n");
  TomlDefaultsDomain domain(path_);
  EXPECT_EQ(domain.Read(), kClosed);
  EXPECT_EQ(log_.Count("more than the limit"), 1u);
}

}  // namespace
}  // namespace tavrin
