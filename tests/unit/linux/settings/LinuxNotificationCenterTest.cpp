#include "platform/linux/settings/LinuxNotificationCenter.h"

#include <signal.h>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "platform/linux/dispatch/AsioDispatcher.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

namespace fs = std::filesystem;
using testing::WaitFor;
using testing::WriteBytes;

// The center's watchers on an I/O thread of their own, its handlers on a serial queue of the real
// dispatcher.
class LinuxNotificationCenterTest : public ::testing::Test {
 protected:
  void TearDown() override {
    center_.reset();
    work_.reset();
    ioThread_.join();  // returns only once the watchers' last completions have run
  }
  // A handler that counts its calls, and those that ran off its queue.
  int Register(const std::string& name) {
    int token = 0;
    auto count = [this](int token) {
      std::lock_guard lock(mutex_);
      ++calls_[token];
      offQueue_ += !queue_->IsCurrent();
    };
    EXPECT_EQ(center_->RegisterNotificationHandler(name, &token, *queue_, count), kNotifyStatusOk);
    return token;
  }
  int Calls(int token) {
    std::lock_guard lock(mutex_);
    return calls_[token];
  }
  bool Drained() { return dispatcher_.WaitUntilDrained(testing::kWaitLimit); }

  std::mutex mutex_;
  std::map<int, int> calls_;  // guarded by mutex_
  int offQueue_ = 0;          // guarded by mutex_
  asio::io_context io_;
  asio::executor_work_guard<asio::io_context::executor_type> work_ = asio::make_work_guard(io_);
  std::thread ioThread_{[this] { io_.run(); }};
  AsioDispatcher dispatcher_{1};
  SerialQueuePtr queue_ = dispatcher_.CreateSerialQueue("notify", QualityOfService::kDefault);
  std::unique_ptr<LinuxNotificationCenter> center_ = std::make_unique<LinuxNotificationCenter>(io_);
  testing::TempDir dir_;
  const std::string path_ = dir_ / "com.quorvex.tavrin.toml";
};

TEST_F(LinuxNotificationCenterTest, PostsReachEveryHandlerOfTheNameOnItsQueueUntilCancelled) {
  const int first = Register("a"), second = Register("a"), other = Register("b");
  const int cancelled = Register("a"), queuedThenCancelled = Register("a");
  EXPECT_EQ((std::set{first, second, other, cancelled, queuedThenCancelled}.size()), 5u);
  center_->Cancel(cancelled);
  center_->Cancel(12345);  // unknown tokens are ignored
  queue_->Suspend();       // the posts are queued, not run, when the next cancel comes
  center_->Post("a");
  center_->Post("a");
  center_->Post("nobody listens");
  center_->Cancel(queuedThenCancelled);
  queue_->Resume();
  ASSERT_TRUE(Drained());
  std::unique_lock lock(mutex_);
  EXPECT_EQ(calls_, (std::map<int, int>{{first, 2}, {second, 2}}));
  EXPECT_EQ(offQueue_, 0);
  lock.unlock();
  EXPECT_EQ(center_->GetCounters().posts, 3u);

  int token = 0;
  auto handler = [](int) {};
  EXPECT_EQ(center_->RegisterNotificationHandler("", &token, *queue_, handler),
            kNotifyStatusInvalidName);
  EXPECT_EQ(center_->RegisterNotificationHandler("a", nullptr, *queue_, handler),
            kNotifyStatusInvalidRequest);
  EXPECT_EQ(center_->RegisterNotificationHandler("a", &token, *queue_, nullptr),
            kNotifyStatusInvalidRequest);
}

TEST_F(LinuxNotificationCenterTest, EveryChangeOfTheDefaultsFileAndHangupPostButNotOtherFiles) {
  const int token = Register(kDefaultsNotificationName);
  ASSERT_EQ(center_->WatchDefaults(path_), std::nullopt);
  // Events about another file of the directory, or a new file whose writer has not finished,
  // are read and counted without posting.
  auto eventsSeenWithoutPost = [&](uint64_t events) {
    return WaitFor([&] { return center_->GetCounters().fileEvents >= events; }) && Drained() &&
           Calls(token) == 0;
  };
  WriteBytes(dir_ / "sibling.toml", "x");  // created and closed
  EXPECT_TRUE(eventsSeenWithoutPost(2));
  std::ofstream writer(path_);
  EXPECT_TRUE(eventsSeenWithoutPost(3));

  const std::string temporary = dir_ / ".swp";
  const std::pair<const char*, std::function<void()>> steps[] = {
      {"closed by its writer", [&] { writer << "a = 1\n", writer.close(); }},
      {"rewritten in place", [&] { WriteBytes(path_, "a = 2\n"); }},
      {"renamed over", [&] { WriteBytes(temporary, "a = 3\n"), fs::rename(temporary, path_); }},
      {"renamed over again",
       [&] { WriteBytes(temporary, "a = 4\n"), fs::rename(temporary, path_); }},
      {"removed", [&] { fs::remove(path_); }},
      {"linked in", [&] { fs::create_symlink(dir_ / "sibling.toml", path_); }},
      {"moved away", [&] { fs::rename(path_, dir_ / "moved.toml"); }},
      {"SIGHUP", [] { raise(SIGHUP); }},
  };
  for (const auto& [what, step] : steps) {
    const int before = Calls(token);
    step();
    EXPECT_TRUE(WaitFor([&] { return Calls(token) > before; })) << what;
  }
  EXPECT_EQ(center_->GetCounters().signalsCaught, 1u);
  std::lock_guard lock(mutex_);
  EXPECT_EQ(offQueue_, 0);
}

TEST_F(LinuxNotificationCenterTest, RemovedDirectoryPostsOnceAndIsReported) {
  testing::FakeLogSystem log;
  const int token = Register("settings");
  fs::create_directory(dir_ / "etc");
  ASSERT_EQ(center_->WatchFile(dir_ / "etc/defaults.toml", "settings"), std::nullopt);
  fs::remove(dir_ / "etc");
  ASSERT_TRUE(WaitFor([&] { return log.Count("stopped watching", LogLevel::kError) == 1; }));
  ASSERT_TRUE(Drained());
  EXPECT_EQ(Calls(token), 1);
  EXPECT_TRUE(center_->WatchFile(dir_ / "gone/defaults.toml", "settings").has_value());
}

}  // namespace
}  // namespace tavrin
