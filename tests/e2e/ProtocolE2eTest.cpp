#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <fstream>

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

TEST(ProtocolE2eTest, TwoClientsSharingAnIdAndTheDoubleAnswerForReporterZero) {
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

  b.Send(3, protocol::GetServiceNameForReporterID{0});
  auto first = MustRead(b, service);
  auto second = MustRead(b, service);
  EXPECT_EQ(first.call, 3u);
  EXPECT_EQ(second.call, 3u);
  EXPECT_EQ(protocol::ServiceTypeReplyValue(first.value), std::optional<uint16_t>(0xFFFF));
  EXPECT_EQ(protocol::ServiceTypeReplyValue(second.value), std::optional<uint16_t>(0xFFFF));

  a.Send(3, protocol::StopReportingSessionForID{7});
  EXPECT_EQ(MustRead(a, service).call, 2u);
  EXPECT_EQ(MustRead(a, service).call, 3u);
}

TEST(ProtocolE2eTest, DisabledReportingRefusesMessagesUntilTheSettingIsRemoved) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient a(service.SocketPath());
  TestClient b(service.SocketPath());
  a.Send(1, protocol::CreateReportingSession{7});
  MustRead(a, service);

  WriteFileAtomically(service.DefaultsPath(), "disable_reporting = true\n");
  ASSERT_TRUE(service.WaitForLog("re-reading tavrin defaults")) << service.Log();
  b.Send(1, protocol::SendMessage{Dictionary{{"x", 1}}, 1, 0, std::vector<int64_t>{7}});
  auto refused = MustRead(b, service);
  EXPECT_EQ(refused.status, Status::kOperationError);
  EXPECT_EQ(refused.value["domain"], "com.quorvex.audio.reporting");
  EXPECT_EQ(refused.value["code"], 1);
  b.Send(2, protocol::ReporterIDValid{7});
  EXPECT_EQ(MustRead(b, service).value, (Value{{"reporterID", 0}, {"serviceType", 0xFFFF}}));

  WriteFileAtomically(service.DefaultsPath(), "device_name = \"hall\"\n");
  ASSERT_TRUE(service.WaitForLog("re-reading tavrin defaults", 2)) << service.Log();
  b.Send(3, protocol::SendMessage{Dictionary{{"x", 2}}, 1, 0, std::vector<int64_t>{7}});
  auto accepted = MustRead(b, service);
  EXPECT_EQ(accepted.status, Status::kOk);
  EXPECT_TRUE(protocol::IsNilReplyValue(accepted.value));
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
  client.Send(3,
              protocol::SetConfiguration{Dictionary{{"HostApplicationDisplayID", "player"}}, 21});
  client.Send(4, protocol::StartReportingSessionForID{21});
  // Requests run in order: once this one is answered, the start has taken its snapshot.
  client.Send(40, protocol::GetAllReporters{});
  for (uint64_t call : {1, 2, 3, 40}) EXPECT_EQ(MustRead(client, service).call, call);
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
  std::vector<std::filesystem::path> files;
  for (const auto& entry :
       std::filesystem::directory_iterator(root + "/log/DiagnosticLogs/Audio/Reporting")) {
    files.push_back(entry.path());
  }
  ASSERT_EQ(files.size(), 1u);
  const std::string name = files[0].filename().string();
  EXPECT_NE(name.find("-tavrin-player-haptics.json"), std::string::npos) << name;
  std::ifstream in(files[0]);
  const Value summary = Value::parse(in);
  ASSERT_TRUE(summary.is_array());
  EXPECT_EQ(summary[0]["HostApplicationDisplayID"], "player");  // the user info comes first
  ASSERT_GE(summary.size(), 3u);
  EXPECT_EQ(summary[1].begin().key(), "Generic_Generic_1");
  const auto mode =
      std::filesystem::status(root + "/log/DiagnosticLogs/Audio/Reporting").permissions();
  // Never world-writable, so no other local user can forge or delete summaries.
  EXPECT_EQ(mode & std::filesystem::perms::all, std::filesystem::perms(0750));
}

}  // namespace
}  // namespace tavrin
