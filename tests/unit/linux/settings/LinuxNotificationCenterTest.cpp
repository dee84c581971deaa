#include "platform/linux/settings/LinuxNotificationCenter.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "tests/fakes/FakeLogSystem.h"

namespace tavrin {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

// Generous: other builds share the machine's two cores.
constexpr auto kEventTimeout = 10s;

template <typename Predicate>
bool WaitUntil(Predicate predicate) {
  const auto deadline = std::chrono::steady_clock::now() + kEventTimeout;
  while (!predicate()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(1ms);
  }
  return true;
}

// A serial queue on one thread of its own: enough to see handlers arrive on the queue they were
// registered with.
class ThreadQueue final : public WorkQueue {
 public:
  ThreadQueue() : thread_([this] { Run(); }) {}
  ~ThreadQueue() override {
    {
      std::lock_guard lock(mutex_);
      stopping_ = true;
    }
    wake_.notify_all();
    thread_.join();
  }
  void Async(Work work) override {
    {
      std::lock_guard lock(mutex_);
      items_.push_back(std::move(work));
    }
    wake_.notify_all();
  }
  void AsyncAfter(Duration, Work) override { ADD_FAILURE() << "the center never delays work"; }
  const std::string& Label() const override { return label_; }
  QualityOfService Qos() const override { return QualityOfService::kUserInteractive; }

  std::thread::id ThreadId() const { return thread_.get_id(); }
  // Returns once everything queued before it has run.
  void Drain() {
    std::mutex mutex;
    std::condition_variable done;
    bool ran = false;
    Async([&] {
      std::lock_guard lock(mutex);
      ran = true;
      done.notify_all();
    });
    std::unique_lock lock(mutex);
    ASSERT_TRUE(done.wait_for(lock, kEventTimeout, [&] { return ran; }));
  }

 private:
  void Run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      wake_.wait(lock, [&] { return stopping_ || !items_.empty(); });
      if (items_.empty()) return;
      Work work = std::move(items_.front());
      items_.pop_front();
      lock.unlock();
      work();
      lock.lock();
    }
  }

  const std::string label_ = "test.notifications";
  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<Work> items_;
  bool stopping_ = false;
  std::thread thread_;
};

// Counts handler calls per token and checks they ran on the queue's thread.
class Calls {
 public:
  explicit Calls(const ThreadQueue& queue) : queue_(queue) {}
  NotificationCenter::Handler Handler() {
    return [this](int token) {
      std::lock_guard lock(mutex_);
      ++counts_[token];
      if (std::this_thread::get_id() != queue_.ThreadId()) ++offQueue_;
    };
  }
  int Count(int token) const {
    std::lock_guard lock(mutex_);
    const auto found = counts_.find(token);
    return found == counts_.end() ? 0 : found->second;
  }
  int OffQueue() const {
    std::lock_guard lock(mutex_);
    return offQueue_;
  }

 private:
  const ThreadQueue& queue_;
  mutable std::mutex mutex_;
  std::map<int, int> counts_;
  int offQueue_ = 0;
};

class LinuxNotificationCenterTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-notify-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    defaultsPath_ = (dir_ / "com.quorvex.tavrin.toml").string();
    ioThread_ = std::thread([this] { io_.run(); });
  }
  void TearDown() override {
    center_.reset();
    work_.reset();
    ioThread_.join();  // returns only once the watchers' last completions have run
    fs::remove_all(dir_);
  }

  int RegisterDefaults() {
    int token = 0;
    EXPECT_EQ(center_->RegisterNotificationHandler(kDefaultsNotificationName, &token, queue_,
                                                   calls_.Handler()),
              kNotifyStatusOk);
    return token;
  }
  void WriteFile(const fs::path& path, const std::string& text) {
    std::ofstream(path, std::ios::trunc) << text;
  }
  // Waits until the watcher has read `events` more inotify events than `before`, then until the
  // queue has run whatever they posted.
  void SettleAfterEvents(uint64_t before, uint64_t events) {
    ASSERT_TRUE(WaitUntil([&] { return center_->GetCounters().fileEvents >= before + events; }))
        << "saw " << center_->GetCounters().fileEvents - before << " of " << events << " events";
    queue_.Drain();
  }

  asio::io_context io_;
  asio::executor_work_guard<asio::io_context::executor_type> work_ = asio::make_work_guard(io_);
  std::thread ioThread_;
  ThreadQueue queue_;
  Calls calls_{queue_};
  std::unique_ptr<LinuxNotificationCenter> center_ = std::make_unique<LinuxNotificationCenter>(io_);
  fs::path dir_;
  std::string defaultsPath_;
};

TEST_F(LinuxNotificationCenterTest, PostsReachEveryHandlerOfTheNameOnItsQueue) {
  int first = 0, second = 0, other = 0;
  ASSERT_EQ(center_->RegisterNotificationHandler("a", &first, queue_, calls_.Handler()), 0);
  ASSERT_EQ(center_->RegisterNotificationHandler("a", &second, queue_, calls_.Handler()), 0);
  ASSERT_EQ(center_->RegisterNotificationHandler("b", &other, queue_, calls_.Handler()), 0);
  EXPECT_NE(first, second);
  EXPECT_NE(first, other);
  EXPECT_NE(second, other);

  center_->Post("a");
  center_->Post("a");
  center_->Post("nobody listens");
  queue_.Drain();
  EXPECT_EQ(calls_.Count(first), 2);
  EXPECT_EQ(calls_.Count(second), 2);
  EXPECT_EQ(calls_.Count(other), 0);
  EXPECT_EQ(calls_.OffQueue(), 0);
}

TEST_F(LinuxNotificationCenterTest, CancelledRegistrationIsNotCalled) {
  int kept = 0, cancelled = 0, queuedThenCancelled = 0;
  ASSERT_EQ(center_->RegisterNotificationHandler("a", &kept, queue_, calls_.Handler()), 0);
  ASSERT_EQ(center_->RegisterNotificationHandler("a", &cancelled, queue_, calls_.Handler()), 0);
  ASSERT_EQ(
      center_->RegisterNotificationHandler("a", &queuedThenCancelled, queue_, calls_.Handler()), 0);
  center_->Cancel(cancelled);
  center_->Cancel(12345);  // unknown tokens are ignored

  // Hold the queue so the post is queued but not run when the cancel comes.
  std::mutex gate;
  std::unique_lock hold(gate);
  queue_.Async([&] { std::lock_guard wait(gate); });
  center_->Post("a");
  center_->Cancel(queuedThenCancelled);
  hold.unlock();
  queue_.Drain();

  EXPECT_EQ(calls_.Count(kept), 1);
  EXPECT_EQ(calls_.Count(cancelled), 0);
  EXPECT_EQ(calls_.Count(queuedThenCancelled), 0);
}

TEST_F(LinuxNotificationCenterTest, WritingTheDefaultsFilePosts) {
  const int token = RegisterDefaults();
  ASSERT_EQ(center_->WatchDefaults(defaultsPath_), std::nullopt);
  WriteFile(defaultsPath_, "disable_reporting = true\n");  // created
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 1; }));
  const int afterCreate = calls_.Count(token);
  WriteFile(defaultsPath_, "disable_reporting = false\n");  // rewritten in place
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) > afterCreate; }));
  EXPECT_EQ(calls_.OffQueue(), 0);
}

TEST_F(LinuxNotificationCenterTest, EditorStyleRenameOverTheFilePosts) {
  WriteFile(defaultsPath_, "device_name = \"old\"\n");
  const int token = RegisterDefaults();
  ASSERT_EQ(center_->WatchDefaults(defaultsPath_), std::nullopt);
  const fs::path temporary = dir_ / ".com.quorvex.tavrin.toml.swp";
  WriteFile(temporary, "device_name = \"new\"\n");
  fs::rename(temporary, defaultsPath_);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 1; }));

  // The watch survives the file's inode changing: a second save posts again.
  const int afterFirst = calls_.Count(token);
  WriteFile(temporary, "device_name = \"newer\"\n");
  fs::rename(temporary, defaultsPath_);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) > afterFirst; }));
}

TEST_F(LinuxNotificationCenterTest, RemovingTheFilePosts) {
  WriteFile(defaultsPath_, "disable_reporting = true\n");
  const int token = RegisterDefaults();
  ASSERT_EQ(center_->WatchDefaults(defaultsPath_), std::nullopt);
  fs::remove(defaultsPath_);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 1; }));

  // Moving it away is a removal too.
  WriteFile(defaultsPath_, "x = 1\n");
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 2; }));
  const int beforeMove = calls_.Count(token);
  fs::rename(defaultsPath_, dir_ / "saved.toml");
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) > beforeMove; }));
}

TEST_F(LinuxNotificationCenterTest, HangupSignalPosts) {
  const int token = RegisterDefaults();
  ASSERT_EQ(center_->WatchDefaults(defaultsPath_), std::nullopt);
  ASSERT_EQ(::raise(SIGHUP), 0);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 1; }));
  ASSERT_EQ(::kill(::getpid(), SIGHUP), 0);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 2; }));
  EXPECT_EQ(center_->GetCounters().signalsCaught, 2u);
  EXPECT_EQ(calls_.OffQueue(), 0);
}

TEST_F(LinuxNotificationCenterTest, RemovedDirectoryPostsOnceAndIsReported) {
  testing::FakeLogSystem log;
  const fs::path sub = dir_ / "etc";
  fs::create_directory(sub);
  const int token = RegisterDefaults();
  ASSERT_EQ(center_->WatchFile((sub / "defaults.toml").string(), kDefaultsNotificationName),
            std::nullopt);
  fs::remove(sub);
  ASSERT_TRUE(WaitUntil([&] { return calls_.Count(token) >= 1; }));
  ASSERT_TRUE(WaitUntil([&] { return log.Count("stopped watching") == 1; }));
  EXPECT_EQ(log.Matching("stopped watching")[0].level, LogLevel::kError);
}

TEST_F(LinuxNotificationCenterTest, ConcurrentPostsAndRegistrationsLoseNothing) {
  constexpr int kPosters = 4;
  constexpr int kPostsEach = 200;
  int stable = 0;
  ASSERT_EQ(center_->RegisterNotificationHandler("a", &stable, queue_, calls_.Handler()), 0);
  std::atomic<bool> stop{false};
  std::thread churn([&] {
    while (!stop.load()) {
      int token = 0;
      center_->RegisterNotificationHandler("a", &token, queue_, [](int) {});
      center_->Cancel(token);
    }
  });
  std::vector<std::thread> posters;
  for (int i = 0; i < kPosters; ++i) {
    posters.emplace_back([&] {
      for (int n = 0; n < kPostsEach; ++n) center_->Post("a");
    });
  }
  for (auto& poster : posters) poster.join();
  stop = true;
  churn.join();
  queue_.Drain();
  EXPECT_EQ(calls_.Count(stable), kPosters * kPostsEach);
  EXPECT_EQ(center_->GetCounters().posts, uint64_t(kPosters * kPostsEach));
}

}  // namespace
}  // namespace tavrin
