#include <gtest/gtest.h>
#include <sys/prctl.h>

#include <atomic>
#include <csignal>
#include <thread>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::QueryStore;
using testing::TavrindProcess;
using testing::TestClient;

protocol::Reply MustRead(TestClient& client, const TavrindProcess& service) {
  auto reply = client.Read();
  EXPECT_TRUE(reply) << service.Log();
  return reply.value_or(protocol::Reply{});
}

TEST(ClientsE2eTest, ClientKilledMidSessionIsCleanedUpOnceAndItsUptimeRecorded) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  int ready[2];
  ASSERT_EQ(::pipe(ready), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    ::prctl(PR_SET_NAME, "killedclient");
    TestClient client(service.SocketPath());
    client.Send(1, protocol::CreateReportingSession{77});
    client.Send(2, protocol::StartReportingSessionForID{77});
    client.Send(3, protocol::SendMessage{Dictionary{{"level", 3}}, 2, 0, std::vector<int64_t>{77}});
    client.Read();  // create
    client.Read();  // message accepted: the start ran before it
    const char byte = 1;
    if (::write(ready[1], &byte, 1) != 1) ::_exit(1);
    ::pause();
    ::_exit(0);
  }
  char byte = 0;
  ASSERT_EQ(::read(ready[0], &byte, 1), 1);
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  ::close(ready[0]);
  ::close(ready[1]);

  const std::string removed = "removing " + std::to_string(child) + " from the server client list";
  ASSERT_TRUE(service.WaitForLog(removed)) << service.Log();
  EXPECT_EQ(service.Stop(SIGTERM), 0);
  EXPECT_EQ(service.LogCount(removed), 1u);
  // The clean-up stopped the session: its summary went out through its own path.
  auto summaries = QueryStore(service.DatabasePath(),
                              "SELECT payload FROM session_messages WHERE reporter_id = 77 AND "
                              "category = 65535");
  ASSERT_EQ(summaries.size(), 1u);
  EXPECT_NE(summaries[0][0].find("\"level\":\"3\""), std::string::npos);
  auto uptime = QueryStore(service.DatabasePath(),
                           "SELECT payload FROM analytics_events WHERE name = "
                           "'com.quorvex.tavrin.ruvoreportingclientuptime' AND payload LIKE "
                           "'%killedclient%'");
  // Only the killed client's event, under its process name (an end between frames is an
  // invalidation, as the bad input suite shows): the harness's start-up probe is a client too.
  ASSERT_EQ(uptime.size(), 1u);
  EXPECT_NE(uptime[0][0].find("\"processName\":\"killedclient\""), std::string::npos);
}

TEST(ClientsE2eTest, FiftyConcurrentClientsLoseNoMessageAndGetStartBeforeStop) {
  constexpr int kClients = 50;
  constexpr int kMessages = 100;
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int c = 0; c < kClients; ++c) {
    threads.emplace_back([&, c] {
      const int64_t id = 1000 + c;
      TestClient client(service.SocketPath());
      client.Send(1, protocol::CreateReportingSession{id});
      client.Send(2, protocol::StartReportingSessionForID{id});
      for (int m = 0; m < kMessages; ++m) {
        client.Send(100 + m, protocol::SendMessage{Dictionary{{"n", m}, {"client", c}}, 1, 0,
                                                   std::vector<int64_t>{id}});
      }
      client.Send(3, protocol::StopReportingSessionForID{id});
      std::vector<uint64_t> calls;
      for (int r = 0; r < kMessages + 3; ++r) {
        auto reply = client.Read();
        if (!reply) break;
        calls.push_back(reply->call);
      }
      const bool complete = calls.size() == size_t(kMessages + 3);
      const bool startBeforeStop = complete && calls[calls.size() - 2] == 2 && calls.back() == 3;
      if (!complete || !startBeforeStop) failures.fetch_add(1);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(service.Stop(SIGTERM), 0) << service.Log();

  auto perReporter =
      QueryStore(service.DatabasePath(),
                 "SELECT reporter_id, COUNT(*), COUNT(DISTINCT json_extract(payload, "
                 "'$.n')) FROM session_messages WHERE category = 1 GROUP BY reporter_id");
  ASSERT_EQ(perReporter.size(), size_t(kClients));
  for (const auto& row : perReporter) {
    EXPECT_EQ(row[1], std::to_string(kMessages)) << "reporter " << row[0];
    EXPECT_EQ(row[2], std::to_string(kMessages)) << "reporter " << row[0];
  }
}

// What the running service adds to a client's session: the driver counters it reads under its
// root at start and stop.
TEST(ClientsE2eTest, AStoppedSessionCarriesTheDriverCountersReadUnderTheRoot) {
  TavrindProcess service;
  const std::string counters = service.root() + "/driverstats";
  testing::WriteFileAtomically(counters + "/Speaker/xruns", "5\n");
  testing::WriteFileAtomically(counters + "/Haptics/Stats/actuations", "100\n");
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::CreateReportingSession{21});
  client.Send(2, protocol::SetServiceType{3, 21});
  client.Send(4, protocol::StartReportingSessionForID{21});
  // Requests run in order: once this one is answered, the start has taken its snapshot.
  client.Send(40, protocol::GetAllReporters{});
  for (uint64_t call : {1, 2, 40}) EXPECT_EQ(MustRead(client, service).call, call);
  testing::WriteFileAtomically(counters + "/Speaker/xruns", "9\n");  // +4; actuations unchanged
  client.Send(5, protocol::SendMessage{Dictionary{{"a", 1}}, 1, 0, std::vector<int64_t>{21}});
  client.Send(6, protocol::StopReportingSessionForID{21});
  for (uint64_t call : {5, 4, 6}) EXPECT_EQ(MustRead(client, service).call, call);
  // An orderly stop commits everything before the process ends.
  EXPECT_EQ(service.Stop(SIGTERM), 0);

  EXPECT_EQ(testing::QueryStoreColumn(
                service.DatabasePath(),
                "SELECT payload FROM session_messages WHERE category = 9 AND type = 0"),
            (std::vector<std::string>{"{\"Speaker_xruns\":4}"}));
}

}  // namespace
}  // namespace tavrin
