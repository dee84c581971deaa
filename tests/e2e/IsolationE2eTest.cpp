// What a careless or hostile local user can do to the service: who may reach it and stop it (the
// socket's mode keeps out users outside the service's group; killService is honoured only for
// root, the service's own user and limits.kill_uids), and what broken settings turn into. The
// access cases switch to another uid in a child process, so they run only as root.

#include <grp.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/StoreFiles.h"
#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::TavrindProcess;
using testing::TestClient;

constexpr uid_t kOtherUid = 65534;  // nobody

// Timing bounds are for the optimised build; the sanitizer builds run about ten times slower.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::chrono::seconds kSlowBuild{10};
#else
constexpr std::chrono::seconds kSlowBuild{1};
#endif

unsigned Mode(const std::string& path) {
  struct stat info {};
  return ::stat(path.c_str(), &info) == 0 ? (info.st_mode & 07777) : 0xFFFFu;
}

// Peak resident memory of a process, from /proc.
size_t PeakRssBytes(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return std::stoul(line.substr(6)) * 1024;
  }
  return 0;
}

// Runs `body` as kOtherUid in a child process and returns its exit status (0: all held).
int RunAsOtherUser(const std::function<int()>& body) {
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setgroups(0, nullptr) != 0 || ::setgid(kOtherUid) != 0 || ::setuid(kOtherUid) != 0) {
      ::_exit(100);
    }
    ::_exit(body());
  }
  int status = 0;
  ::waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 200;
}

// Writes the defaults file, then starts the service on it.
bool StartWith(TavrindProcess& service, const std::string& defaults) {
  testing::WriteFileAtomically(service.DefaultsPath(), defaults);
  return service.Start();
}

// A single message of category 1, type 0.
protocol::Arguments Message(Dictionary payload) {
  return protocol::SendMessage{std::move(payload), 1, 0, std::nullopt};
}

// Sends one request and waits for its reply: the reply's status, or none when no reply came.
std::optional<protocol::Status> Ask(TestClient& client, protocol::Arguments request,
                                    std::chrono::milliseconds timeout = testing::kE2eTimeout) {
  const auto reply = client.Call(std::move(request), timeout);
  return reply ? std::optional(reply->status) : std::nullopt;
}

class IsolationE2eTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
  }
  // Lets other users walk to the socket, so that only the socket's own mode decides.
  static void OpenPathTo(const TavrindProcess& service) {
    ::chmod(service.root().c_str(), 0711);
    ::chmod((service.root() + "/run").c_str(), 0711);
  }
};

TEST_F(IsolationE2eTest, FilesAreClosedToOtherUsersAndTheSocketToOtherGroups) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  OpenPathTo(service);
  EXPECT_EQ(Mode(service.SocketPath()), 0660u);
  EXPECT_EQ(Mode(service.root() + "/lib"), 0750u);
  // The store opens after the socket is listening.
  EXPECT_TRUE(testing::WaitUntil([&] { return Mode(service.DatabasePath()) != 0xFFFFu; }));
  EXPECT_EQ(Mode(service.DatabasePath()), 0640u);

  const std::string socketPath = service.SocketPath();
  EXPECT_EQ(RunAsOtherUser([&] { return TestClient(socketPath).connected() ? 1 : 0; }), 0)
      << "a user outside the service's group connected";
  TestClient owner(socketPath);
  EXPECT_TRUE(owner.connected());
}

TEST_F(IsolationE2eTest, AnotherUserWhoMayConnectCannotStopTheServiceUnlessListed) {
  TavrindProcess service({"--socket-mode", "0666"});
  ASSERT_TRUE(service.Start()) << service.Log();
  OpenPathTo(service);
  const std::string socketPath = service.SocketPath();
  auto killThenAsk = [&] {
    TestClient client(socketPath);
    if (!client.connected()) return 2;
    client.Send(1, protocol::KillService{});
    client.Send(2, protocol::GetAllReporters{});
    const auto refusal = client.Read(), next = client.Read();
    const bool refused = refusal && refusal->call == 1 &&
                         refusal->status == protocol::Status::kOperationError &&
                         refusal->value.value("domain", "") == protocol::kAccessErrorDomain &&
                         refusal->value.value("code", 0) == protocol::kKillNotAllowedCode &&
                         !refusal->value.value("reason", "").empty();
    return !refused ? 3 : next && next->call == 2 && next->status == protocol::Status::kOk ? 0 : 5;
  };
  EXPECT_EQ(RunAsOtherUser(killThenAsk), 0) << service.Log();
  EXPECT_TRUE(service.WaitForLog("refused killService")) << service.Log();

  // Listed in limits.kill_uids (the defaults are re-read on SIGHUP), the same user may stop it.
  std::ofstream(service.DefaultsPath()) << "[limits]\nkill_uids = [" << kOtherUid << "]\n";
  ::kill(service.pid(), SIGHUP);
  const auto allowed = [&] {
    for (int attempt = 0; attempt < 100; ++attempt) {
      TestClient client(socketPath);
      client.Send(1, protocol::KillService{});
      if (client.WaitForClose(std::chrono::milliseconds(500)) &&
          !TestClient(socketPath).connected()) {
        return 0;
      }
      ::usleep(50'000);
    }
    return 1;
  };
  EXPECT_EQ(RunAsOtherUser(allowed), 0) << service.Log();
  EXPECT_EQ(service.WaitForExit(), 2) << service.Log();
}

// One wide frame or one long reporter list used to freeze every client for seconds, or take the
// service to a gigabyte: both are now refused at once with the limits error, and another client's
// round trips go on.
TEST(IsolationLimitsE2eTest, WideFramesAndLongReporterListsAreRefusedWithoutStallingOthers) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient attacker(service.SocketPath());
  TestClient bystander(service.SocketPath());

  // [1, 6, {200,000 distinct 3-letter keys: 0}, 1, 0, nil]: just under 1 MiB.
  std::vector<uint8_t> wide{0x96, 0x01, 0x06, 0xdf, 0x00, 0x03, 0x0d, 0x40};
  for (int key = 0; key < 200'000; ++key) {
    wide.insert(wide.end(), {0xa3, uint8_t('0' + key % 64), uint8_t('0' + key / 64 % 64),
                             uint8_t('0' + key / 4096), 0x00});
  }
  wide.insert(wide.end(), {0x01, 0x00, 0xc0});
  std::vector<int64_t> everyone(10'000, 7);  // under the entry limit, over the list limit

  auto worstRoundTrip = std::chrono::nanoseconds(0);
  auto roundTrip = [&] {
    const auto started = std::chrono::steady_clock::now();
    const bool answered = Ask(bystander, protocol::GetAllReporters{}) == protocol::Status::kOk;
    worstRoundTrip = std::max(worstRoundTrip, std::chrono::steady_clock::now() - started);
    return answered;
  };
  ASSERT_TRUE(roundTrip());
  const auto started = std::chrono::steady_clock::now();
  ASSERT_TRUE(attacker.SendBody(wide));
  ASSERT_TRUE(attacker.Send(
      2, protocol::SendMessage{Dictionary{{"x", std::string(1024, 'x')}}, 1, 0, everyone}));
  for (int i = 0; i < 20; ++i) EXPECT_TRUE(roundTrip());
  for (auto [call, code] : {std::pair{1, protocol::LimitCode::kEntriesPerFrame},
                            std::pair{2, protocol::LimitCode::kReporterListTooLong}}) {
    EXPECT_EQ(testing::Describe(attacker.Read()),
              fmt::format("{} 1 {} {}", call, protocol::kLimitsErrorDomain, int(code)));
  }
  EXPECT_LT(std::chrono::steady_clock::now() - started, 1 * kSlowBuild);
  EXPECT_LT(worstRoundTrip, std::chrono::milliseconds(50) * kSlowBuild.count());
  EXPECT_EQ(service.LogCount("refused request from pid"), 2u) << service.Log();
  EXPECT_LT(PeakRssBytes(service.pid()), size_t{256} << 20);

  // Large frames are decoded aside from the I/O thread; a connection's requests keep their order.
  Dictionary large;
  for (int key = 0; key < 2000; ++key) large["k" + std::to_string(key)] = std::string(40, 'v');
  for (uint64_t next = 3; next < 9; next += 2) {
    attacker.Send(next, protocol::SendMessage{large, 1, 0, std::nullopt});
    attacker.Send(next + 1, protocol::GetAllReporters{});
  }
  for (int call = 3; call < 9; ++call) {
    EXPECT_EQ(testing::Describe(attacker.Read()), std::to_string(call) + " 0") << service.Log();
  }
  EXPECT_EQ(service.Stop(), 0);
  EXPECT_EQ(service.LogCount("reporter IDs per message 1, entries per frame 1,"), 1u)
      << service.Log();
}

// A connection's replies keep flowing while another connection floods the service: a bystander
// that pipelines a thousand requests has them all answered long before the flood is read. (One
// reply frame a write gave it one reply per turn of the I/O loop, each turn behind another 16 KiB
// of the flood: about 110,000 flood messages for its thousand replies.)
TEST(IsolationLimitsE2eTest, ABystandersPipelinedRepliesAreNotHeldBehindAFlood) {
  TavrindProcess service;
  ASSERT_TRUE(service.Start()) << service.Log();
  TestClient flooder(service.SocketPath());
  TestClient bystander(service.SocketPath());
  constexpr int kFloodMessages = 60'000;
  constexpr uint64_t kRequests = 1'000;
  std::vector<uint8_t> flood;
  for (int i = 0; i < kFloodMessages; ++i) {
    const auto frame = protocol::EncodeFrame(protocol::EncodeRequest(
        protocol::Request{std::nullopt, Message(Dictionary{{"i", i}, {"pad", "xxxxxxxxxxxx"}})}));
    flood.insert(flood.end(), frame.begin(), frame.end());
  }
  std::vector<uint8_t> requests;
  for (uint64_t call = 1; call <= kRequests; ++call) {
    const auto frame = protocol::EncodeFrame(
        protocol::EncodeRequest(protocol::Request{call, protocol::GetAllReporters{}}));
    requests.insert(requests.end(), frame.begin(), frame.end());
  }
  std::atomic<size_t> floodSent{0};
  std::thread flooding([&] {
    constexpr size_t kChunk = 4096;
    for (size_t at = 0; at < flood.size(); at += kChunk) {
      const size_t end = std::min(flood.size(), at + kChunk);
      if (!flooder.SendBytes(std::vector<uint8_t>(flood.begin() + at, flood.begin() + end))) break;
      floodSent = end;
    }
  });
  while (floodSent < flood.size() / 10) std::this_thread::yield();
  ASSERT_TRUE(bystander.SendBytes(requests));
  uint64_t answered = 0;
  while (answered < kRequests) {
    const auto reply = bystander.Read();
    if (!reply || reply->status != protocol::Status::kOk) break;
    ++answered;
  }
  const size_t floodSentWhenAnswered = floodSent;
  flooding.join();
  EXPECT_EQ(answered, kRequests) << service.Log();
  EXPECT_LT(floodSentWhenAnswered, flood.size()) << "the bystander waited for the whole flood";
  EXPECT_EQ(service.Stop(), 0);
}

// Both limits below are settings. A frame over the frame limit ends its connection, one under it
// is answered. A connection keeps a bounded number of sessions: one more is refused with code 1
// and creates nothing; re-creating an ID it has is no new session, destroying one frees a place,
// and another connection has places of its own.
TEST(IsolationLimitsE2eTest, FrameAndSessionsPerConnectionLimitsComeFromTheSettings) {
  TavrindProcess service;
  ASSERT_TRUE(StartWith(service, "[limits]\nframe_bytes = 70000\nsessions_per_connection = 3\n"))
      << service.Log();
  for (auto [text, answered] : {std::pair{69'000, true}, {71'000, false}}) {
    TestClient sender(service.SocketPath());
    EXPECT_EQ(Ask(sender, Message({{"t", std::string(text, 'x')}}), 2s).has_value(), answered);
  }
  EXPECT_TRUE(service.WaitForLog("outside 1..70000")) << service.Log();
  TestClient client(service.SocketPath());
  TestClient other(service.SocketPath());
  // The reply without its call number.
  auto create = [&](TestClient& on, int64_t id) {
    const std::string reply = testing::Describe(on.Call(protocol::CreateReportingSession{id}));
    return reply.substr(reply.find(' ') + 1);
  };
  const std::string created = "0", refused = fmt::format("1 {} 1", protocol::kLimitsErrorDomain);
  // 3 is below the floor of 16.
  for (int64_t id = 1; id <= 16; ++id) EXPECT_EQ(create(client, id), created) << id;
  EXPECT_EQ(create(client, 5), created);
  EXPECT_EQ(create(client, 17), refused);
  EXPECT_EQ(create(other, 17), created);
  // ID 0 is never a session of its own.
  ASSERT_TRUE(client.Call(protocol::DestroyReportingSession{0}) &&
              client.Call(protocol::DestroyReportingSession{3}));
  EXPECT_EQ(create(client, 18), created);
  EXPECT_EQ(create(client, 19), refused);

  auto reporters = client.Call(protocol::GetAllReporters{});
  ASSERT_TRUE(reporters);
  const auto ids = protocol::ReportersReplyValue(reporters->value);
  ASSERT_TRUE(ids);
  EXPECT_EQ(std::count(ids->begin(), ids->end(), 19), 0) << "a refused request had an effect";
  EXPECT_EQ(ids->size(), 17u);  // 15 of this connection's, 18, and the other's 17
  EXPECT_TRUE(service.WaitForLog("(2 from this client)")) << service.Log();
  EXPECT_EQ(service.Stop(), 0);
  EXPECT_EQ(service.LogCount("refusals by limit: sessions per connection 2,"), 1u) << service.Log();
}

// A crowd of connections is bounded twice: per uid, and by the descriptors kept for the service
// itself. Refusals close the newcomer at once and are logged once a second with a count; the
// connections already there, and the store, go on.
TEST(IsolationLimitsE2eTest, ConnectionCrowdsAreCutAtThePerUidLimitAndTheDescriptorReserve) {
  struct Case {
    int descriptorLimit;
    int perUid;
    size_t kept;
  };
  // 100 descriptors less the reserve of 64 leaves 36 connections at most.
  for (const Case& c : {Case{1024, 8, 8}, Case{100, 1000, 36}}) {
    TavrindProcess service;
    rlimit saved{};
    ::getrlimit(RLIMIT_NOFILE, &saved);
    const rlimit lowered{static_cast<rlim_t>(c.descriptorLimit), saved.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &lowered);  // inherited by the service
    const bool started =
        StartWith(service, "[limits]\nconnections_per_uid = " + std::to_string(c.perUid) + "\n");
    ::setrlimit(RLIMIT_NOFILE, &saved);
    ASSERT_TRUE(started) << service.Log();

    std::vector<std::unique_ptr<TestClient>> crowd;
    for (int i = 0; i < 60; ++i) {
      crowd.push_back(std::make_unique<TestClient>(service.SocketPath()));
      crowd.back()->Send(1, protocol::GetAllReporters{});
    }
    size_t answered = 0;
    for (auto& client : crowd) answered += client->Read(500ms) ? 1 : 0;
    EXPECT_EQ(answered, c.kept) << service.Log();
    EXPECT_LE(service.LogCount("since the last such line"), 3u) << "one line a second at most";
    crowd.clear();
    // Once the crowd leaves, connections are accepted again and messages reach the store.
    ASSERT_TRUE(testing::WaitUntil([&] {
      TestClient client(service.SocketPath());
      return Ask(client, Message({{"after", 1}}), 500ms) == protocol::Status::kOk;
    })) << service.Log();
    EXPECT_EQ(service.Stop(), 0);
  }
}

// One client that never reads its replies is cut off at its own backlog bound (a setting), with
// a line naming it; the service and another client go on.
TEST(IsolationLimitsE2eTest, AClientThatNeverReadsIsCutOffAtItsOwnBacklogBound) {
  TavrindProcess service;
  ASSERT_TRUE(StartWith(service, "[limits]\nreply_bytes_per_connection = 65536\n"))
      << service.Log();
  TestClient silent(service.SocketPath());
  for (int64_t id = 1; id <= 1000; ++id) {
    silent.SendNoReply(protocol::CreateReportingSession{(int64_t{1} << 40) + id});
  }
  // Each reply lists 1,000 IDs of nine bytes: 200 of them are far more than the socket buffers.
  for (uint64_t call = 1; call <= 200; ++call) silent.Send(call, protocol::GetAllReporters{});
  EXPECT_TRUE(service.WaitForLog("bytes of replies not read")) << service.Log();
  EXPECT_TRUE(silent.WaitForClose(10s));
  TestClient other(service.SocketPath());
  EXPECT_TRUE(Ask(other, protocol::GetAllReporters{}));
  EXPECT_EQ(service.Stop(), 0);
  EXPECT_EQ(service.LogCount("reply backlog 1"), 1u) << service.Log();
}

// Clients that send requests and never read their replies once took the service to 2.8 GB and
// SIGABRT. Each backlog is bounded, and so is their total: the largest backlogs are cut off. The
// total is lowered here to 1 MiB so that 200 silent clients overrun it
// with a fraction of the work the defaults would need. Each asks for about 360 KB of replies,
// more than its socket's kernel buffer takes, so backlogs build up in the service.
TEST(IsolationLimitsE2eTest, ManyClientsThatNeverReadCannotExhaustTheService) {
  TavrindProcess service;
  ASSERT_TRUE(StartWith(service,
                        "[limits]\nconnections_per_uid = 1000\nreply_bytes_total = 1048576\n"
                        "sessions_per_connection = 4096\n"))
      << service.Log();
  TestClient owner(service.SocketPath());
  // Reporter IDs of nine bytes each: every reply below lists 2,000 of them, about 18 KB.
  for (int64_t id = 1; id <= 2000; ++id) {
    owner.SendNoReply(protocol::CreateReportingSession{(int64_t{1} << 40) + id});
  }
  ASSERT_TRUE(Ask(owner, protocol::GetAllReporters{})) << service.Log();

  std::vector<std::unique_ptr<TestClient>> silent;
  for (int i = 0; i < 200; ++i) {
    silent.push_back(std::make_unique<TestClient>(service.SocketPath()));
    for (uint64_t call = 1; call <= 20; ++call) {
      silent.back()->Send(call, protocol::GetAllReporters{});
    }
  }
  TestClient newcomer(service.SocketPath());
  const auto started = std::chrono::steady_clock::now();
  EXPECT_EQ(Ask(newcomer, protocol::GetAllReporters{}, 60s), protocol::Status::kOk)
      << service.Log();
  EXPECT_LT(std::chrono::steady_clock::now() - started, 15 * kSlowBuild);
  EXPECT_LT(PeakRssBytes(service.pid()), size_t{512} << 20);
  EXPECT_GT(service.LogCount("the largest reply backlog"), 0u) << "the total was never enforced";
  EXPECT_EQ(service.Stop(), 0);
  EXPECT_EQ(service.LogCount("reply backlog 0"), 0u) << service.Log();
}

// Settings fail closed: a file that does not parse at start, or a switch of the wrong type, never
// turns reporting on. (A file broken later keeps the last good settings: TomlSettingsTest.)
TEST(IsolationSettingsE2eTest, BrokenSettingsOrASwitchOfTheWrongTypeDisableReporting) {
  TavrindProcess service;
  ASSERT_TRUE(StartWith(service, "disable_reporting = fals\n")) << service.Log();
  TestClient client(service.SocketPath());
  auto send = [&] { return Ask(client, Message({{"x", 1}})); };
  EXPECT_EQ(send(), protocol::Status::kOperationError)
      << "a broken file at start enabled reporting";
  EXPECT_TRUE(service.WaitForLog("reporting disabled until the file parses")) << service.Log();

  int rereads = 1;  // the start's
  auto rewrite = [&](const std::string& text) {
    testing::WriteFileAtomically(service.DefaultsPath(), text);
    return service.WaitForLog("re-reading tavrin defaults", ++rereads);
  };
  ASSERT_TRUE(rewrite("device_name = \"hall\"\n")) << service.Log();
  EXPECT_EQ(send(), protocol::Status::kOk);

  // A value of the wrong type names the key and its expected type, and fails closed too.
  ASSERT_TRUE(rewrite("disable_reporting = \"false\"\n")) << service.Log();
  EXPECT_EQ(send(), protocol::Status::kOperationError);
  EXPECT_TRUE(service.WaitForLog("disable_reporting: expected a boolean, got string"))
      << service.Log();
}

}  // namespace
}  // namespace tavrin
