#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using protocol::Status;
using testing::QueryStoreColumn;
using testing::TavrindProcess;
using testing::TestClient;
using testing::WriteFileAtomically;

protocol::Reply MustRead(TestClient& client, const TavrindProcess& service) {
  auto reply = client.Read();
  EXPECT_TRUE(reply) << service.Log();
  return reply.value_or(protocol::Reply{});
}

TEST(ProtocolE2eTest, TwoClientsSharingAnIdLeaveTheHeldStartToItsOwner) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient a(service.SocketPath());
  TestClient b(service.SocketPath());
  a.Send(1, protocol::CreateReportingSession{7});
  a.Send(2, protocol::StartReportingSessionForID{7});
  EXPECT_EQ(MustRead(a, service).call, 1u);
  b.Send(1, protocol::StartReportingSessionForID{7});  // A's session, already started
  b.Send(2, protocol::StopReportingSessionForID{7});   // not B's to stop
  EXPECT_EQ(MustRead(b, service).call, 1u);
  EXPECT_EQ(MustRead(b, service).call, 2u);
  // A's start reply is still held.
  EXPECT_FALSE(a.Read(std::chrono::milliseconds(300)).has_value());

  a.Send(3, protocol::StopReportingSessionForID{7});
  EXPECT_EQ(MustRead(a, service).call, 2u);
  EXPECT_EQ(MustRead(a, service).call, 3u);
}

TEST(ProtocolE2eTest, BroadcastReachesRunningSessionsOrGoesStandaloneAndEmptyListsSendNothing) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::SendMessage{Dictionary{{"alone", 1}}, 3, 0, std::nullopt});
  client.Send(2, protocol::SendMessage{Dictionary{{"nobody", 1}}, 3, 0, std::vector<int64_t>{}});
  client.Send(3,
              protocol::SendMessage{Dictionary{{"nobody", 2}}, 3, 0, std::vector<int64_t>{0, 5}});
  client.Send(4, protocol::CreateReportingSession{9});
  client.Send(5, protocol::StartReportingSessionForID{9});
  client.Send(6, protocol::SendMessage{Dictionary{{"everyone", 1}}, 3, 0, std::nullopt});
  client.Send(7, protocol::StopReportingSessionForID{9});
  for (uint64_t call : {1, 2, 3, 4, 6, 5, 7}) EXPECT_EQ(MustRead(client, service).call, call);
  const std::string db = service.DatabasePath();
  // Replies mean accepted: wait for delivery (the session's back-end wait may still be running).
  EXPECT_TRUE(testing::WaitUntil([&] {
    return !QueryStoreColumn(
                db, "SELECT 1 FROM session_messages WHERE reporter_id = 9 AND category = 3")
                .empty();
  }));
  EXPECT_EQ(service.Stop(SIGTERM), 0);

  auto singles =
      QueryStoreColumn(db,
                       "SELECT json_extract(user_info, '$.ServiceName') || ' ' || payload "
                       "FROM single_messages");
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0], "standalone {\"alone\":1}");
  EXPECT_EQ(QueryStoreColumn(db,
                             "SELECT payload FROM session_messages WHERE reporter_id = 9 AND "
                             "category = 3"),
            (std::vector<std::string>{"{\"everyone\":1}"}));
  EXPECT_TRUE(QueryStoreColumn(db,
                               "SELECT 1 FROM session_messages WHERE payload LIKE '%nobody%' UNION "
                               "SELECT 1 FROM single_messages WHERE payload LIKE '%nobody%'")
                  .empty());
}

TEST(ProtocolE2eTest, DriverStatisticsAtStopAndTheSummaryFileOfAnInternalBuild) {
  const std::string root = testing::MakeTempDirectory("tavrin-e2e-");
  WriteFileAtomically(root + "/driverstats/Speaker/xruns", "5\n");
  WriteFileAtomically(root + "/driverstats/Haptics/Stats/actuations", "100\n");
  WriteFileAtomically(root + "/etc/device.toml", "InternalBuild = true\n");
  TavrindProcess service({}, root);
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::CreateReportingSession{21});
  client.Send(2, protocol::SetServiceType{3, 21});
  client.Send(4, protocol::StartReportingSessionForID{21});
  // Requests run in order: once this one is answered, the start has taken its snapshot.
  client.Send(40, protocol::GetAllReporters{});
  for (uint64_t call : {1, 2, 40}) EXPECT_EQ(MustRead(client, service).call, call);
  WriteFileAtomically(root + "/driverstats/Speaker/xruns", "9\n");  // +4; actuations unchanged
  client.Send(5, protocol::SendMessage{Dictionary{{"a", 1}}, 1, 0, std::vector<int64_t>{21}});
  client.Send(6, protocol::StopReportingSessionForID{21});
  for (uint64_t call : {5, 4, 6}) EXPECT_EQ(MustRead(client, service).call, call);
  EXPECT_TRUE(testing::WaitUntil([&] {
    return !QueryStoreColumn(service.DatabasePath(),
                             "SELECT 1 FROM session_messages WHERE category = 9")
                .empty();
  })) << service.Log();
  EXPECT_EQ(service.Stop(SIGTERM), 0);

  EXPECT_EQ(
      QueryStoreColumn(service.DatabasePath(),
                       "SELECT payload FROM session_messages WHERE category = 9 AND type = 0"),
      (std::vector<std::string>{"{\"Speaker_xruns\":4}"}));
  // One summary file, in a directory no other local user can write to, so none can forge or
  // delete summaries (its name and content are checked through tavrinctl's e2e suite).
  const std::string summaries = root + "/log/DiagnosticLogs/Audio/Reporting";
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(summaries), {}), 1);
  EXPECT_EQ(std::filesystem::status(summaries).permissions() & std::filesystem::perms::all,
            std::filesystem::perms(0750));
}

}  // namespace
}  // namespace tavrin
