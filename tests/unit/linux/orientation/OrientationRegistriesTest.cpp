// The delivery rule every Linux orientation registry shares, the feed registry, and the
// --orientation values that choose a registry. (The iio registry has a file of its own: it needs
// a bus daemon.)

#include "platform/linux/orientation/OrientationRegistries.h"

#include <sys/stat.h>

#include <atomic>
#include <fstream>
#include <future>
#include <stdexcept>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/linux/orientation/FeedOrientationRegistry.h"
#include "platform/linux/orientation/IioOrientationRegistry.h"
#include "platform/linux/orientation/NoOrientationRegistry.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::WaitFor;
using Seen = std::vector<std::string>;
constexpr auto kDevice = OrientationKind::kDevice;
constexpr auto kUI = OrientationKind::kUI;

class OrientationCallbacksTest : public ::testing::Test {
 protected:
  // A callback that notes "id=value".
  OrientationRegistry::Callback Note(const std::string& id) {
    return [this, id](const OrientationValue& value) { notes_.Add(id + "=" + value); };
  }

  testing::FakeLogSystem log_;
  testing::Notes notes_;
  OrientationCallbacks callbacks_;
};

TEST_F(OrientationCallbacksTest, EachKindReachesItsOwnCallbacksPastEmptyOrThrowingOnes) {
  callbacks_.Register(kDevice, "a", [](const OrientationValue&) { throw std::runtime_error("x"); });
  callbacks_.Register(kDevice, "b", Note("b"));
  callbacks_.Register(kDevice, "c", Note("old"));
  callbacks_.Register(kDevice, "c", Note("c"));  // registering again replaces
  callbacks_.Register(kUI, "b", Note("ui-b"));
  callbacks_.Register(kUI, "empty", nullptr);
  EXPECT_EQ(callbacks_.Deliver(kDevice, "normal"), 3u);
  EXPECT_EQ(callbacks_.Deliver(kUI, "left-up"), 1u);
  EXPECT_EQ(notes_.Get(), (Seen{"b=normal", "c=normal", "ui-b=left-up"}));
  EXPECT_EQ(log_.Count("device orientation callback of \"a\" threw: x", LogLevel::kError), 1u);
  EXPECT_EQ(log_.Count("empty ui orientation callback for \"empty\"", LogLevel::kError), 1u);
}

// "a" runs first (identifier order) and removes itself, "b" (already picked for this delivery)
// and a callback of the other kind, all without waiting for itself.
TEST_F(OrientationCallbacksTest, CallbacksUnregisteringThemselvesOrOthersNeitherWaitNorGetCalled) {
  callbacks_.Register(kDevice, "a", [&](const OrientationValue& value) {
    Note("a")(value);
    for (auto id : {"a", "b", "unknown"}) callbacks_.Unregister(kDevice, id);
    callbacks_.Unregister(kUI, "ui");
  });
  callbacks_.Register(kDevice, "b", Note("b"));
  callbacks_.Register(kUI, "ui", Note("ui"));
  EXPECT_EQ(callbacks_.Deliver(kDevice, "1"), 1u);
  EXPECT_EQ(callbacks_.Deliver(kDevice, "2") + callbacks_.Deliver(kUI, "3"), 0u);
  EXPECT_EQ(notes_.Get(), (Seen{"a=1"}));
}

TEST_F(OrientationCallbacksTest, UnregisterElsewhereWaitsForTheRunningCallbackAndItsCaptures) {
  std::promise<void> entered, release;
  auto captured = std::make_shared<int>(0);
  std::weak_ptr<int> capture = captured;
  std::atomic<bool> running{false};
  callbacks_.Register(kDevice, "slow",
                      [&, captured, released = release.get_future().share()](auto&) {
                        running = true;
                        entered.set_value();
                        released.wait();
                        running = false;
                      });
  captured.reset();
  std::thread deliverer([&] { callbacks_.Deliver(kDevice, "x"); });
  entered.get_future().wait();
  std::atomic<bool> returned{false}, runningOrCapturedAtReturn{true};
  std::thread unregisterer([&] {
    callbacks_.Unregister(kDevice, "slow");
    runningOrCapturedAtReturn = running || !capture.expired();
    returned = true;
  });
  std::this_thread::sleep_for(50ms);  // whatever the delay, Unregister must still be waiting
  EXPECT_FALSE(returned.load());
  release.set_value();
  unregisterer.join();
  deliverer.join();
  EXPECT_FALSE(runningOrCapturedAtReturn.load());
}

// Each case is "LINE|EXPECTED": "device VALUE|" or "ui VALUE|" for a good line, the start of the
// reason for a bad one, "|" for a blank line (which is no error).
TEST(ParseFeedLineTest, GoodLinesGiveKindAndTrimmedValueBadOnesSayWhy) {
  for (std::string_view c :
       {"device normal|device normal|", "ui\tleft-up|ui left-up|",
        "  device   face up \r|device face up|",        // CRLF writers
        "ui \xc3\xa9tendu|ui \xc3\xa9tendu|", " \t||",  // UTF-8 is text; blank
        "sideways normal|unknown kind", "Device normal|unknown kind", "devicenormal|unknown kind",
        "device|missing value", "ui   \t |missing value", "device nor\x01mal|value is not UTF-8",
        "device nor\x7fmal|value is not UTF-8", "device \xff|value is not UTF-8",
        "device \xc3|value is not UTF-8",                 // cut short
        "device \xc0\xaf|value is not UTF-8",             // overlong form
        "device \xed\xa0\x80|value is not UTF-8",         // surrogate
        "device \xc2\x85|value is not UTF-8",             // C1 control
        "device \xf4\x90\x80\x80|value is not UTF-8"}) {  // above U+10FFFF
    const ParsedFeedLine parsed = ParseFeedLine(c.substr(0, c.find('|')));
    const std::string got =
        parsed.line ? (parsed.line->kind == OrientationKind::kDevice ? "device " : "ui ") +
                          parsed.line->value + "|"
                    : std::string(parsed.error.empty() ? "|" : parsed.error);
    EXPECT_EQ(got.substr(0, c.size() - c.find('|') - 1), c.substr(c.find('|') + 1)) << c;
  }
}

// Writes through an opening of its own, as a program would.
void Write(const std::string& path, const std::string& text) {
  EXPECT_TRUE(std::ofstream(path) << text << std::flush) << path;
}

class FeedOrientationRegistryTest : public ::testing::Test {
 protected:
  // Notes "KIND VALUE", with "!" when it runs anywhere but on the registry's own thread.
  FeedOrientationRegistry& Start() {
    registry_ = std::make_unique<FeedOrientationRegistry>(path_);
    for (std::string kind : {"device ", "ui "}) {
      auto note = [this, kind](const OrientationValue& value) {
        notes_.Add(kind + value + (testing::ThreadName() == kOrientationThreadName ? "" : "!"));
      };
      kind == "ui " ? registry_->RegisterUIOrientation("ui", note)
                    : registry_->RegisterDeviceOrientation("dev", note);
    }
    return *registry_;
  }

  testing::FakeLogSystem log_;
  testing::TempDir dir_;
  const std::string path_ = dir_ / "orientation";
  testing::Notes notes_;
  std::unique_ptr<FeedOrientationRegistry> registry_;
};

// Writers come and go; a line may arrive in pieces.
TEST_F(FeedOrientationRegistryTest, CreatesTheFifoAndDeliversWholeLinesOnItsOwnThread) {
  auto& registry = Start();
  ASSERT_TRUE(registry.listening());
  struct stat st;
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISFIFO(st.st_mode));
  Write(path_, "device nor");
  ASSERT_TRUE(WaitFor([&] { return registry.counts().bytesRead == 10; }));
  EXPECT_EQ(notes_.Size(), 0u) << "half a line was delivered";
  Write(path_, "mal\nui le");
  Write(path_, "ft-up\n\ndevice  right-up  \n");
  ASSERT_TRUE(notes_.WaitSize(3));
  EXPECT_EQ(notes_.Get(), (Seen{"device normal", "ui left-up", "device right-up"}));
}

// Bad lines are dropped and counted; the first ones get an error line each (control bytes
// escaped), later ones one line per interval.
TEST_F(FeedOrientationRegistryTest, BadLinesAreDroppedCountedAndLoggedBoundedAndEscaped) {
  auto& registry = Start();
  constexpr uint64_t kBad = 2 * FeedOrientationRegistry::kBadLineLogInterval;
  std::string flood = "sideways normal\ndevice\nui   \ndevice bad\x01value\ndevice \xff\n   \n";
  for (uint64_t i = 5; i < kBad; ++i) flood += "bogus line " + std::to_string(i) + "\n";
  // More than a pipe buffer: the writer blocks until the reader drains.
  std::thread writer([&] { Write(path_, flood + "device good\n"); });
  ASSERT_TRUE(notes_.WaitSize(1));
  writer.join();
  EXPECT_EQ(notes_.Get(), (Seen{"device good"}));
  EXPECT_EQ(registry.counts().badLines, kBad);
  EXPECT_EQ(log_.Count("line dropped", LogLevel::kError), FeedOrientationRegistry::kLoggedBadLines);
  EXPECT_EQ(log_.Count("missing value"), 2u);
  EXPECT_EQ(log_.Count("\"device bad\\x01value\""), 1u);
  EXPECT_EQ(log_.Count("\"device \\xff\""), 1u);
  EXPECT_EQ(log_.Count("further dropped lines are logged once per"), 1u);
  EXPECT_EQ(log_.Count("lines dropped so far", LogLevel::kError), 2u);
  EXPECT_EQ(log_.Count("2000 lines dropped so far (2000 bad, 0 over-long)"), 1u);
}

TEST_F(FeedOrientationRegistryTest, OverlongLineIsDroppedAndTheNextLineIsKept) {
  auto& registry = Start();
  constexpr size_t kMax = FeedOrientationRegistry::kMaxLineBytes;
  const std::string longest = "device " + std::string(kMax - 7, 'a');  // exactly at the limit
  const std::string tooLong = "ui " + std::string(kMax - 2, 'b');      // one byte over
  Write(path_, longest + "\n" + tooLong.substr(0, 600));  // its newline comes in a later write
  ASSERT_TRUE(WaitFor([&] { return registry.counts().bytesRead == kMax + 601; }));
  Write(path_, tooLong.substr(600) + std::string(3 * kMax, 'c') + "\ndevice ok\n");
  ASSERT_TRUE(notes_.WaitSize(2));
  EXPECT_EQ(notes_.Get(), (Seen{longest, "device ok"}));
  EXPECT_EQ(registry.counts().overlongLines, 1u);
  EXPECT_EQ(log_.Count("longer than the limit of 1024 bytes", LogLevel::kError), 1u);
}

TEST_F(FeedOrientationRegistryTest, ExistingRegularFileIsRefusedAndLeftAlone) {
  testing::WriteBytes(path_, "device normal\n");
  EXPECT_FALSE(Start().listening());
  EXPECT_EQ(log_.Count("exists and is not a FIFO", LogLevel::kError), 1u);
  registry_.reset();  // nothing to join, nothing removed
  EXPECT_EQ(testing::ReadBytes(path_), "device normal\n");
}

TEST(MakeOrientationRegistryTest, EachSourceMakesItsRegistryAnythingElseIsAClearError) {
  testing::FakeLogSystem log;
  testing::TempDir dir;
  // No system bus: the iio registry starts all the same and keeps trying.
  setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + dir / "no-bus").c_str(), 1);
  std::string error;
  auto none = MakeOrientationRegistry("none", nullptr, &error);
  auto iio = MakeOrientationRegistry("iio", nullptr, &error);
  auto feed = MakeOrientationRegistry("feed:" + dir / "feed", nullptr, &error);
  unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
  EXPECT_NE(dynamic_cast<NoOrientationRegistry*>(none.get()), nullptr);
  EXPECT_NE(dynamic_cast<IioOrientationRegistry*>(iio.get()), nullptr);
  ASSERT_NE(dynamic_cast<FeedOrientationRegistry*>(feed.get()), nullptr);
  EXPECT_EQ(static_cast<FeedOrientationRegistry&>(*feed).path(), dir / "feed");
  EXPECT_EQ(error, "");
  for (const std::string source : {"", "feed", "IIO", "iio:", "none ", "fifo:/tmp/x"}) {
    EXPECT_EQ(MakeOrientationRegistry(source, nullptr, &error), nullptr) << source;
    EXPECT_EQ(error,
              "unknown orientation source \"" + source + "\"; expected none, iio or feed:PATH");
  }
  EXPECT_EQ(MakeOrientationRegistry("feed:", nullptr, &error), nullptr);
  EXPECT_EQ(error, "orientation source \"feed:\" needs a path: feed:PATH");
  EXPECT_EQ(MakeOrientationRegistry("bogus", nullptr, nullptr), nullptr);  // the error is optional
}

}  // namespace
}  // namespace tavrin
