#include <gtest/gtest.h>
#include <sqlite3.h>

#include <csignal>

#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using protocol::Status;
using testing::TavrindProcess;
using testing::TestClient;

int64_t CountRows(const std::string& database, const std::string& sql) {
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    sqlite3_close(db);
    return -1;
  }
  sqlite3_stmt* statement = nullptr;
  int64_t count = -1;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK &&
      sqlite3_step(statement) == SQLITE_ROW) {
    count = sqlite3_column_int64(statement, 0);
  }
  sqlite3_finalize(statement);
  sqlite3_close(db);
  return count;
}

TEST(ServiceLifecycleE2eTest, HeldStartReplyArrivesAtStopAndRowsLandInTheStore) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  ASSERT_TRUE(client.connected());

  client.Send(1, protocol::CreateReportingSession{7});
  client.Send(2, protocol::SetServiceType{2, 7});
  client.Send(3, protocol::StartReportingSessionForID{7});
  for (int i = 0; i < 3; ++i) {
    client.Send(10 + i, protocol::SendMessage{Dictionary{{"engine on time", i}}, 0x80000001, 1,
                                              std::vector<int64_t>{7}});
  }
  client.Send(4, protocol::StopReportingSessionForID{7});

  std::vector<uint64_t> order;
  for (int i = 0; i < 7; ++i) {
    auto reply = client.Read();
    ASSERT_TRUE(reply) << service.Log();
    EXPECT_EQ(reply->status, Status::kOk);
    order.push_back(reply->call);
  }
  // The start reply (3) is held until the stop runs and comes just before the stop's own reply.
  EXPECT_EQ(order, (std::vector<uint64_t>{1, 2, 10, 11, 12, 3, 4}));

  client.Close();
  EXPECT_EQ(service.Stop(SIGTERM), 0) << service.Log();
  // Three client messages and the summary event, all committed before the exit.
  EXPECT_EQ(CountRows(service.DatabasePath(),
                      "SELECT COUNT(*) FROM session_messages WHERE reporter_id = 7"),
            4);
  // Client messages keep their low 16 category bits and cleaned keys; the summary is 0xFFFF/0xFFFF.
  EXPECT_EQ(CountRows(service.DatabasePath(),
                      "SELECT COUNT(*) FROM session_messages WHERE category = 1 AND type = 1 AND "
                      "payload LIKE '%engine_on_time%'"),
            3);
  EXPECT_EQ(CountRows(service.DatabasePath(),
                      "SELECT COUNT(*) FROM session_messages WHERE category = 65535 AND type = "
                      "65535 AND payload LIKE '%\"Ruvo_Session_Summary_Event\":\"2\"%'"),
            1);
  EXPECT_EQ(CountRows(service.DatabasePath(), "SELECT COUNT(*) FROM sessions"), 1);
}

TEST(ServiceLifecycleE2eTest, KillServiceEndsTheProcessWithStatusTwoAndNoReply) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::KillService{});
  EXPECT_FALSE(client.Read(std::chrono::milliseconds(2000)).has_value());
  EXPECT_EQ(service.WaitForExit(), 2);
  EXPECT_EQ(service.LogCount("DESTROYING SERVICE"), 1u);
}

TEST(ServiceLifecycleE2eTest, SocketActivationServesThePassedSocketAndLeavesItsOwnPathAlone) {
  const std::string directory = testing::MakeTempDirectory("tavrin-activation-");
  const std::string path = directory + "/activated.sock";
  const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
  ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
  ASSERT_EQ(::listen(fd, 16), 0);

  TavrindProcess service;
  ASSERT_TRUE(service.StartActivated(fd, path)) << service.Log();
  ::close(fd);
  TestClient client(path);
  ASSERT_TRUE(client.connected());
  client.Send(5, protocol::CreateReportingSession{11});
  auto reply = client.Read();
  ASSERT_TRUE(reply) << service.Log();
  EXPECT_EQ(reply->call, 5u);
  EXPECT_EQ(protocol::BoolReplyValue(reply->value), std::optional<bool>(true));
  EXPECT_EQ(service.LogCount("(socket activation)"), 1u);
  EXPECT_FALSE(std::filesystem::exists(service.root() + "/run/reporting.sock"));
  EXPECT_EQ(service.Stop(SIGINT), 0) << service.Log();
  std::filesystem::remove_all(directory);
}

}  // namespace
}  // namespace tavrin
