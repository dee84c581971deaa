// libtavrin against the real service: every operation, the answers that come twice, late or
// never, the service going away, and the errors a user sees.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <thread>

#include "tavrin/Client.h"
#include "tests/fakes/GuardedState.h"
#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using client::Client;
using client::Done;
using client::Errc;
using client::Result;
using client::Session;
using testing::TavrindProcess;

constexpr auto kWait = std::chrono::milliseconds(10000);

// Collects the answers an asynchronous handler is given, from the reader thread.
template <typename T>
class Answers : GuardedState {
 public:
  client::ReplyHandler<T> Handler() {
    return [this](Result<T> result) {
      std::lock_guard lock(mutex_);
      results_.push_back(std::move(result));
    };
  }
  size_t Count() const { return Locked(results_).size(); }
  Result<T> At(size_t i) const { return Locked(results_).at(i); }

 private:
  std::vector<Result<T>> results_;  // guarded by mutex_
};

// The error code of a call that failed; none for one that succeeded.
template <typename T>
std::optional<Errc> Failure(const Result<T>& result) {
  return result ? std::nullopt : std::optional(result.error().code);
}

int64_t MessageRows(const TavrindProcess& service, int64_t reporter, uint32_t category) {
  return testing::StoreCount(service.DatabasePath(),
                             "session_messages WHERE reporter_id = " + std::to_string(reporter) +
                                 " AND category = " + std::to_string(category));
}

// One service and one connected client for each case.
class ClientLibraryE2eTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(service.Start()) << service.Log();
    auto connected = Client::Connect({service.SocketPath(), kWait});
    ASSERT_TRUE(connected) << connected.error().message;
    client = std::move(connected.value());
  }

  TavrindProcess service;
  std::unique_ptr<Client> client;
};

TEST_F(ClientLibraryE2eTest, EveryOperationAgainstTheService) {
  const int64_t id = 4242;

  ASSERT_EQ(client->createReportingSession(id, kWait).value(), true);
  ASSERT_EQ(client->setServiceType(7, id, kWait).value(), true);
  EXPECT_EQ(client->getServiceNameForReporterID(id, kWait).value(), 7);
  ASSERT_EQ(client->setConfiguration({{"route", "speaker"}}, id, kWait).value(), true);

  Answers<bool> started;
  client->startReportingSessionForID(id, started.Handler());
  // Requests run in order: once this is answered the start has run and holds its answer.
  EXPECT_EQ(client->reporterID(id, kWait).value(), (client::Validity{id, 7}));
  EXPECT_EQ(started.Count(), 0u);

  EXPECT_TRUE(client->sendMessage({{"xruns", 2}}, 5, 1, std::vector<int64_t>{id}, kWait));
  ASSERT_TRUE(client->sendMessage({{"xruns", 3}}, 5, 1));  // fire-and-forget, to every session
  Answers<Done> sent;
  client->sendMessage({{"xruns", 4}}, 5, 1, std::nullopt, sent.Handler());

  EXPECT_THAT(client->getAllReporters(kWait).value(), ::testing::Contains(id));
  EXPECT_EQ(sent.Count(), 1u);  // answered before the later call
  EXPECT_TRUE(sent.At(0));

  ASSERT_EQ(client->stopReportingSessionForID(id, kWait).value(), true);
  ASSERT_TRUE(testing::WaitUntil([&] { return started.Count() == 1; }));
  EXPECT_EQ(started.At(0).value(), true);
  ASSERT_EQ(client->destroyReportingSession(id, kWait).value(), true);
  EXPECT_EQ(client->reporterID(id, kWait).value(), (client::Validity{0, 0xFFFF}));
  EXPECT_EQ(client->pendingCalls(), 0u);

  EXPECT_TRUE(testing::WaitUntil([&] { return MessageRows(service, id, 5) == 3; }))
      << MessageRows(service, id, 5);
}

TEST_F(ClientLibraryE2eTest, AnswersThatComeTwiceLateOrNever) {
  // Reporter ID 0 is answered twice; both reach the handler, and nothing stays pending.
  Answers<uint16_t> names;
  client->getServiceNameForReporterID(0, names.Handler());
  ASSERT_TRUE(client->getAllReporters(kWait));
  ASSERT_EQ(names.Count(), 2u);
  EXPECT_EQ(names.At(0).value(), 0xFFFF);
  EXPECT_EQ(names.At(1).value(), 0xFFFF);
  EXPECT_EQ(client->getServiceNameForReporterID(0, kWait).value(), 0xFFFF);

  // A held start whose session is destroyed, or replaced by a new one under the same ID, is
  // never answered by the service: the library ends it then.
  for (const bool replace : {false, true}) {
    ASSERT_TRUE(client->createReportingSession(12, kWait));
    Answers<bool> start;
    client->startReportingSessionForID(12, start.Handler());
    ASSERT_TRUE(replace ? client->createReportingSession(12, kWait)
                        : client->destroyReportingSession(12, kWait));
    ASSERT_EQ(start.Count(), 1u) << replace;
    EXPECT_EQ(start.At(0).error().code, Errc::kNoReply) << replace;
  }
  // The new session's own start is held as usual and answered by the stop.
  Answers<bool> newStart;
  client->startReportingSessionForID(12, newStart.Handler());
  ASSERT_TRUE(client->stopReportingSessionForID(12, kWait));
  ASSERT_EQ(newStart.Count(), 1u);
  EXPECT_EQ(newStart.At(0).value(), true);

  // A blocking start waits for the held answer; its time-out forgets the call, and the late
  // answer (at the stop) finds no one and harms nothing.
  ASSERT_TRUE(client->createReportingSession(13, kWait));
  EXPECT_EQ(Failure(client->startReportingSessionForID(13, std::chrono::milliseconds(100))),
            Errc::kTimedOut);
  EXPECT_EQ(client->pendingCalls(), 0u);
  ASSERT_TRUE(client->stopReportingSessionForID(13, kWait));
  EXPECT_TRUE(client->getAllReporters(kWait));

  // A start held when the client closes is ended with the connection.
  ASSERT_TRUE(client->createReportingSession(14, kWait));
  Answers<bool> openAtClose;
  client->startReportingSessionForID(14, openAtClose.Handler());
  ASSERT_TRUE(client->getAllReporters(kWait));
  client->Close();
  ASSERT_EQ(openAtClose.Count(), 1u);
  EXPECT_EQ(openAtClose.At(0).error().code, Errc::kConnectionLost);
  EXPECT_EQ(client->pendingCalls(), 0u);
  EXPECT_EQ(Failure(client->getAllReporters(kWait)), Errc::kConnectionLost);
}

TEST_F(ClientLibraryE2eTest, TheServiceGoingAwayEndsEveryWaitingCallAtOnce) {
  ASSERT_TRUE(client->createReportingSession(21, kWait));

  // A blocking start on another thread waits for the held answer, with a long time-out.
  std::optional<Result<bool>> blocked;
  std::thread waiting([&] { blocked = client->startReportingSessionForID(21, kWait * 6); });
  ASSERT_TRUE(testing::WaitUntil([&] { return client->pendingCalls() == 1; }));
  const auto killedAt = std::chrono::steady_clock::now();
  ASSERT_EQ(service.Stop(SIGKILL), 128 + SIGKILL);
  waiting.join();
  EXPECT_LT(std::chrono::steady_clock::now() - killedAt, kWait);
  ASSERT_TRUE(blocked.has_value());
  ASSERT_EQ(Failure(*blocked), Errc::kConnectionLost);
  EXPECT_NE(blocked->error().message.find(service.SocketPath()), std::string::npos);
  EXPECT_FALSE(client->connected());

  EXPECT_EQ(Failure(client->sendMessage({{"a", 1}}, 1, 1)), Errc::kConnectionLost);
}

TEST(ClientLibraryWithoutServiceTest, TheSocketPathAndWhyNoServiceAnswersThere) {
  ::setenv("TAVRIN_SOCKET", "/tmp/from-env.sock", 1);
  ::setenv("TAVRIN_ROOT", "/tmp/root", 1);
  EXPECT_EQ(client::ResolveSocketPath("/tmp/given.sock"), "/tmp/given.sock");
  EXPECT_EQ(client::ResolveSocketPath(), "/tmp/from-env.sock");
  ::setenv("TAVRIN_SOCKET", "", 1);
  EXPECT_EQ(client::ResolveSocketPath(), "/tmp/root/run/reporting.sock");
  ::unsetenv("TAVRIN_SOCKET");
  ::unsetenv("TAVRIN_ROOT");
  EXPECT_EQ(client::ResolveSocketPath(), client::kDefaultSocketPath);

  const std::string directory = testing::MakeTempDirectory("tavrin-client-");
  auto missing = Client::Connect({directory + "/run/reporting.sock"});
  ASSERT_EQ(Failure(missing), Errc::kNotRunning);
  EXPECT_NE(missing.error().message.find(directory + "/run/reporting.sock"), std::string::npos);
  EXPECT_NE(missing.error().message.find("TAVRIN_SOCKET"), std::string::npos);
  // A socket file left behind by a service that is gone: nothing listens.
  const int stale = testing::BindUnixSocket(directory + "/stale.sock", false);
  ASSERT_GE(stale, 0);
  ::close(stale);
  EXPECT_EQ(Failure(Client::Connect({directory + "/stale.sock"})), Errc::kNotRunning);
  EXPECT_EQ(Failure(Client::Connect({"/" + std::string(200, 'x')})), Errc::kInvalidArgument);
  std::filesystem::remove_all(directory);
}

TEST_F(ClientLibraryE2eTest, BadRequestsAndRefusalsAreErrorsAndTheConnectionStaysUsable) {
  EXPECT_EQ(Failure(client->sendMessage(client::Dictionary::array({1, 2}), 1, 1)),
            Errc::kInvalidArgument);

  client::Dictionary huge{{"blob", std::string(protocol::kDefaultFrameLimit, 'x')}};
  auto tooBig = client->sendMessage(huge, 1, 1, std::nullopt, kWait);
  ASSERT_EQ(Failure(tooBig), Errc::kInvalidArgument);
  EXPECT_NE(tooBig.error().message.find("frame limit"), std::string::npos);

  // A value MessagePack can carry but the protocol refuses: the service answers status 2.
  auto binary = client->sendMessage({{"raw", client::Dictionary::binary({1, 2, 3})}}, 1, 1,
                                    std::nullopt, kWait);
  ASSERT_EQ(Failure(binary), Errc::kRejected);
  EXPECT_EQ(binary.error().domain, protocol::kProtocolErrorDomain);
  EXPECT_EQ(binary.error().serviceCode, 6);

  EXPECT_TRUE(client->connected());
  EXPECT_TRUE(client->createReportingSession(31, kWait));
}

TEST_F(ClientLibraryE2eTest, BlockingCallInsideAHandlerIsRefusedInsteadOfHanging) {
  std::atomic<int> nested{-1};
  client->getAllReporters([&](Result<std::vector<int64_t>>) {
    auto inner = client->createReportingSession(1, kWait);
    nested = inner ? 0 : static_cast<int>(inner.error().code);
  });
  ASSERT_TRUE(testing::WaitUntil([&] { return nested.load() != -1; }));
  EXPECT_EQ(nested.load(), static_cast<int>(Errc::kWouldDeadlock));
}

TEST_F(ClientLibraryE2eTest, ConcurrentCallersShareOneConnection) {
  constexpr int kThreads = 4;
  constexpr int kMessages = 50;
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      const int64_t id = 500 + t;
      if (!client->createReportingSession(id, kWait)) ++failures;
      for (int i = 0; i < kMessages; ++i) {
        if (!client->sendMessage({{"i", i}}, 3, 0, std::vector<int64_t>{id}, kWait)) ++failures;
      }
      if (!client->destroyReportingSession(id, kWait)) ++failures;
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(client->pendingCalls(), 0u);
}

TEST_F(ClientLibraryE2eTest, SessionHelperStopsAndDestroysOnScopeExit) {
  int64_t id = 0;
  {
    Session::Options options;
    options.serviceType = 3;
    options.configuration = {{"route", "headphones"}};
    auto opened = Session::Open(*client, 0, options);
    ASSERT_TRUE(opened) << opened.error().message;
    Session session = std::move(opened.value());
    id = session.reporterID();
    EXPECT_NE(id, 0);
    EXPECT_EQ(client->getServiceNameForReporterID(id, kWait).value(), 3);
    for (int i = 0; i < 3; ++i) ASSERT_TRUE(session.send({{"n", i}}, 8, 2));
    EXPECT_TRUE(session.send({{"n", 3}}, 8, 2, kWait));
  }
  EXPECT_EQ(client->reporterID(id, kWait).value(), (client::Validity{0, 0xFFFF}));
  EXPECT_EQ(client->pendingCalls(), 0u);
  EXPECT_TRUE(testing::WaitUntil([&] { return MessageRows(service, id, 8) == 4; }));
  // The stop wrote the session's summary through its own path.
  EXPECT_TRUE(testing::WaitUntil([&] { return MessageRows(service, id, 0xFFFF) == 1; }));
}

TEST_F(ClientLibraryE2eTest, KillServiceIsAnsweredByTheServiceEnding) {
  auto killed = client->killService(kWait);
  EXPECT_TRUE(killed) << killed.error().message;
  EXPECT_EQ(service.WaitForExit(), 2);
  EXPECT_EQ(service.LogCount("DESTROYING SERVICE"), 1u);
  EXPECT_FALSE(client->connected());
}

}  // namespace
}  // namespace tavrin
