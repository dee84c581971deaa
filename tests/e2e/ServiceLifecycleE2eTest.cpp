// How the service's process ends on request and starts from a socket passed to it. The held
// start answer, the store's rows and their commit before a SIGTERM exit are covered by the
// protocol, client library and concurrent clients suites.

#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::TavrindProcess;
using testing::TestClient;

TEST(ServiceLifecycleE2eTest, KillServiceEndsTheProcessWithStatusTwoAndNoReply) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::KillService{});
  EXPECT_FALSE(client.Read(std::chrono::milliseconds(2000)).has_value());
  EXPECT_EQ(service.WaitForExit(), 2);
  EXPECT_EQ(service.LogCount("DESTROYING SERVICE"), 1u);
}

// Single messages of the "alarms" service type wait up to 59 s on a timer; a SIGTERM sends the
// ones still waiting instead of dropping them.
TEST(ServiceLifecycleE2eTest, SigtermSendsTheAlarmsMessagesStillHeldBack) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  client.Send(1, protocol::CreateReportingSession{21});
  client.Send(2, protocol::SetServiceType{4, 21});  // alarms; never started: single messages
  constexpr int kMessages = 20;  // each waits a random 0..59 s: all of them at once is unlikely
  for (int i = 0; i < kMessages; ++i) {
    client.Send(3 + i,
                protocol::SendMessage{Dictionary{{"alarm", i}}, 1, 0, std::vector<int64_t>{21}});
  }
  for (int i = 0; i < 2 + kMessages; ++i) ASSERT_TRUE(client.Read()) << service.Log();
  EXPECT_EQ(service.Stop(), 0) << service.Log();
  EXPECT_EQ(testing::QueryStore(service.DatabasePath(), "SELECT count(*) FROM single_messages"),
            (std::vector<std::vector<std::string>>{{std::to_string(kMessages)}}))
      << service.Log();
  EXPECT_EQ(service.LogCount("held-back single message(s) now"), 1u) << service.Log();
}

TEST(ServiceLifecycleE2eTest, SocketActivationServesThePassedSocketAndLeavesItsOwnPathAlone) {
  const std::string directory = testing::MakeTempDirectory("tavrin-activation-");
  const std::string path = directory + "/activated.sock";
  const int fd = testing::BindUnixSocket(path, true);
  ASSERT_GE(fd, 0);
  TavrindProcess service;
  ASSERT_TRUE(service.StartActivated(fd, path)) << service.Log();
  ::close(fd);
  TestClient client(path);
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
