// How the service's process stops, recovers after a kill, talks to its service manager and starts
// from a socket passed to it. killService's exit is in the client library suite; the held start
// answer, the store's rows and their commit before a SIGTERM exit are covered by the protocol,
// client library and concurrent clients suites.

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <functional>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::TavrindProcess;
using testing::TestClient;

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
  EXPECT_EQ(testing::StoreCount(service.DatabasePath(), "single_messages"), kMessages)
      << service.Log();
  EXPECT_EQ(service.LogCount("held-back single message(s) now"), 1u) << service.Log();
  EXPECT_EQ(service.LogCount("still queued"), 0u) << "an orderly stop drained everything";
}

// A session open when the service is killed: the next start sends its summary, marked as
// recovered in the store, covering every message the store had committed, writes its summary
// file and removes the spool it came from.
TEST(ServiceLifecycleE2eTest, AfterSigkillTheNextStartSendsTheOpenSessionsSummary) {
  TavrindProcess service;
  testing::WriteFileAtomically(service.root() + "/etc/device.toml", "InternalBuild = true\n");
  ASSERT_TRUE(service.Start()) << service.Log();
  constexpr int kMessages = 300;
  // The client stays connected: a client that goes away has its sessions stopped.
  TestClient client(service.SocketPath());
  client.Send(1, protocol::CreateReportingSession{21});
  client.Send(2, protocol::SetServiceType{3, 21});
  client.Send(3, protocol::StartReportingSessionForID{21});
  for (int i = 0; i < kMessages; ++i) {
    client.Send(10 + i, protocol::SendMessage{Dictionary{{"n", i}, {"text", std::string(600, 'x')}},
                                              1, 0, std::vector<int64_t>{21}});
  }
  // The start's answer is held until the session stops, which it never does here.
  for (int i = 0; i < 2 + kMessages; ++i) ASSERT_TRUE(client.Read()) << service.Log();
  const auto stored = [&] {
    return testing::StoreCount(service.DatabasePath(),
                               "session_messages WHERE reporter_id = 21 AND category = 1");
  };
  ASSERT_TRUE(testing::WaitUntil([&] { return stored() == kMessages; }))
      << stored() << service.Log();
  ::kill(service.pid(), SIGKILL);
  ASSERT_EQ(service.WaitForExit(), 128 + SIGKILL);

  ASSERT_TRUE(service.Start()) << service.Log();
  const std::string summary =
      "SELECT m.payload FROM session_messages m JOIN sessions s ON m.session_row = s.row "
      "WHERE s.recovered = 1 AND s.reporter_id = 21 AND m.type = 65535";
  ASSERT_TRUE(testing::WaitUntil([&] {
    return !testing::QueryStoreColumn(service.DatabasePath(), summary).empty();
  })) << service.Log();
  EXPECT_EQ(service.Stop(), 0) << service.Log();

  const auto rows = testing::QueryStoreColumn(service.DatabasePath(), summary);
  ASSERT_EQ(rows.size(), 1u);
  const Value event = Value::parse(rows[0]);
  std::string numbers;
  for (int i = 0; i < kMessages; ++i) numbers += (i ? "," : "") + std::to_string(i);
  EXPECT_EQ(event["n"], numbers);
  EXPECT_EQ(event["Ruvo_Session_Summary_Event"], "3");
  EXPECT_EQ(testing::StoreCount(service.DatabasePath(), "sessions WHERE recovered = 1"), 1);
  // One summary file: its name and entries are the summary suite's business.
  const std::filesystem::path files = service.root() + "/log/DiagnosticLogs/Audio/Reporting";
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(files), {}), 1);
  EXPECT_TRUE(std::filesystem::is_empty(service.root() + "/lib/spool"));
}

// Under a service manager (a datagram socket standing in for systemd's): READY with a status
// line once it serves, watchdog pings while it runs, and a longer stop time asked for at SIGTERM.
TEST(ServiceLifecycleE2eTest, TellsTheServiceManagerItIsReadyAliveAndStopping) {
  const std::string directory = testing::MakeTempDirectory("tavrin-notify-");
  const std::string path = directory + "/notify.sock";
  const int manager = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address = testing::UnixAddress(path);
  ASSERT_EQ(::bind(manager, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  const timeval wait{0, 100'000};
  ::setsockopt(manager, SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof wait);
  std::string heard;
  // Collects what the service says until `enough` holds or 20 s pass.
  auto listen = [&](const std::function<bool()>& enough) {
    const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    char buffer[512];
    while (!enough() && std::chrono::steady_clock::now() < until) {
      const ssize_t size = ::recv(manager, buffer, sizeof buffer, 0);
      if (size > 0) heard += std::string(buffer, size_t(size)) + "\n";
    }
  };
  auto count = [&](const std::string& needle) { return testing::Occurrences(heard, needle); };

  TavrindProcess service;
  ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
  ::setenv("WATCHDOG_USEC", "200000", 1);
  const bool started = service.Start();
  ::unsetenv("NOTIFY_SOCKET");
  ::unsetenv("WATCHDOG_USEC");
  ASSERT_TRUE(started) << service.Log();
  listen([&] { return count("WATCHDOG=1") >= 3; });
  EXPECT_EQ(count("READY=1\nSTATUS=serving; "), 1u) << heard;
  EXPECT_GE(count("WATCHDOG=1"), 3u) << heard;
  EXPECT_GE(count("STATUS=serving; 0 queued work items"), 1u) << heard;
  ASSERT_EQ(service.Stop(), 0) << service.Log();
  listen([&] { return count("EXTEND_TIMEOUT_USEC=") > 0; });
  EXPECT_EQ(count("EXTEND_TIMEOUT_USEC=20000000"), 1u) << heard;
  ::close(manager);
  std::filesystem::remove_all(directory);
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
