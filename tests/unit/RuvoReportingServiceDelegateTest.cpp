#include "Statistics/Service/RuvoReportingServiceDelegate.h"
#include "Statistics/Service/ServiceWatchdog.h"

#include "Statistics/RuvoReportingUtility.h"

#include <gtest/gtest.h>

#include <chrono>
#include <optional>
#include <vector>

#include "platform/TracePoints.h"
#include "tests/fakes/FakeClientConnection.h"
#include "tests/fakes/FakeDefaultsDomain.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/fakes/FakeNotificationCenter.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/fakes/FakeProcessInfo.h"
#include "tests/fakes/FakeTraceRecorder.h"

namespace tavrin {
namespace {

using std::chrono::seconds;
using testing::FakeClientConnection;
using Replies = std::vector<std::string>;

// Listener that is never asked to do anything: the delegate only receives it.
class NullListener final : public ServiceListener {
 public:
  void SetDelegate(ServiceListenerDelegate*) override {}
  void Resume() override {}
};

// One accepted client: its connection and the replies it has received, in order.
struct Client {
  std::shared_ptr<FakeClientConnection> connection;
  Replies replies;

  RuvoReportingServiceProtocol& service() { return *connection->ExportedObject(); }
  RuvoReportingServiceProtocol::BoolReply Bool(std::string what) {
    return [this, what](bool value) { replies.push_back(what + "=" + (value ? "YES" : "NO")); };
  }
  void CreateAndStart(int64_t id) {
    service().createReportingSession(id, Bool("create"));
    service().startReportingSessionForID(id, Bool("start"));
  }
};

class ServiceDelegateTest : public ::testing::Test {
 protected:
  void SetUp() override {
    platform.services.processInfo = &processInfo;
    platform.services.notifications = &notifications;
    platform.services.defaults = &defaults;
    delegate = RuvoReportingServiceDelegate::init(platform.services);
  }

  std::unique_ptr<Client> Connect(int32_t pid) {
    auto client = std::make_unique<Client>();
    client->connection = std::make_shared<FakeClientConnection>(pid);
    EXPECT_TRUE(delegate->shouldAcceptNewConnection(listener, client->connection));
    platform.dispatcher.RunUntilIdle();
    return client;
  }

  void Run() { platform.dispatcher.RunUntilIdle(); }

  void PostDefaults() {
    notifications.Post(kDefaultsNotificationName);
    Run();
  }

  testing::FakeLogSystem log;
  testing::RecordingTraceRecorder traces;
  testing::FakePlatform platform;
  testing::FakeProcessInfo processInfo;
  testing::FakeNotificationCenter notifications;
  testing::FakeDefaultsDomain defaults;
  NullListener listener;
  std::shared_ptr<RuvoReportingServiceDelegate> delegate;
};

TEST_F(ServiceDelegateTest, SettingsComeWithEachNotificationOfTheOwnTokenAndReachEverySession) {
  EXPECT_FALSE(delegate->getDefaults().has_value());
  EXPECT_TRUE(delegate->isReportingEnabled());
  EXPECT_EQ(log.Count("notify setup result 0"), 1u);
  EXPECT_EQ(defaults.reads(), 0);

  auto client = Connect(100);
  client->service().createReportingSession(7, client->Bool("create"));
  Run();
  defaults.Set("device_name", "kitchen");
  PostDefaults();
  EXPECT_EQ(delegate->getDefaults(),
            (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));
  EXPECT_EQ(delegate->findReportingSessionForID(7)->userInfo(),
            (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));

  defaults.Remove("device_name");
  PostDefaults();
  EXPECT_EQ(delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));

  // A foreign token is ignored.
  const int reads = defaults.reads();
  defaults.Set("disable_reporting", true);
  notifications.PostWithToken(kDefaultsNotificationName, 999);
  Run();
  EXPECT_TRUE(delegate->isReportingEnabled());
  EXPECT_EQ(defaults.reads(), reads);
}

TEST_F(ServiceDelegateTest, FailedRegistrationIsLoggedAndTheServiceRunsWithoutSettings) {
  testing::FakeNotificationCenter failing;
  failing.failWith = 7;
  platform.services.notifications = &failing;
  auto second = RuvoReportingServiceDelegate::init(platform.services);
  EXPECT_EQ(log.Count("notify setup result 7"), 1u);
  EXPECT_TRUE(second->isReportingEnabled());
  EXPECT_FALSE(second->getDefaults().has_value());
  second.reset();
  platform.services.notifications = &notifications;  // the fixture's delegate still uses it
}

TEST_F(ServiceDelegateTest, StartReplyIsHeldUntilItsOwnClientStopsAndLookupFavoursTheFirstClient) {
  auto a = Connect(100);
  auto b = Connect(200);
  a->CreateAndStart(7);
  b->service().createReportingSession(9, b->Bool("create"));
  a->service().createReportingSession(9, a->Bool("create"));
  Run();
  // B reaches A's session under the same id, but its stop stops nothing.
  b->service().startReportingSessionForID(7, b->Bool("start"));
  b->service().stopReportingSessionForID(7, b->Bool("stop"));
  Run();
  EXPECT_EQ(b->replies, (Replies{"create=YES", "start=YES", "stop=YES"}));
  EXPECT_EQ(a->replies, (Replies{"create=YES", "create=YES"}));
  EXPECT_TRUE(delegate->findReportingSessionForID(7)->started());
  EXPECT_EQ(log.Count("found reporting session 7 for client 100"), 2u);
  EXPECT_EQ(delegate->findReportingSessionForID(9)->processIdentifiers(),
            (std::vector<int32_t>{100}));
  EXPECT_EQ(log.Count("failed to find reporting session"), 0u);
  EXPECT_FALSE(delegate->findReportingSessionForID(10));
  EXPECT_EQ(log.Count("failed to find reporting session 10", LogLevel::kError), 1u);

  // The held start reply arrives before the stop reply.
  a->service().stopReportingSessionForID(7, a->Bool("stop"));
  Run();
  EXPECT_EQ(a->replies, (Replies{"create=YES", "create=YES", "start=YES", "stop=YES"}));
  EXPECT_EQ(traces.Count(trace::kClientCreate), 3u);
  EXPECT_EQ(traces.Count(trace::kClientStart), 2u);
  EXPECT_EQ(traces.Count(trace::kClientStop), 2u);
  EXPECT_EQ(log.Count("nothing interesting to fetch from the drivers"), 1u);  // no counters
}

TEST_F(ServiceDelegateTest, DisabledReportingRefusesMessagesAndHidesOtherClientsSessions) {
  auto a = Connect(100);
  auto b = Connect(200);
  a->service().createReportingSession(7, a->Bool("create"));
  a->service().setServiceType(2, 7, a->Bool("type"));
  Run();
  // While reporting is enabled, another client's lookup finds the session; reporter 0 is
  // answered twice, an unknown reporter once.
  std::vector<uint16_t> types;
  for (int64_t id : {7, 0, 44}) {
    b->service().getServiceNameForReporterID(id, [&](uint16_t type) { types.push_back(type); });
  }
  Run();
  EXPECT_EQ(types, (std::vector<uint16_t>{2, 0xFFFF, 0xFFFF, 0xFFFF}));

  defaults.Set("disable_reporting", true);
  PostDefaults();
  EXPECT_FALSE(delegate->isReportingEnabled());
  log.Clear();

  std::vector<OptionalError> errors;
  b->service().sendMessage(Dictionary{{"x", 1}}, 1, 0, std::vector<int64_t>{7},
                           [&](const OptionalError& error) { errors.push_back(error); });
  std::optional<Dictionary> valid;
  b->service().reporterID(7, [&](const Dictionary& answer) { valid = answer; });
  Run();
  ASSERT_EQ(errors.size(), 1u);
  ASSERT_TRUE(errors[0].has_value());
  EXPECT_EQ(errors[0]->domain, "com.quorvex.audio.reporting");
  EXPECT_EQ(errors[0]->code, 1);
  ASSERT_TRUE(valid);
  EXPECT_EQ(*valid, (Dictionary{{"reporterID", 0}, {"serviceType", 0xFFFF}}));
  // The disabled search answers none without a word.
  EXPECT_EQ(log.Count("failed to find reporting session"), 0u);

  defaults.Remove("disable_reporting");
  PostDefaults();
  EXPECT_TRUE(delegate->isReportingEnabled());
  EXPECT_EQ(*delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
  b->service().reporterID(7, [&](const Dictionary& answer) { valid = answer; });
  Run();
  EXPECT_EQ(*valid, (Dictionary{{"reporterID", 7}, {"serviceType", 2}}));
}

// (Empty lists, lists naming no session and the standalone road are checked end to end.)
TEST_F(ServiceDelegateTest, BroadcastReachesEveryRunningSessionOfEveryClient) {
  auto a = Connect(100);
  auto b = Connect(200);
  b->service().createReportingSession(3, b->Bool("create"));  // never started: left out
  a->CreateAndStart(1);
  b->CreateAndStart(2);
  a->service().sendMessage(Dictionary{{"EngineOnTime", 4.5}}, 1, 0, std::nullopt, nullptr);
  Run();
  EXPECT_EQ(log.Count("active reporting sessions 2 : "), 1u);
  size_t delivered = 0;
  for (const auto& session : platform.telvoro.Sessions()) delivered += session->Messages().size();
  EXPECT_EQ(delivered, 2u);
  EXPECT_TRUE(platform.telvoro.SingleMessages().empty());
  EXPECT_EQ(platform.analytics.Events().size(), 2u);
  EXPECT_EQ(platform.powerLog.Events().size(), 2u);
}

TEST_F(ServiceDelegateTest, CreatingAnIdTwiceReplacesTheSessionWithoutStoppingIt) {
  auto client = Connect(100);
  client->CreateAndStart(7);
  Run();
  client->service().createReportingSession(7, client->Bool("create"));
  Run();
  EXPECT_EQ(traces.Count(trace::kSessionStopped), 0u);
  EXPECT_EQ(traces.Count(trace::kSessionCreated), 2u);
  RuvoReportingSessionPtr current = delegate->findReportingSessionForID(7);
  ASSERT_TRUE(current);
  EXPECT_FALSE(current->started());
  // The held start reply went with the replaced session: it is never answered.
  EXPECT_EQ(client->replies, (Replies{"create=YES", "create=YES"}));
}

TEST_F(ServiceDelegateTest, StopSendsThePositiveDriverDeltaIntoTheSessionFirst) {
  const int channel = platform.driverStats.AddChannel("Speaker", std::nullopt, "xruns", 10);
  delegate = RuvoReportingServiceDelegate::init(platform.services);  // subscribes anew
  auto client = Connect(100);
  client->CreateAndStart(7);
  Run();
  platform.driverStats.SetValue(channel, 13);
  client->service().stopReportingSessionForID(7, client->Bool("stop"));
  Run();
  ASSERT_EQ(platform.telvoro.Sessions().size(), 1u);
  auto messages = platform.telvoro.Sessions()[0]->Messages();
  ASSERT_EQ(messages.size(), 2u) << "the delta, then the summary of the stop";
  EXPECT_EQ(messages[0], (testing::FakeTelvoroMessage{9, 0, {{"Speaker_xruns", 3}}}));
  EXPECT_EQ(messages[1].type, kSummaryEventType);  // the category reaches it masked to 16 bits
  EXPECT_EQ(log.Count("fetching driver logs {\"Speaker_xruns\":3}"), 1u);
  RuvoReportingSessionPtr session = delegate->findReportingSessionForID(7);
  ASSERT_TRUE(session);
  EXPECT_FALSE(session->started());
}

TEST_F(ServiceDelegateTest, DisconnectStopsRunningSessionsAndRemovesTheClientOnce) {
  processInfo.SetCommandName(100, "mediaplayer");
  auto client = Connect(100);
  client->CreateAndStart(7);
  Run();
  platform.clock.Advance(seconds(42));

  client->connection->End(/*abnormal=*/true);
  Run();
  EXPECT_EQ(log.Count("InterruptionHandler: connection exited"), 1u);
  EXPECT_EQ(log.Count("removing 100 from the server client list"), 1u);
  EXPECT_TRUE(delegate->getAllClients().empty());
  EXPECT_EQ(traces.Count(trace::kSessionStopped), 1u);
  // No held reply on this road.
  EXPECT_EQ(client->replies, (Replies{"create=YES"}));
  EXPECT_EQ(log.Count("InvalidationHandler: connection exited process=mediaplayer uptime_sec=42"),
            1u);
  auto events = platform.analytics.Events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].name, "com.quorvex.tavrin.ruvoreportingclientuptime");
  EXPECT_EQ(events[0].payload, (Dictionary{{"processName", "mediaplayer"}, {"seconds", 42.0}}));
  // With the connection and the client list gone, the instance and its sessions are released.
  EXPECT_EQ(log.Count("dealloc 100 from the server client list"), 1u);
  EXPECT_EQ(traces.Count(trace::kSessionReleased), 1u);
}

TEST_F(ServiceDelegateTest, ClientsWithoutANameOrStartDateSendNoUptimeEvent) {
  auto zero = Connect(0);
  EXPECT_FALSE(delegate->getAllClients().back()->clientProcessName().has_value());
  zero->connection->End(/*abnormal=*/false);
  auto early = std::make_shared<FakeClientConnection>(100);
  processInfo.SetCommandName(100, "early");
  ASSERT_TRUE(delegate->shouldAcceptNewConnection(listener, early));
  early->End(/*abnormal=*/false);  // before the queue added the client
  Run();
  EXPECT_EQ(log.Count("clientProcessName is nil. clientpid=0"), 1u);
  EXPECT_EQ(log.Count("clientStartDate is nil. clientpid=100 clientprocessname=(null)"), 1u);
  EXPECT_EQ(log.Count("uptime_sec=-1"), 1u);
  EXPECT_EQ(log.Count("InterruptionHandler"), 0u);
  EXPECT_TRUE(platform.analytics.Events().empty());
  EXPECT_TRUE(delegate->getAllClients().empty());

  auto own = Connect(processInfo.ownPid);
  EXPECT_EQ(delegate->getAllClients().back()->clientProcessName(),
            std::optional<std::string>("tavrind"));
}

TEST_F(ServiceDelegateTest, DestroyStopsARunningSessionAndReportersAreListedInOrder) {
  auto a = Connect(100);
  auto b = Connect(200);
  b->service().createReportingSession(5, b->Bool("c"));
  a->CreateAndStart(7);
  a->service().createReportingSession(3, a->Bool("c"));
  a->service().createReportingSession(1, a->Bool("c"));
  a->service().destroyReportingSession(7, a->Bool("destroy"));
  a->service().destroyReportingSession(0, a->Bool("destroy0"));
  std::vector<int64_t> reporters;
  b->service().getAllReporters([&](const std::vector<int64_t>& ids) { reporters = ids; });
  Run();
  EXPECT_EQ(reporters, (std::vector<int64_t>{1, 3, 5}));
  EXPECT_EQ(traces.Count(trace::kSessionStopped), 1u);
  EXPECT_EQ(log.Count("destroying 7"), 1u);
  EXPECT_EQ(log.Count("destroying 0"), 0u);
  EXPECT_EQ(a->replies, (Replies{"create=YES", "c=YES", "c=YES", "destroy=YES", "destroy0=YES"}));
}

// Pings only while probes come back through the work queue within the interval; a stuck queue
// stops them, holds one probe at the most, and they resume once it turns again.
TEST(ServiceWatchdogTest, PingsOnlyWhileTheQueueTurns) {
  testing::FakeDispatcher dispatcher;
  SerialQueuePtr queue = dispatcher.CreateSerialQueue("work", QualityOfService::kUserInteractive);
  int pings = 0;
  ServiceWatchdog watchdog(queue, dispatcher.GetClock(), seconds(10), [&] { ++pings; });

  for (int i = 0; i < 4; ++i) {
    watchdog.Tick();
    dispatcher.AdvanceBy(seconds(5));
  }
  EXPECT_EQ(pings, 4);

  queue->Suspend();  // stuck: the probe that is queued now never comes back
  watchdog.Tick();
  dispatcher.AdvanceBy(seconds(5));
  watchdog.Tick();  // the last probe ran 10 s ago: just alive
  EXPECT_EQ(pings, 6);
  for (int i = 0; i < 6; ++i) {
    dispatcher.AdvanceBy(seconds(5));
    watchdog.Tick();
  }
  EXPECT_EQ(pings, 6) << "pinged for a queue that had not turned for over 10 s";
  EXPECT_EQ(dispatcher.PendingCount(*queue), 1u) << "probes piled up behind the stuck queue";

  queue->Resume();
  dispatcher.RunUntilIdle();
  watchdog.Tick();
  EXPECT_EQ(pings, 7);
  EXPECT_EQ(watchdog.Pings(), 7u);
}

}  // namespace
}  // namespace tavrin
