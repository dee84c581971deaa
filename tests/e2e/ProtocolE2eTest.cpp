// What only the running service shows of a session: the driver counters it reads from its root at
// start and stop, and the summary file an internal build writes. Which requests get which answer
// is the codec's, dispatch's and the service delegate's unit tests' business.

#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::QueryStoreColumn;
using testing::TavrindProcess;
using testing::TestClient;
using testing::WriteFileAtomically;

protocol::Reply MustRead(TestClient& client, const TavrindProcess& service) {
  auto reply = client.Read();
  EXPECT_TRUE(reply) << service.Log();
  return reply.value_or(protocol::Reply{});
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
