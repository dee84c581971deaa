#include "platform/linux/settings/TomlDeviceInfo.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

namespace fs = std::filesystem;

class TomlDeviceInfoTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-device-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    path_ = (dir_ / "device.toml").string();
  }
  void TearDown() override { fs::remove_all(dir_); }

  void WriteFile(const std::string& text) { std::ofstream(path_, std::ios::trunc) << text; }

  testing::FakeLogSystem log_;
  fs::path dir_;
  std::string path_;
};

TEST_F(TomlDeviceInfoTest, AnswersTheFileValues) {
  WriteFile("InternalBuild = true\nDeviceClassNumber = 7\n");
  TomlDeviceInfo info(path_);
  EXPECT_TRUE(info.QueryBool(kDeviceInfoInternalBuild, false));
  EXPECT_EQ(info.QueryInt32(kDeviceInfoDeviceClassNumber, 0), 7);
  WriteFile("InternalBuild = false\nDeviceClassNumber = -3\n");
  TomlDeviceInfo other(path_);
  EXPECT_FALSE(other.QueryBool(kDeviceInfoInternalBuild, true));
  EXPECT_EQ(other.QueryInt32(kDeviceInfoDeviceClassNumber, 0), -3);
  EXPECT_TRUE(log_.Lines().empty());
}

TEST_F(TomlDeviceInfoTest, MissingFileOrKeyAnswersTheFallbackSilently) {
  TomlDeviceInfo noFile(path_);
  EXPECT_FALSE(noFile.QueryBool(kDeviceInfoInternalBuild, false));
  EXPECT_TRUE(noFile.QueryBool(kDeviceInfoInternalBuild, true));
  EXPECT_EQ(noFile.QueryInt32(kDeviceInfoDeviceClassNumber, 42), 42);

  WriteFile("Other = 1\n");
  TomlDeviceInfo noKey(path_);
  EXPECT_FALSE(noKey.QueryBool(kDeviceInfoInternalBuild, false));
  EXPECT_EQ(noKey.QueryInt32(kDeviceInfoDeviceClassNumber, 0), 0);
  EXPECT_TRUE(log_.Lines().empty());
}

TEST_F(TomlDeviceInfoTest, WrongTypeAnswersTheFallbackWithOneErrorLine) {
  WriteFile("InternalBuild = \"yes\"\nDeviceClassNumber = 2.5\n");
  TomlDeviceInfo info(path_);
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(info.QueryBool(kDeviceInfoInternalBuild, true));
    EXPECT_EQ(info.QueryInt32(kDeviceInfoDeviceClassNumber, 9), 9);
  }
  const auto bools = log_.Matching("InternalBuild");
  ASSERT_EQ(bools.size(), 1u);
  EXPECT_EQ(bools[0].level, LogLevel::kError);
  EXPECT_NE(bools[0].text.find("\"yes\""), std::string::npos) << bools[0].text;
  EXPECT_NE(bools[0].text.find(path_), std::string::npos) << bools[0].text;
  EXPECT_EQ(log_.Count("DeviceClassNumber", LogLevel::kError), 1u);
  // Asking for the other type is a separate mistake.
  EXPECT_EQ(info.QueryInt32(kDeviceInfoInternalBuild, 1), 1);
  EXPECT_EQ(log_.Count("InternalBuild"), 2u);
}

TEST_F(TomlDeviceInfoTest, MalformedFileAnswersFallbacksWithOneErrorLine) {
  WriteFile("InternalBuild = tru\n");
  TomlDeviceInfo info(path_);
  EXPECT_FALSE(info.QueryBool(kDeviceInfoInternalBuild, false));
  EXPECT_EQ(info.QueryInt32(kDeviceInfoDeviceClassNumber, 3), 3);
  const auto lines = log_.Lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kError);
  EXPECT_NE(lines[0].text.find(path_), std::string::npos) << lines[0].text;
}

}  // namespace
}  // namespace tavrin
