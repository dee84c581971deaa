// The account of every client message, read through op 12 from the real service and compared
// with what its store holds.

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::TavrindProcess;
using testing::TestClient;

Value Status(TestClient& client) {
  static uint64_t call = 1'000'000;
  client.Send(++call, protocol::GetStatus{});
  auto reply = client.Read();
  if (!reply || reply->status != protocol::Status::kOk) return Value();
  return reply->value;
}

// Each drop reason the core decides, a client that goes away with messages counted, and the
// delivered count that the store confirms row for row.
TEST(LedgerE2eTest, EveryMessageIsReceivedThenDeliveredOrDroppedByReason) {
  const std::string root = testing::MakeTempDirectory("tavrin-e2e-");
  const std::string metrics = root + "/metrics.prom";
  TavrindProcess service({"--metrics-file", metrics}, root);
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  uint64_t call = 0;
  auto ask = [&](protocol::Arguments arguments) {
    client.Send(++call, std::move(arguments));
    return client.Read();
  };
  ASSERT_TRUE(ask(protocol::CreateReportingSession{1}));
  ASSERT_TRUE(ask(protocol::CreateReportingSession{2}));
  ASSERT_TRUE(ask(protocol::SetServiceType{11, 2}));             // "test": never sends
  client.Send(++call, protocol::StartReportingSessionForID{1});  // answered at its stop
  client.Send(++call, protocol::StartReportingSessionForID{2});
  for (int i = 0; i < 50; ++i) {
    client.SendNoReply(protocol::SendMessage{Dictionary{{"i", i}}, 1, 0, std::vector<int64_t>{1}});
  }
  for (int i = 0; i < 10; ++i) {
    client.SendNoReply(protocol::SendMessage{Dictionary{{"i", i}}, 1, 0, std::vector<int64_t>{2}});
  }
  // Two IDs without a session, one with: three paths.
  client.SendNoReply(
      protocol::SendMessage{Dictionary{{"x", 1}}, 1, 0, std::vector<int64_t>{98, 1, 99}});
  {
    TestClient gone(service.SocketPath());
    gone.Send(1, protocol::CreateReportingSession{7});
    gone.Send(2, protocol::StartReportingSessionForID{7});
    for (int i = 0; i < 20; ++i) {
      gone.SendNoReply(protocol::SendMessage{Dictionary{{"g", i}}, 1, 0, std::vector<int64_t>{7}});
    }
    ASSERT_TRUE(gone.Read());
  }
  testing::WriteFileAtomically(service.DefaultsPath(), "disable_reporting = true\n");
  ASSERT_TRUE(service.WaitForLog("re-reading tavrin defaults")) << service.Log();
  auto refused = ask(protocol::SendMessage{Dictionary{{"off", 1}}, 1, 0, std::vector<int64_t>{1}});
  ASSERT_TRUE(refused);
  EXPECT_EQ(refused->status, protocol::Status::kOperationError);

  Value status;
  ASSERT_TRUE(testing::WaitUntil([&] {
    status = Status(client);
    return status.is_object() && status["totals"]["in_flight"] == 0 &&
           status["totals"]["received"] == 84;
  })) << status.dump()
      << service.Log();
  const Value totals = status["totals"];
  EXPECT_EQ(totals["dropped"],
            (Value{{"reporting_disabled", 1}, {"no_session", 2}, {"test_session", 10}}))
      << totals.dump();
  EXPECT_EQ(totals["delivered"], 71);
  ASSERT_EQ(status["clients"].size(), 1u) << "a client that went away leaves the list";
  const Value mine = status["clients"][0];
  EXPECT_EQ(mine["received"], 64);
  EXPECT_EQ(mine["delivered"], 51);
  EXPECT_EQ(mine["sessions"], 2);
  EXPECT_EQ(mine["pid"], int64_t(::getpid()));
  EXPECT_EQ(status["sessions"], 2);
  for (const char* key : {"uptime_s", "rss_bytes", "store_backlog", "refusals"}) {
    EXPECT_TRUE(status.contains(key)) << key;
  }
  EXPECT_GT(status["rss_bytes"].get<uint64_t>(), 1u << 20);
  EXPECT_EQ(testing::QueryStoreColumn(service.DatabasePath(),
                                      "SELECT count(*) FROM session_messages WHERE category = 1"),
            std::vector<std::string>{"71"});
  EXPECT_EQ(service.Stop(), 0);

  // The metrics file's last rewrite, at exit, holds the same counts in OpenMetrics text.
  std::ifstream in(metrics);
  std::stringstream text;
  text << in.rdbuf();
  const std::string lines = text.str();
  for (const char* sample :
       {"tavrin_messages_received_total 84\n", "tavrin_messages_delivered_total 71\n",
        "tavrin_messages_dropped_total{reason=\"test_session\"} 10\n",
        "# TYPE tavrin_messages_dropped_total counter\n"}) {
    EXPECT_NE(lines.find(sample), std::string::npos) << sample << lines;
  }
  EXPECT_TRUE(lines.ends_with("# EOF\n")) << lines;
  // What Prometheus's own linter says of it (installed by the bootstrap script).
  EXPECT_EQ(std::system(("promtool check metrics < " + metrics).c_str()), 0) << lines;
}

// Without a back-end nothing is delivered, and every message says why.
TEST(LedgerE2eTest, WithoutABackEndEveryMessageIsDroppedAsSuch) {
  TavrindProcess service({"--backend", "none"});
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient client(service.SocketPath());
  for (int i = 0; i < 5; ++i) {
    client.SendNoReply(protocol::SendMessage{Dictionary{{"i", i}}, 1, 0, std::nullopt});
  }
  Value status;
  ASSERT_TRUE(testing::WaitUntil([&] {
    status = Status(client);
    return status.is_object() && status["totals"]["received"] == 5 &&
           status["totals"]["in_flight"] == 0;
  })) << status.dump();
  EXPECT_EQ(status["totals"]["dropped"], (Value{{"no_backend", 5}}));
  EXPECT_EQ(status["totals"]["delivered"], 0);
}

}  // namespace
}  // namespace tavrin
