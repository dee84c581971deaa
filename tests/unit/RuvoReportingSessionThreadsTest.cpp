// Sessions on the real dispatcher, with real threads: the client's sends, orientation callbacks
// and back-end answers arrive from different threads at once.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/linux/dispatch/AsioDispatcher.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

using Discovery = FakeTelvoroService::Discovery;
using std::chrono::milliseconds;

// Generous: other builds share the two cores, and sanitizers slow everything down.
constexpr auto kDeadline = std::chrono::seconds(120);

size_t ThreadCount() {
  const std::filesystem::directory_iterator tasks("/proc/self/task");
  return static_cast<size_t>(std::distance(begin(tasks), end(tasks)));
}

// Polls `done` until it holds or the deadline passes; true when it held.
bool Eventually(const std::function<bool()>& done) {
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(milliseconds(2));
  }
  return true;
}

class SessionThreadsTest : public SessionTestBase {
 protected:
  SessionThreadsTest() {
    services = platform.services;
    services.dispatcher = &dispatcher;
  }
  ~SessionThreadsTest() override { dispatcher.Shutdown(); }

  AsioDispatcher dispatcher;
  PlatformServices services;
};

TEST_F(SessionThreadsTest, MessagesKeepTheirOrderWhileOrientationAndStopRunElsewhere) {
  constexpr int kSessions = 6;
  constexpr int kMessages = 300;
  constexpr int kAfterStop = 5;
  log.SetVerbose(false);
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);

  std::vector<std::shared_ptr<RuvoReportingSession>> sessions;
  for (int i = 0; i < kSessions; ++i) {
    sessions.push_back(RuvoReportingSession::create(i + 1, {100 + i}, services));
    sessions.back()->setServiceType(2);  // telephony: orientation is tracked
  }

  std::atomic<bool> clientDone{false};
  std::atomic<size_t> fired{0};
  std::thread orientation([&] {
    while (!clientDone.load()) {
      fired += platform.orientation.FireDevice("portrait");
      fired += platform.orientation.FireUI("landscape");
      std::this_thread::yield();
    }
  });
  std::thread backends([&] {
    // Answers each session's discovery as soon as it asks, from this thread.
    size_t answered = 0;
    const auto deadline = std::chrono::steady_clock::now() + kDeadline;
    while (answered < kSessions && std::chrono::steady_clock::now() < deadline) {
      answered += platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"x"});
      std::this_thread::yield();
    }
  });
  std::thread client([&] {
    for (auto& session : sessions) session->start();
    // Let orientation changes reach the started sessions while the messages go out.
    const size_t firedBefore = fired.load();
    while (fired.load() == firedBefore) std::this_thread::yield();
    for (int seq = 0; seq < kMessages; ++seq) {
      for (auto& session : sessions) session->sendMessage(Dictionary{{"seq", seq}}, 1, 1, nullptr);
    }
    for (auto& session : sessions) session->stop();
    for (int n = 0; n < kAfterStop; ++n) {
      for (auto& session : sessions) session->sendMessage(Dictionary{{"late", n}}, 1, 1, nullptr);
    }
    clientDone = true;
  });
  client.join();
  orientation.join();
  backends.join();

  ASSERT_TRUE(Eventually([&] {
    const auto created = platform.telvoro.Sessions();
    return created.size() == kSessions &&
           std::all_of(created.begin(), created.end(),
                       [](const auto& s) { return s->MessagesAtFlush().size() == 1; }) &&
           platform.telvoro.SingleMessages().size() == kSessions * kAfterStop;
  }));

  std::string allSeq;
  for (int seq = 0; seq < kMessages; ++seq) allSeq += (seq ? "," : "") + std::to_string(seq);
  int records = 0;
  for (const auto& fake : platform.telvoro.Sessions()) {
    const auto messages = fake->Messages();
    ASSERT_EQ(messages.size(), size_t{kMessages} + 1);
    for (int seq = 0; seq < kMessages; ++seq) {
      ASSERT_EQ(messages[seq].payload["seq"], seq) << fake->Description();
    }
    // The summary comes last and holds every message, in order, with the orientation records.
    const Dictionary& summary = messages.back().payload;
    EXPECT_EQ(summary["seq"], allSeq);
    EXPECT_FALSE(summary.contains("late"));
    records += summary.contains("device_orientation") || summary.contains("ui_orientation");
    if (summary.contains("device_orientation")) {
      const auto count = [&](const char* key) {
        const std::string text = summary[key].get<std::string>();
        return std::count(text.begin(), text.end(), ',');
      };
      EXPECT_EQ(count("device_orientation"), count("device_orientation_time"));
    }
    EXPECT_EQ(fake->MessagesAtFlush(), std::vector<size_t>{kMessages + 1});
  }
  EXPECT_EQ(CountMessage("failed to find backend"), 0u);
  EXPECT_GT(records, 0);

  // Nothing holds the sessions once their queued work is done and their callbacks are gone.
  std::vector<std::weak_ptr<RuvoReportingSession>> weak(sessions.begin(), sessions.end());
  sessions.clear();
  EXPECT_TRUE(Eventually([&] {
    return std::all_of(weak.begin(), weak.end(), [](const auto& s) { return s.expired(); });
  }));
  EXPECT_EQ(platform.orientation.RegisteredCount(FakeOrientationRegistry::Kind::kDevice), 0u);
}

TEST_F(SessionThreadsTest, TenThousandSessionsWaitForBackEndsWithoutThreads) {
  constexpr size_t kSessions = 10000;
  log.SetVerbose(false);
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);
  const size_t threadsBefore = ThreadCount();
  ASSERT_GT(threadsBefore, 0u);

  std::vector<std::shared_ptr<RuvoReportingSession>> sessions;
  sessions.reserve(kSessions);
  for (size_t i = 0; i < kSessions; ++i) {
    auto session = RuvoReportingSession::create(static_cast<int64_t>(i + 1), {1}, services);
    session->setServiceType(0);
    session->start();
    session->sendMessage(Dictionary{{"n", i}}, 1, 1, nullptr);
    sessions.push_back(std::move(session));
  }
  ASSERT_TRUE(Eventually([&] {
    const auto created = platform.telvoro.Sessions();
    return created.size() == kSessions &&
           std::all_of(created.begin(), created.end(),
                       [](const auto& s) { return s->DiscoveryPending(); });
  }));
  // Every session is waiting now, and the process has no more threads than before.
  EXPECT_LE(ThreadCount(), threadsBefore + 1);
  EXPECT_EQ(dispatcher.PoolThreadCount(), AsioDispatcher::kDefaultPoolThreads);

  EXPECT_EQ(platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"x"}), kSessions);
  // Each queued message went through once its queue resumed (or, on a machine slow enough to
  // pass the 9 s time-out, was dropped with its error line).
  ASSERT_TRUE(Eventually([&] {
    size_t delivered = 0;
    for (const auto& session : platform.telvoro.Sessions()) delivered += session->Messages().size();
    return delivered == kSessions || delivered + log.Count("No valid TelvoroSession") == kSessions;
  }));
  EXPECT_LE(ThreadCount(), threadsBefore + 1);
}

}  // namespace
}  // namespace tavrin::testing
