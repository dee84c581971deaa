#include "platform/linux/orientation/FeedOrientationRegistry.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <csignal>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <sstream>
#include <thread>
#include <vector>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::FakeLogSystem;
namespace fs = std::filesystem;

// Generous: other builds share the two cores.
constexpr auto kWaitLimit = 10s;

bool WaitFor(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(1ms);
  }
  return true;
}

struct Received {
  std::string value;
  std::string thread;
};

class Recorder {
 public:
  OrientationRegistry::Callback Callback() {
    return [this](const OrientationValue& value) {
      char name[16] = {};
      pthread_getname_np(pthread_self(), name, sizeof name);
      std::lock_guard lock(mutex_);
      received_.push_back({value, name});
    };
  }
  std::vector<std::string> Values() const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> values;
    for (const auto& r : received_) values.push_back(r.value);
    return values;
  }
  std::vector<Received> All() const {
    std::lock_guard lock(mutex_);
    return received_;
  }
  size_t Size() const {
    std::lock_guard lock(mutex_);
    return received_.size();
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Received> received_;
};

// A writer process stand-in: its own descriptor on the FIFO, opened and closed like a program's.
// A writer of the FIFO. Opening can succeed against a reader that has just seen the previous
// writer's end and is about to close and reopen; a write that then finds no reader (EPIPE) is
// made again through a new opening, which waits for the reopened reader.
class Writer {
 public:
  explicit Writer(const std::string& path)
      : path_(path), fd_(open(path.c_str(), O_WRONLY | O_CLOEXEC)) {
    EXPECT_GE(fd_, 0) << std::strerror(errno);
    signal(SIGPIPE, SIG_IGN);
  }
  ~Writer() { Close(); }
  void Write(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t n = write(fd_, bytes.data(), bytes.size());
      if (n < 0 && errno == EPIPE) {
        close(fd_);
        fd_ = open(path_.c_str(), O_WRONLY | O_CLOEXEC);
        ASSERT_GE(fd_, 0) << std::strerror(errno);
        continue;
      }
      ASSERT_GT(n, 0) << std::strerror(errno);
      bytes.remove_prefix(size_t(n));
    }
  }
  void Close() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }

 private:
  std::string path_;
  int fd_;
};

class FeedOrientationRegistryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-feed-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    path_ = (dir_ / "orientation").string();
  }
  void TearDown() override {
    registry_.reset();
    fs::remove_all(dir_);
  }

  FeedOrientationRegistry& Start() {
    registry_ = std::make_unique<FeedOrientationRegistry>(path_);
    registry_->RegisterDeviceOrientation("dev", device_.Callback());
    registry_->RegisterUIOrientation("ui", ui_.Callback());
    return *registry_;
  }
  // Waits until the registry has handled `n` good lines and their callbacks have run (the count
  // goes up before the callbacks are called).
  bool WaitDelivered(uint64_t n) {
    return WaitFor([&] {
      return registry_->counts().deliveredLines >= n &&
             device_.Values().size() + ui_.Values().size() >= n;
    });
  }

  FakeLogSystem log_;
  fs::path dir_;
  std::string path_;
  Recorder device_;
  Recorder ui_;
  std::unique_ptr<FeedOrientationRegistry> registry_;
};

TEST(ParseFeedLineTest, GoodLines) {
  struct Case {
    std::string_view text;
    OrientationKind kind;
    std::string_view value;
  };
  const Case cases[] = {
      {"device normal", OrientationKind::kDevice, "normal"},
      {"ui left-up", OrientationKind::kUI, "left-up"},
      {"device\tbottom-up", OrientationKind::kDevice, "bottom-up"},
      {"  device   face up \r", OrientationKind::kDevice, "face up"},  // CRLF writers
      {"ui portrait upside-down", OrientationKind::kUI, "portrait upside-down"},
      {"ui \xc3\xa9tendu", OrientationKind::kUI, "\xc3\xa9tendu"},  // UTF-8 is text
  };
  for (const auto& c : cases) {
    const ParsedFeedLine parsed = ParseFeedLine(c.text);
    ASSERT_TRUE(parsed.line) << c.text << ": " << parsed.error;
    EXPECT_EQ(parsed.line->kind, c.kind) << c.text;
    EXPECT_EQ(parsed.line->value, c.value) << c.text;
  }
}

TEST(ParseFeedLineTest, BadLinesSayWhy) {
  struct Case {
    std::string_view text;
    std::string_view error;
  };
  const Case cases[] = {
      {"sideways normal", "unknown kind"},
      {"Device normal", "unknown kind"},  // the kind word is lower case
      {"devicenormal", "unknown kind"},
      {"normal", "unknown kind"},
      {"device", "missing value"},
      {"ui   \t ", "missing value"},
      {"device nor\x01mal", "not UTF-8 text"},
      {"device nor\x7fmal", "not UTF-8 text"},
      {"device \xff", "not UTF-8 text"},
      {"device \xc3", "not UTF-8 text"},              // cut short
      {"device \xc0\xaf", "not UTF-8 text"},          // overlong form
      {"device \xed\xa0\x80", "not UTF-8 text"},      // surrogate
      {"device \xc2\x85", "not UTF-8 text"},          // C1 control
      {"device \xf4\x90\x80\x80", "not UTF-8 text"},  // above U+10FFFF
  };
  for (const auto& c : cases) {
    const ParsedFeedLine parsed = ParseFeedLine(c.text);
    EXPECT_FALSE(parsed.line) << c.text;
    EXPECT_NE(parsed.error.find(c.error), std::string_view::npos) << c.text << ": " << parsed.error;
  }
}

TEST_F(FeedOrientationRegistryTest, CreatesTheFifoAndDeliversBothKindsOnItsOwnThread) {
  auto& registry = Start();
  ASSERT_TRUE(registry.listening());
  struct stat st;
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISFIFO(st.st_mode));

  Writer writer(path_);
  writer.Write("device normal\nui left-up\ndevice  right-up  \n");
  ASSERT_TRUE(WaitDelivered(3));
  EXPECT_EQ(device_.Values(), (std::vector<std::string>{"normal", "right-up"}));
  EXPECT_EQ(ui_.Values(), (std::vector<std::string>{"left-up"}));
  for (const auto& r : device_.All()) EXPECT_EQ(r.thread, kOrientationThreadName);
  for (const auto& r : ui_.All()) EXPECT_EQ(r.thread, kOrientationThreadName);
  EXPECT_EQ(registry.OrientationToString("left-up"), "left-up");
}

TEST_F(FeedOrientationRegistryTest, LineSplitAcrossWritesIsDeliveredWhole) {
  auto& registry = Start();
  Writer writer(path_);
  writer.Write("device nor");
  ASSERT_TRUE(WaitFor([&] { return registry.counts().bytesRead == 10; }));
  EXPECT_EQ(registry.counts().deliveredLines, 0u);
  writer.Write("mal\nui le");
  ASSERT_TRUE(WaitDelivered(1));
  writer.Write("ft-up\n");
  ASSERT_TRUE(WaitDelivered(2));
  EXPECT_EQ(device_.Values(), (std::vector<std::string>{"normal"}));
  EXPECT_EQ(ui_.Values(), (std::vector<std::string>{"left-up"}));
}

TEST_F(FeedOrientationRegistryTest, BadLinesAreDroppedCountedAndLoggedOneLineEach) {
  auto& registry = Start();
  Writer writer(path_);
  writer.Write("sideways normal\ndevice\nui   \ndevice bad\x01value\ndevice \xff\n\n   \n");
  writer.Write("device good\n");
  ASSERT_TRUE(WaitDelivered(1));
  EXPECT_EQ(device_.Values(), (std::vector<std::string>{"good"}));
  EXPECT_TRUE(ui_.Values().empty());
  EXPECT_EQ(registry.counts().badLines, 5u);
  EXPECT_EQ(log_.Count("line dropped", LogLevel::kError), 5u);
  EXPECT_EQ(log_.Count("unknown kind"), 1u);
  EXPECT_EQ(log_.Count("missing value"), 2u);
  // Control bytes are escaped in the log, not written raw.
  EXPECT_EQ(log_.Count("\"device bad\\x01value\""), 1u);
  EXPECT_EQ(log_.Count("\"device \\xff\""), 1u);
}

TEST_F(FeedOrientationRegistryTest, AFloodOfBadLinesGetsBoundedLogging) {
  auto& registry = Start();
  constexpr uint64_t kBad = 2 * FeedOrientationRegistry::kBadLineLogInterval + 5;
  std::string flood;
  for (uint64_t i = 0; i < kBad; ++i) flood += "bogus line " + std::to_string(i) + "\n";
  std::thread writerThread([&] {
    Writer writer(path_);
    writer.Write(flood);  // more than a pipe buffer: the writer blocks until the reader drains
    writer.Write("ui fine\n");
  });
  ASSERT_TRUE(WaitDelivered(1));
  writerThread.join();
  EXPECT_EQ(registry.counts().badLines, kBad);
  EXPECT_EQ(ui_.Values(), (std::vector<std::string>{"fine"}));
  // Each of the first ones, then one per interval.
  EXPECT_EQ(log_.Count("line dropped", LogLevel::kError), FeedOrientationRegistry::kLoggedBadLines);
  EXPECT_EQ(log_.Count("further dropped lines are logged once per"), 1u);
  EXPECT_EQ(log_.Count("lines dropped so far", LogLevel::kError), 2u);
  EXPECT_EQ(log_.Count("2000 lines dropped so far (2000 bad, 0 over-long)"), 1u);
}

TEST_F(FeedOrientationRegistryTest, OverlongLineIsDroppedAndTheNextLineIsKept) {
  auto& registry = Start();
  constexpr size_t kMax = FeedOrientationRegistry::kMaxLineBytes;
  const std::string longest = "device " + std::string(kMax - 7, 'a');  // exactly at the limit
  ASSERT_EQ(longest.size(), kMax);
  const std::string tooLong = "ui " + std::string(kMax - 2, 'b');  // one byte over
  Writer writer(path_);
  writer.Write(longest + "\n");
  // An over-long line arriving in pieces, with its newline in a later write.
  writer.Write(tooLong.substr(0, 600));
  ASSERT_TRUE(WaitFor([&] { return registry.counts().bytesRead == kMax + 1 + 600; }));
  writer.Write(tooLong.substr(600));
  writer.Write(std::string(3 * kMax, 'c'));  // and it goes on well past the limit
  writer.Write("\ndevice ok\n");
  ASSERT_TRUE(WaitDelivered(2));
  const auto values = device_.Values();
  ASSERT_EQ(values.size(), 2u);
  EXPECT_EQ(values[0].size(), kMax - 7);
  EXPECT_EQ(values[1], "ok");
  EXPECT_TRUE(ui_.Values().empty());
  EXPECT_EQ(registry.counts().overlongLines, 1u);
  EXPECT_EQ(registry.counts().badLines, 0u);
  EXPECT_EQ(log_.Count("longer than the limit of 1024 bytes", LogLevel::kError), 1u);
}

TEST_F(FeedOrientationRegistryTest, ExistingRegularFileIsRefusedAndLeftAlone) {
  {
    std::ofstream file(path_);
    file << "device normal\n";
  }
  auto& registry = Start();
  EXPECT_FALSE(registry.listening());
  EXPECT_EQ(log_.Count("exists and is not a FIFO", LogLevel::kError), 1u);
  struct stat st;
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));
  std::ifstream file(path_);
  std::stringstream content;
  content << file.rdbuf();
  EXPECT_EQ(content.str(), "device normal\n");
  registry_.reset();  // nothing to join, nothing removed
  EXPECT_TRUE(fs::exists(path_));
  EXPECT_EQ(device_.Size(), 0u);
}

// Reads one line from `fd` (the child's report), empty on end-of-file.
std::string ReadReportLine(int fd) {
  std::string line;
  char c;
  while (read(fd, &c, 1) == 1 && c != '\n') line += c;
  return line;
}

// A reader that may not write to the FIFO opens it read-only and must reopen it after every
// writer. Permission bits do not bind root, so the reader runs in a child process that, under
// root, becomes "nobody"; it reports over a pipe.
TEST_F(FeedOrientationRegistryTest, ReadOnlyFifoIsReopenedAfterEachWriter) {
  constexpr int kRounds = 3;
  ASSERT_EQ(chmod(dir_.c_str(), 0755), 0);
  ASSERT_EQ(mkfifo(path_.c_str(), 0444), 0);
  ASSERT_EQ(chmod(path_.c_str(), 0444), 0);  // whatever the umask
  int report[2];
  ASSERT_EQ(pipe2(report, O_CLOEXEC), 0);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    close(report[0]);
    if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(2);
    auto say = [&](const std::string& text) {
      const std::string line = text + "\n";
      if (write(report[1], line.data(), line.size()) != ssize_t(line.size())) _exit(3);
    };
    {
      FeedOrientationRegistry registry(path_);
      registry.RegisterDeviceOrientation("dev", [&](const OrientationValue& v) { say(v); });
      say(std::string(registry.listening() ? "listening" : "not-listening") +
          (log_.Contains("(read-only)") ? " read-only" : " read-write"));
      const bool done = WaitFor([&] { return registry.counts().deliveredLines == kRounds; });
      say(registry.listening() ? "still-listening" : "stopped");
      if (!done) _exit(4);
    }
    _exit(0);
  }
  close(report[1]);
  EXPECT_EQ(ReadReportLine(report[0]), "listening read-only");
  ASSERT_EQ(chmod(path_.c_str(), 0644), 0);  // now the test (the owner) may write
  for (int round = 0; round < kRounds; ++round) {
    Writer writer(path_);
    writer.Write("device round" + std::to_string(round) + "\n");
    writer.Close();
    // The next writer comes only after the reader has seen this one out.
    EXPECT_EQ(ReadReportLine(report[0]), "round" + std::to_string(round));
  }
  EXPECT_EQ(ReadReportLine(report[0]), "still-listening");
  close(report[0]);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

}  // namespace
}  // namespace tavrin
