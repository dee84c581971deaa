// The settings files: the defaults domain and the device facts, both TOML.

#include "platform/linux/settings/TomlDefaultsDomain.h"
#include "platform/linux/settings/TomlDeviceInfo.h"

#include <filesystem>
#include <functional>
#include <string>

#include <gtest/gtest.h>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

namespace fs = std::filesystem;
using testing::WriteBytes;

// What a domain that never parsed reads as: reporting off.
const Dictionary kClosed = Dictionary::parse(R"({"disable_reporting": true})");

class TomlSettingsTest : public ::testing::Test {
 protected:
  testing::FakeLogSystem log_;
  testing::TempDir dir_;
  const std::string path_ = dir_ / "com.quorvex.tavrin.toml";
  TomlDefaultsDomain domain_{path_};
};

TEST_F(TomlSettingsTest, DefaultsReadsKeysOfEveryTypeInFileOrderAfreshEachTime) {
  EXPECT_EQ(domain_.Read(), Dictionary::object()) << "a missing file is an empty domain";
  WriteBytes(path_, R"(
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
  const Dictionary values = domain_.Read();
  // ordered_json: the order of keys counts too.
  EXPECT_EQ(values, Dictionary::parse(R"({"device_name": "kitchen speaker",
    "reporting_server_verbose": 5, "disable_reporting": true, "gain": 0.25,
    "mixed": [1, "two", 3.5, false], "nested": [[1, 2], []], "inline": {"b": 2, "a": 1},
    "born": "1979-05-27T07:32:00Z", "day": "2024-02-29", "alarm": "07:30:00",
    "table": {"zeta": "z", "alpha": {"deep": [{"x": 1}]}},
    "servers": [{"name": "one"}, {"name": "two"}]})"))
      << values.dump();
  EXPECT_TRUE(values["reporting_server_verbose"].is_number_integer());
  WriteBytes(path_, "");
  EXPECT_EQ(domain_.Read(), Dictionary::object());
  TomlDefaultsDomain missingDirectory(dir_ / "absent/defaults.toml");
  EXPECT_EQ(missingDirectory.Read(), Dictionary::object());
  EXPECT_TRUE(log_.Lines().empty());
}

// A half-read file must not yield some of its keys, nor leave reporting on.
TEST_F(TomlSettingsTest, DefaultsUnreadableFilesFailClosedWithOneErrorLineNamingThem) {
  const std::pair<std::function<void()>, std::string> cases[] = {
      {[&] { WriteBytes(path_, "device_name = \"k\"\ndisable_reporting = \n"); }, "line 2"},
      {[&] { WriteBytes(path_, "a = 1\na = 2\n"); }, "cannot parse"},  // duplicate keys
      {[&] { fs::create_directory(path_); }, "not a regular file"},
      {[&] { WriteBytes(path_, "x = \"" + std::string(kMaxTomlFileBytes, 'x') + "\"\n"); },
       "more than the limit"},
  };
  for (const auto& [breakIt, why] : cases) {
    fs::remove_all(path_);
    log_.Clear();
    breakIt();
    TomlDefaultsDomain domain(path_);
    EXPECT_EQ(domain.Read(), kClosed) << why;
    EXPECT_EQ(domain.Read(), kClosed) << why;
    ASSERT_EQ(log_.Count("reporting disabled until the file parses", LogLevel::kError), 1u) << why;
    EXPECT_NE(log_.Lines()[0].text.find(path_), std::string::npos) << log_.Lines()[0].text;
    EXPECT_NE(log_.Lines()[0].text.find(why), std::string::npos) << log_.Lines()[0].text;
  }
  WriteBytes(dir_ / "plain", "x");
  TomlDefaultsDomain notADirectory(dir_ / "plain/defaults.toml");
  EXPECT_EQ(notADirectory.Read(), kClosed);
  EXPECT_EQ(log_.Count("Not a directory"), 1u);
}

TEST_F(TomlSettingsTest,
       DefaultsBrokenFileKeepsTheLastGoodSettingsAndIsLoggedAgainOnlyWhenChanged) {
  WriteBytes(path_, "disable_reporting = false\n");
  const Dictionary good = domain_.Read();
  WriteBytes(path_, "disable_reporting = [\n");
  EXPECT_EQ(domain_.Read(), good);
  EXPECT_EQ(domain_.Read(), good);
  EXPECT_EQ(log_.Count("keeping the last settings that parsed", LogLevel::kError), 1u);
  WriteBytes(path_, "disable_reporting = [[\n");
  EXPECT_EQ(domain_.Read(), good);
  EXPECT_EQ(log_.Count("unreadable"), 2u) << "a changed file that is still broken is new news";
  WriteBytes(path_, "disable_reporting = true\n");
  EXPECT_EQ(domain_.Read(), kClosed);
  WriteBytes(path_, "disable_reporting = [\n");
  EXPECT_EQ(domain_.Read(), kClosed) << "the newest good settings are kept";
  EXPECT_EQ(log_.Count("unreadable"), 3u) << "breaking a repaired file is logged again";
}

// Each file is queried with the fallbacks true and 9, three times over, then rewritten: the facts
// are read once and do not change while the service runs.
TEST_F(TomlSettingsTest, DeviceInfoAnswersTheFileOrTheFallbackWithOneErrorLinePerProblem) {
  // "FILE|ANSWERS|ERROR LINES" ("-" for no file).
  for (std::string_view c :
       {"InternalBuild = false\nDeviceClassNumber = -3\n|0 -3|0", "-|1 9|0", "Other = 1\n|1 9|0",
        "InternalBuild = \"yes\"\nDeviceClassNumber = 2.5\n|1 9|2",  // one per key
        "DeviceClassNumber = 2147483648\n|1 9|1",                    // beyond 32 bits
        "InternalBuild = tru\n|1 9|1"}) {                            // one for the file
    log_.Clear();
    static int files = 0;
    const std::string path = dir_ / ("device" + std::to_string(++files) + ".toml");
    const std::string file(c.substr(0, c.find('|')));
    if (file != "-") WriteBytes(path, file);
    TomlDeviceInfo info(path);
    auto answers = [&] {
      return fmt::format("{} {}", int(info.QueryBool(kDeviceInfoInternalBuild, true)),
                         info.QueryInt32(kDeviceInfoDeviceClassNumber, 9));
    };
    const std::string expected(c.substr(c.find('|') + 1, c.rfind('|') - c.find('|') - 1));
    for (int i = 0; i < 3; ++i) EXPECT_EQ(answers(), expected) << file;
    WriteBytes(path, "InternalBuild = false\nDeviceClassNumber = 1\n");
    EXPECT_EQ(answers(), expected) << file;
    EXPECT_EQ(log_.Count(path, LogLevel::kError), size_t(c.back() - '0')) << file;
    EXPECT_EQ(log_.Lines().size(), size_t(c.back() - '0'));
  }
}

}  // namespace
}  // namespace tavrin
