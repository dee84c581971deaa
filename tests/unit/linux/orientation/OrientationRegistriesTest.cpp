#include "platform/linux/orientation/OrientationRegistries.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>

#include "platform/linux/orientation/FeedOrientationRegistry.h"
#include "platform/linux/orientation/IioOrientationRegistry.h"
#include "platform/linux/orientation/NoOrientationRegistry.h"
#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

namespace fs = std::filesystem;
using testing::FakeLogSystem;

class MakeOrientationRegistryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-orient-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
  }
  void TearDown() override { fs::remove_all(dir_); }

  std::unique_ptr<OrientationRegistry> Make(const std::string& source) {
    error_.clear();
    return MakeOrientationRegistry(source, nullptr, &error_);
  }

  FakeLogSystem log_;
  fs::path dir_;
  std::string error_;
};

TEST_F(MakeOrientationRegistryTest, NoneAcceptsRegistrationsAndNeverCalls) {
  auto registry = Make("none");
  ASSERT_TRUE(registry);
  EXPECT_NE(dynamic_cast<NoOrientationRegistry*>(registry.get()), nullptr);
  bool called = false;
  registry->RegisterDeviceOrientation("a", [&](const OrientationValue&) { called = true; });
  registry->RegisterUIOrientation("a", [&](const OrientationValue&) { called = true; });
  registry->UnregisterDeviceOrientation("a");
  registry->UnregisterUIOrientation("a");
  EXPECT_FALSE(called);
  EXPECT_EQ(registry->OrientationToString("normal"), "normal");
}

TEST_F(MakeOrientationRegistryTest, FeedReadsTheGivenPath) {
  const std::string path = (dir_ / "feed").string();
  auto registry = Make("feed:" + path);
  ASSERT_TRUE(registry);
  auto* feed = dynamic_cast<FeedOrientationRegistry*>(registry.get());
  ASSERT_NE(feed, nullptr);
  EXPECT_EQ(feed->path(), path);
  EXPECT_TRUE(feed->listening());
}

TEST_F(MakeOrientationRegistryTest, IioStartsEvenWithoutABus) {
  setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + (dir_ / "no-bus").string()).c_str(), 1);
  auto registry = Make("iio");
  ASSERT_TRUE(registry);
  EXPECT_NE(dynamic_cast<IioOrientationRegistry*>(registry.get()), nullptr);
  registry.reset();
  unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
}

TEST_F(MakeOrientationRegistryTest, AnythingElseIsAClearError) {
  for (const std::string source : {"", "feed:", "feed", "IIO", "iio:", "none ", "fifo:/tmp/x"}) {
    EXPECT_EQ(Make(source), nullptr) << source;
    EXPECT_FALSE(error_.empty()) << source;
  }
  Make("feed:");
  EXPECT_EQ(error_, "orientation source \"feed:\" needs a path: feed:PATH");
  Make("bogus");
  EXPECT_EQ(error_, "unknown orientation source \"bogus\"; expected none, iio or feed:PATH");
  // The error is optional.
  EXPECT_EQ(MakeOrientationRegistry("bogus", nullptr, nullptr), nullptr);
}

}  // namespace
}  // namespace tavrin
