// The PipeWire exporter and the service meet in the counters tree: a private PipeWire daemon
// runs a graph, the real tavrin-pw-exporter writes its counters under the root of a real
// tavrind, and a client's session carries what rose while it ran in its driver delta message.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <csignal>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "tests/support/ChildProcess.h"
#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using testing::ChildProcess;
using testing::TavrindProcess;
using testing::TestClient;
using testing::WaitUntil;

// A counter file's value, -1 while it does not exist yet.
int64_t Counter(const std::string& path) {
  int64_t value = -1;
  std::ifstream(path) >> value;
  return value;
}

TEST(PwExporterServiceE2eTest, ASessionCarriesTheCyclesThePipeWireGraphRanWhileItWasStarted) {
  if (::access("/usr/bin/pipewire", X_OK) != 0) GTEST_SKIP() << "pipewire is not installed";
  // The daemon and its client meet in a private runtime directory, away from any user session,
  // inside the service's root (removed with it, after the processes below have been killed).
  TavrindProcess service;
  const std::string runtime = service.root() + "/pipewire";
  std::filesystem::create_directory(runtime);
  ::chmod(runtime.c_str(), 0700);
  ::setenv("XDG_RUNTIME_DIR", runtime.c_str(), 1);
  ::setenv("PIPEWIRE_RUNTIME_DIR", runtime.c_str(), 1);
  ::unsetenv("PIPEWIRE_REMOTE");
  const std::string log = runtime + "/output.log";
  ChildProcess daemon({"/usr/bin/pipewire", "-c", PIPEWIRE_NULL_GRAPH_CONF}, log);
  ASSERT_TRUE(daemon.started());
  ASSERT_TRUE(WaitUntil([&] { return ::access((runtime + "/pipewire-0").c_str(), F_OK) == 0; }))
      << testing::ReadFile(log);

  // The service starts before the exporter has made its group, as after a boot.
  ASSERT_TRUE(service.Start()) << service.Log();
  ChildProcess exporter(
      {TAVRIN_PW_EXPORTER_PATH, "--root", service.root() + "/driverstats", "--interval-ms", "50"},
      log);
  ASSERT_TRUE(exporter.started());
  // The last node in name order owns the family's keys: Speaker_cycles is test_sink's count.
  const std::string cycles = service.root() + "/driverstats/Speaker/test_sink/cycles";
  ASSERT_TRUE(WaitUntil([&] { return Counter(cycles) > 0; })) << testing::ReadFile(log);

  TestClient client(service.SocketPath());
  const int64_t beforeStart = Counter(cycles);
  client.Send(1, protocol::CreateReportingSession{77});
  client.Send(2, protocol::StartReportingSessionForID{77});
  // Requests run in order: once this one is answered, the start has taken its snapshot.
  client.Send(3, protocol::GetAllReporters{});
  for (uint64_t call : {1, 3}) ASSERT_EQ(client.Read().value_or(protocol::Reply{}).call, call);
  const int64_t afterStart = Counter(cycles);
  ASSERT_TRUE(WaitUntil([&] { return Counter(cycles) > afterStart + 2; }))
      << testing::ReadFile(log);
  const int64_t beforeStop = Counter(cycles);
  client.Send(4, protocol::StopReportingSessionForID{77});
  for (uint64_t call : {2, 4}) ASSERT_EQ(client.Read().value_or(protocol::Reply{}).call, call);
  const int64_t afterStop = Counter(cycles);

  const std::string query =
      "SELECT payload FROM session_messages WHERE reporter_id = 77 AND "
      "category = 9 AND type = 0";
  ASSERT_TRUE(WaitUntil([&] {
    return !testing::QueryStoreColumn(service.DatabasePath(), query).empty();
  })) << service.Log();
  const auto payloads = testing::QueryStoreColumn(service.DatabasePath(), query);
  ASSERT_EQ(payloads.size(), 1u);
  const auto delta = nlohmann::json::parse(payloads[0], nullptr, false);
  ASSERT_TRUE(delta.is_object() && delta.contains("Speaker_cycles")) << payloads[0];
  // The snapshot and the stop's sample fall between the reads around them.
  EXPECT_GE(delta["Speaker_cycles"].get<int64_t>(), beforeStop - afterStart) << payloads[0];
  EXPECT_LE(delta["Speaker_cycles"].get<int64_t>(), afterStop - beforeStart) << payloads[0];
  // Only counters that rose, all of the exporter's group.
  for (const auto& [key, value] : delta.items()) {
    EXPECT_EQ(key.rfind("Speaker_", 0), 0u) << key;
    EXPECT_GT(value.get<int64_t>(), 0) << key;
  }
  EXPECT_TRUE(delta.contains("Speaker_busy_ns_total")) << payloads[0];
}

}  // namespace
}  // namespace tavrin
