// Session lifecycle against the back-ends, the message path, the standalone single-message path,
// orientation tracking and the sinks, on the fake platform (time moves only when a test moves it);
// last, sessions on the real dispatcher with real threads.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>
#include <gtest/gtest.h>

#include "Statistics/RuvoReportingKelvaneUtility.h"
#include "Statistics/RuvoReportingStratikBridge.h"
#include "Statistics/RuvoReportingUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/TracePoints.h"
#include "platform/linux/dispatch/AsioDispatcher.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::seconds;
using Builders = FakeAnalyticsSink::Builders;
using Discovery = FakeTelvoroService::Discovery;
using Kind = FakeOrientationRegistry::Kind;
using Change = FakeOrientationRegistry::Change;

class SessionTest : public SessionTestBase {
 protected:
  void Send(const std::shared_ptr<RuvoReportingSession>& session, const Dictionary& payload) {
    session->sendMessage(payload, 1, 1, nullptr);
  }

  std::vector<int64_t> Sequence(const std::shared_ptr<FakeTelvoroSession>& session) {
    std::vector<int64_t> sequence;
    for (const auto& message : session->Messages()) {
      // The summary carries "seq" too, as text; only the messages themselves count here.
      const auto seq = message.payload.find("seq");
      if (seq != message.payload.end() && seq->is_number()) sequence.push_back(seq->get<int64_t>());
    }
    return sequence;
  }
};

// --- creation, setters and release ------------------------------------------------------------

TEST_F(SessionTest, CreationSettersAndReleaseAreLoggedAndTraced) {
  auto session = RuvoReportingSession::create(-7, {11, 12}, platform.services);
  EXPECT_EQ(session->serviceName(), "unknown");

  session->setServiceType(2);
  EXPECT_EQ(session->serviceName(), "telephony");
  EXPECT_EQ(CountMessage("setting service type telephony", LogLevel::kInfo), 1u);
  session->setServiceType(200);  // a code without a name
  EXPECT_FALSE(session->serviceName().has_value());
  EXPECT_EQ(CountMessage("setting service type (null)", LogLevel::kInfo), 1u);

  session->setConfiguration(Dictionary{{"a", 1}, {"b", 2}});
  session->updateDefaults(Dictionary{{"b", 3}, {"c", "x"}});
  session->setConfiguration(Dictionary());               // none: nothing changes
  session->setConfiguration(Dictionary::array({1, 2}));  // not a dictionary: refused, logged
  EXPECT_EQ(session->userInfo(), (Dictionary{{"a", 1}, {"b", 3}, {"c", "x"}}));
  EXPECT_EQ(log.Messages(LogLevel::kError, "rvrr").size(), 1u);

  session.reset();
  EXPECT_EQ(traces.Count(trace::kSessionReleased), 1u);
  EXPECT_EQ(CountMessage("deallocing this session -7", LogLevel::kInfo), 1u);
}

// --- the back-end wait ------------------------------------------------------------------------

TEST_F(SessionTest, BackendsThatNeverAnswerDropTheSessionAfterNineSecondsAndAggregationGoesOn) {
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);
  auto session = Started();
  auto fake = platform.telvoro.LastSession();
  ASSERT_NE(fake, nullptr);
  EXPECT_EQ(session->telvoroSession(), fake);
  EXPECT_TRUE(fake->DiscoveryPending());
  EXPECT_EQ(CountMessage("waiting for telvorod to find backends", LogLevel::kDefault), 1u);

  // Messages sent during the wait queue up behind it; replies mean accepted and come at once.
  int replies = 0;
  auto reply = [&](const OptionalError& error) { replies += error ? 100 : 1; };
  for (int i = 0; i < 3; ++i) session->sendMessage(Dictionary{{"seq", i}}, 1, 1, i == 0, reply);
  EXPECT_EQ(replies, 3);
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(platform.dispatcher.PendingCount(*session->telvoroQueue()), 3u);

  platform.dispatcher.AdvanceBy(milliseconds(8999));
  EXPECT_TRUE(platform.dispatcher.IsSuspended(*session->telvoroQueue()));
  EXPECT_EQ(CountMessage("failed to find backend"), 0u);

  platform.dispatcher.AdvanceBy(milliseconds(1));
  EXPECT_EQ(CountMessage("failed to find backend", LogLevel::kError), 1u);
  EXPECT_FALSE(platform.dispatcher.IsSuspended(*session->telvoroQueue()));
  EXPECT_EQ(platform.dispatcher.PendingCount(*session->telvoroQueue()), 0u);
  EXPECT_EQ(session->telvoroSession(), nullptr);
  EXPECT_FALSE(session->telvoroSessionStarted());
  EXPECT_TRUE(session->started());
  // The queued messages found no session: one error line each, nothing reached the back-end.
  EXPECT_EQ(CountMessage("No valid TelvoroSession", LogLevel::kError), 3u);
  EXPECT_TRUE(fake->Messages().empty());

  // An answer after the time-out changes nothing (resuming the queue a second time would fail
  // the test in the fake dispatcher).
  EXPECT_EQ(platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"sqlite:/l.db"}),
            1u);
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("continuing"), 0u);
  EXPECT_EQ(session->telvoroSession(), nullptr);

  // Still aggregating, so the summary is made; it too finds no session, and nothing is flushed.
  session->sendMessage(Dictionary{{"seq", 3}}, 1, 1, reply);
  EXPECT_EQ(replies, 4);
  EXPECT_EQ(Aggregated(session->summaryTexts()), 4u);
  StopAndRun(session);
  EXPECT_EQ(CountMessage("sending summary event for reporter 42", LogLevel::kDefault), 1u);
  EXPECT_EQ(CountMessage("No valid TelvoroSession", LogLevel::kError), 5u);
  EXPECT_EQ(replies, 4);  // none twice
  EXPECT_TRUE(fake->MessagesAtFlush().empty());
}

TEST_F(SessionTest, BackendsAnsweringLaterReleaseQueuedMessagesInOrder) {
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);
  auto session = Started();
  for (int i = 0; i < 5; ++i) Send(session, Dictionary{{"seq", i}});
  platform.dispatcher.AdvanceBy(seconds(5));
  auto fake = platform.telvoro.LastSession();
  EXPECT_TRUE(fake->Messages().empty());

  // The answer may come from any thread; here from the test's.
  platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"sqlite:/a.db", "kafka:b"});
  EXPECT_EQ(CountMessage("continuing", LogLevel::kDefault), 1u);
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(Sequence(fake), (std::vector<int64_t>{0, 1, 2, 3, 4}));

  // The time-out that was armed does nothing once the answer came.
  platform.dispatcher.AdvanceBy(seconds(10));
  EXPECT_EQ(CountMessage("failed to find backend"), 0u);
  EXPECT_EQ(session->telvoroSession(), fake);
  Send(session, Dictionary{{"seq", 5}});
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(Sequence(fake).size(), 6u);
}

TEST_F(SessionTest, NoBackendListRunsIntoTheTimeOutAndTheWaitKeepsTheSessionAlive) {
  platform.telvoro.SetDiscovery(Discovery::kAnswerNil);
  auto session = Started();
  EXPECT_EQ(CountMessage("No backends found, this session won't get sent to the server",
                         LogLevel::kError),
            1u);
  EXPECT_EQ(log.Count(":start: No backends found"), 1u);
  EXPECT_EQ(CountMessage("waiting for telvorod to find backends"), 1u);
  EXPECT_NE(session->telvoroSession(), nullptr);
  std::weak_ptr<RuvoReportingSession> weak = session;
  session.reset();
  EXPECT_FALSE(weak.expired());
  platform.dispatcher.AdvanceBy(seconds(9));
  EXPECT_EQ(CountMessage("failed to find backend", LogLevel::kError), 1u);
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(CountMessage("deallocing this session 42"), 1u);
}

// --- session info and user info ---------------------------------------------------------------

TEST_F(SessionTest, AnImmediateAnswerMeansNoWaitAndTheBackEndGetsSessionAndUserInfo) {
  const int64_t reporter = -9223372036854775807LL - 1;
  auto session = Create(reporter, 2);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "com.example.app"}});
  session->start();
  // Configuration given before the queued step runs is part of what the back-end gets.
  session->setConfiguration(Dictionary{{"late", true}});
  Send(session, Dictionary{{"seq", 0}});
  platform.dispatcher.RunUntilIdle();
  // An answer before the wait means no wait at all.
  EXPECT_EQ(CountMessage("waiting for telvorod to find backends"), 0u);
  EXPECT_EQ(CountMessage("continuing"), 0u);
  EXPECT_EQ(CountMessage("List of backends [\"sqlite:/fake/tavrin.db\"]"), 1u);
  EXPECT_FALSE(platform.dispatcher.IsSuspended(*session->telvoroQueue()));

  ASSERT_EQ(platform.telvoro.Tokens().size(), 1u);
  EXPECT_EQ(platform.telvoro.TokenParents()[0], nullptr);
  const auto token = platform.telvoro.Tokens()[0];
  EXPECT_EQ(session->telvoroAgentToken(), token);

  auto fake = platform.telvoro.LastSession();
  const Dictionary& info = fake->SessionInfo();
  // As text, so the number types count too.
  EXPECT_EQ(info.dump(), fmt::format(R"({{"ClientType":19,"ClientVersion":2.0,"SessionID":{},)"
                                     R"("BatchEvent":true,"HierarchyToken":{},)"
                                     R"("ContainsRealtimeEvents":false}})",
                                     reporter, token->value));
  EXPECT_EQ(fake->UserInfo(), (Dictionary{{"ClientName", "com.quorvex.tavrin"},
                                          {"ServiceName", "telephony_session"},
                                          {"HostApplicationDisplayID", "com.example.app"},
                                          {"late", true}}));
  EXPECT_TRUE(fake->FrameworksToCheck().empty());
  EXPECT_EQ(Sequence(fake), (std::vector<int64_t>{0}));
}

TEST_F(SessionTest, ServiceNamesAndBatchingFollowTheServiceTypeUnlessTheClientNamesItself) {
  const std::string client = "com.quorvex.tavrin";
  const struct {
    uint16_t type;
    Dictionary configuration;
    Dictionary userInfo;
  } cases[] = {
      {12, Dictionary(), {{"ClientName", client}, {"ServiceName", "apiusage_session"}}},
      {0, Dictionary(), {{"ClientName", client}, {"ServiceName", "generic_session"}}},
      {7, Dictionary(), {{"ClientName", client}, {"ServiceName", "longformaudio_session"}}},
      {7,
       {{"ServiceName", "mine"}, {"ClientName", "other"}},
       {{"ClientName", "other"}, {"ServiceName", "mine"}}},
      {300, Dictionary(), {{"ClientName", client}}},
      {0xFFFF, Dictionary(), {{"ClientName", client}, {"ServiceName", "unknown_session"}}},
  };
  for (const auto& c : cases) {
    Started(c.type, c.configuration, 1);
    const auto fake = platform.telvoro.LastSession();
    EXPECT_EQ(fake->UserInfo(), c.userInfo) << c.type;
    // Only API-usage sessions are real-time.
    EXPECT_EQ(fake->SessionInfo()["BatchEvent"], c.type != 12) << c.type;
    EXPECT_EQ(fake->SessionInfo()["ContainsRealtimeEvents"], c.type == 12) << c.type;
  }
}

// --- start and stop ---------------------------------------------------------------------------

TEST_F(SessionTest, TestSessionsGetNoBackEndButStillSummarise) {
  auto session = Started(11, Dictionary(), 5);
  EXPECT_TRUE(platform.telvoro.Tokens().empty());
  EXPECT_TRUE(platform.telvoro.Sessions().empty());
  EXPECT_EQ(session->telvoroAgentToken(), nullptr);

  Send(session, Dictionary{{"a", 1}});
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("transactions aren't allowed on this platform", LogLevel::kInfo), 1u);

  StopAndRun(session);
  EXPECT_EQ(CountMessage("sending summary event for reporter 5"), 1u);
  EXPECT_EQ(CountMessage("transactions aren't allowed on this platform"), 2u);
  EXPECT_EQ(platform.fileSystem.Files().size(), 1u);
  EXPECT_TRUE(platform.telvoro.SingleMessages().empty());
}

TEST_F(SessionTest, BeforeStartMessagesGoAloneStopDoesNothingAndStartDropsTheAggregate) {
  auto session = Create();
  bool replied = false;
  session->sendMessage(Dictionary{{"early", 1}}, 1, 1,
                       [&](const OptionalError& error) { replied = !error; });
  EXPECT_TRUE(replied);
  StopAndRun(session);
  EXPECT_FALSE(session->started());
  EXPECT_EQ(CountMessage("sending summary event for reporter 42"), 0u);
  EXPECT_TRUE(platform.fileSystem.CreateDirectoriesCalls().empty());
  EXPECT_TRUE(platform.telvoro.Sessions().empty());
  EXPECT_EQ(traces.Count(trace::kSessionStopped), 0u);
  // The message went out alone, and is aggregated in the lists made at creation...
  EXPECT_EQ(platform.telvoro.SingleMessages().size(), 1u);
  EXPECT_EQ(Aggregated(session->summaryTexts()), 1u);
  // ...which start empties.
  StartAndRun(session);
  EXPECT_EQ(Aggregated(session->summaryTexts()), 0u);
  EXPECT_TRUE(Entries(session->spool()).empty());
}

TEST_F(SessionTest, StopFlushesAfterEveryQueuedMessageAndDropsTheLists) {
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);
  platform.telvoro.FailFlushes(Error{"domain", 5, "disk full"});
  auto session = Started();
  for (int i = 0; i < 3; ++i) Send(session, Dictionary{{"seq", i}});
  session->stop();
  EXPECT_FALSE(session->started());
  EXPECT_EQ(session->summaryTexts(), nullptr);
  EXPECT_EQ(session->spool(), nullptr);
  EXPECT_EQ(traces.Count(trace::kSessionStopped), 1u);
  auto fake = platform.telvoro.LastSession();
  EXPECT_TRUE(fake->MessagesAtFlush().empty());  // still behind the wait

  platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"sqlite:/a.db"});
  platform.dispatcher.RunUntilIdle();
  // Messages sent before stop take the session's road even though they ran after it: three
  // messages and the summary, then the flush, whose error is logged.
  EXPECT_EQ(Sequence(fake), (std::vector<int64_t>{0, 1, 2}));
  EXPECT_TRUE(platform.telvoro.SingleMessages().empty());
  EXPECT_EQ(fake->MessagesAtFlush(), (std::vector<size_t>{4}));
  EXPECT_EQ(fake->Messages().back(),
            (FakeTelvoroMessage{
                0xFFFF, 0xFFFF, {{"Ruvo_Session_Summary_Event", "3"}, {"seq", "0,1,2"}}}));
  EXPECT_EQ(session->telvoroSession(), nullptr);
  EXPECT_EQ(CountMessage("flush error disk full", LogLevel::kError), 1u);
  EXPECT_EQ(log.Count(":stop: flush error disk full"), 1u);
}

TEST_F(SessionTest, StartingTwiceChangesNothingButARestartGetsANewBackEndAndFreshLists) {
  auto session = Started();
  Send(session, Dictionary{{"a", 1}});
  const auto list = session->summaryTexts();
  StartAndRun(session);
  EXPECT_EQ(CountMessage("42 is already started", LogLevel::kInfo), 1u);
  EXPECT_EQ(session->summaryTexts(), list);
  EXPECT_EQ(Aggregated(list), 1u);
  EXPECT_EQ(platform.telvoro.Sessions().size(), 1u);
  EXPECT_EQ(traces.Count(trace::kSessionStarted), 1u);

  Send(session, Dictionary{{"a", 2}});
  StopAndRun(session);
  StartAndRun(session);
  EXPECT_EQ(platform.telvoro.Sessions().size(), 2u);
  EXPECT_EQ(platform.telvoro.Tokens().size(), 2u);
  EXPECT_EQ(Aggregated(session->summaryTexts()), 0u);
  // Message ids count on across runs; the first run's summary was counted like any message.
  EXPECT_EQ(session->messageIdForCategory(1, 1), "Generic_Start_3");
  EXPECT_EQ(session->messageTypeCounts()["Undefined_Unknown"], 1);
}

// --- the message path -------------------------------------------------------------------------

TEST_F(SessionTest, TheBackEndGetsKeysWithoutBlanksAndTheLogTheMessageAsSent) {
  auto session = Started();
  Send(session, Dictionary{{"engine on time", 5}, {"plain", "a b"}, {" x  y ", 1}});
  session->sendMessage(Value::array({1, 2}), 1, 1, nullptr);  // not a dictionary: reported
  session->sendMessage(Value(), 1, 1, nullptr);
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(log.Messages(LogLevel::kError, "rvrr").size(), 1u);

  const auto messages = platform.telvoro.LastSession()->Messages();
  ASSERT_EQ(messages.size(), 3u);
  EXPECT_EQ(messages[0].payload,
            (Dictionary{{"engine_on_time", 5}, {"plain", "a b"}, {"_x__y_", 1}}));
  EXPECT_EQ(messages[1].payload, Dictionary::object());
  EXPECT_EQ(messages[2].payload, Dictionary::object());
  EXPECT_EQ(CountMessage("TelvoroAgent <FakeTelvoroSession 0> : message "
                         "{\"engine on time\":5,\"plain\":\"a b\",\" x  y \":1} : category 1 : "
                         "type 1",
                         LogLevel::kDebug),
            1u);

  // A refused message is dropped without a line.
  platform.telvoro.FailSends(Error{"domain", 3, "refused"});
  Send(session, Dictionary{{"a", 1}});
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(platform.telvoro.LastSession()->RefusedCount(), 1u);
  EXPECT_EQ(log.Messages(LogLevel::kError, "rvrr").size(), 1u);
}

TEST_F(SessionTest, MessageIdsCountPerCategoryAndType) {
  auto session = Started();
  for (int i = 0; i < 3; ++i) session->sendMessage(Dictionary{{"n", i}}, 0x80000001, 1, nullptr);
  session->sendMessage(Dictionary{{"n", 3}}, 0x80000001, 2, nullptr);
  platform.dispatcher.RunUntilIdle();
  std::vector<std::string> ids;
  for (const auto& entry : Entries(session->spool())) {
    ids.push_back(entry.begin().key());
  }
  EXPECT_EQ(ids, (std::vector<std::string>{"Toolbox_Generic_Start_1", "Toolbox_Generic_Start_2",
                                           "Toolbox_Generic_Start_3", "Toolbox_Generic_Stop_1"}));
  EXPECT_EQ(session->messageTypeCounts(),
            (Dictionary{{"Toolbox_Generic_Start", 3}, {"Toolbox_Generic_Stop", 1}}));
  EXPECT_EQ(traces.Count(trace::kMessageSent), 4u);
  // Named in full, sent with the low 16 bits.
  for (const auto& message : platform.telvoro.LastSession()->Messages()) {
    EXPECT_EQ(message.category, 1);
  }
}

TEST_F(SessionTest, AfterStopMessagesGoAloneAndReachNoSummary) {
  auto session = Started(2, Dictionary{{"HostApplicationDisplayID", "app"}});
  Send(session, Dictionary{{"kept", 1}});
  session->stop();
  session->sendMessage(Dictionary{{"late key", 2}}, 3, 4, nullptr);
  platform.dispatcher.RunUntilIdle();

  const auto singles = platform.telvoro.SingleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].payload, (Dictionary{{"late_key", 2}}));
  EXPECT_EQ(singles[0].category, 3);
  EXPECT_EQ(singles[0].type, 4);
  EXPECT_EQ(singles[0].userInfo,
            (Dictionary{{"ClientName", "com.quorvex.tavrin"}, {"ServiceName", "telephony"}}));
  EXPECT_EQ(CountMessage("session not started, will send as a single message", LogLevel::kDebug),
            1u);
  EXPECT_EQ(session->messageTypeCounts()["Playback_Error"], 1);

  // Not in the summary of a later run either.
  StartAndRun(session);
  Send(session, Dictionary{{"next", 3}});
  EXPECT_EQ(session->createSummaryEventForSession(),
            (Dictionary{{"Ruvo_Session_Summary_Event", "2"}, {"next", "3"}}));
}

// --- single messages --------------------------------------------------------------------------

TEST_F(SessionTest, AlarmsSingleMessagesWaitTheDrawnDelay) {
  platform.random.Script({59});
  int replies = 0;
  RuvoReportingSession::sendSingleMessage(platform.services, Dictionary{{"a", 1}}, 1, 1, 4,
                                          Dictionary::object(), [&](const OptionalError& error) {
                                            EXPECT_FALSE(error.has_value());
                                            ++replies;
                                          });
  EXPECT_EQ(platform.random.Bounds(), std::vector<uint64_t>{60});
  EXPECT_EQ(CountMessage("sending single message after delta 59 for service 4", LogLevel::kDebug),
            1u);
  platform.dispatcher.AdvanceBy(milliseconds(58900));
  EXPECT_TRUE(platform.telvoro.SingleMessages().empty());
  EXPECT_EQ(replies, 0);
  platform.dispatcher.AdvanceBy(milliseconds(100));
  EXPECT_EQ(platform.telvoro.SingleMessages().size(), 1u);
  EXPECT_EQ(replies, 1);
  EXPECT_EQ(traces.Count(trace::kMessageSent), 1u);

  platform.random.Script({0});
  RuvoReportingSession::sendSingleMessage(platform.services, Dictionary{{"a", 2}}, 1, 1, 4,
                                          Dictionary::object(), nullptr);
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(platform.telvoro.SingleMessages().size(), 2u);
}

TEST_F(SessionTest, OtherSingleMessagesGoAtOnceWithoutTheClientsUserInfoAndReportFailures) {
  RuvoReportingSession::sendSingleMessage(
      platform.services, Dictionary{{"engine on time", 7}}, 0x20000003, 2, 2,
      Dictionary{{"secret", "x"}, {"ServiceName", "mine"}, {"HostApplicationDisplayID", "a"}},
      nullptr);
  // A service type without a name gives no service name.
  RuvoReportingSession::sendSingleMessage(platform.services, Dictionary{{"a", 1}}, 1, 1, 13,
                                          Dictionary::object(), nullptr);
  EXPECT_TRUE(platform.random.Bounds().empty());
  EXPECT_TRUE(platform.telvoro.SingleMessages().empty());  // never on the caller's stack
  platform.dispatcher.RunUntilIdle();
  const auto singles = platform.telvoro.SingleMessages();
  ASSERT_EQ(singles.size(), 2u);
  EXPECT_EQ(singles[0].sessionInfo.dump(),
            R"({"ClientType":19,"ClientVersion":2.0,"SessionID":-1})");
  EXPECT_EQ(singles[0].userInfo,
            (Dictionary{{"ClientName", "com.quorvex.tavrin"}, {"ServiceName", "telephony"}}));
  EXPECT_EQ(singles[0].category, 3);
  EXPECT_EQ(singles[0].type, 2);
  EXPECT_EQ(singles[0].payload, (Dictionary{{"engine_on_time", 7}}));
  EXPECT_EQ(singles[1].userInfo, (Dictionary{{"ClientName", "com.quorvex.tavrin"}}));
  EXPECT_EQ(CountMessage("sending single message", LogLevel::kDebug), 2u);
  EXPECT_EQ(CountMessage("message {\"engine on time\":7} : category 536870915 : type 2",
                         LogLevel::kDebug),
            1u);
  // A refusal reaches the reply and the log.
  platform.telvoro.FailSends(Error{"com.example", 9, "back-end down"});
  std::optional<OptionalError> answer;
  RuvoReportingSession::sendSingleMessage(platform.services, Dictionary{{"a", 1}}, 0xFFFFFFFF, 1,
                                          13, Dictionary::object(),
                                          [&](const OptionalError& error) { answer = error; });
  platform.dispatcher.RunUntilIdle();
  ASSERT_TRUE(answer.has_value() && answer->has_value());
  EXPECT_EQ((*answer)->code, 9);
  EXPECT_EQ((*answer)->description, "back-end down");
  EXPECT_EQ(CountMessage("sendOneMessageWithSessionInfo back-end down", LogLevel::kError), 1u);
  EXPECT_EQ(platform.telvoro.RefusedSingleMessages(), 1u);
}

// --- orientation tracking of telephony and long-form audio sessions on internal builds ---------

constexpr const char* kCallbackID = "RuvoReportingService 42";

// Telephony and long-form audio register device then UI callbacks at start and unregister them at
// stop; other types, never-started sessions and device class 6 never track.
TEST_F(SessionTest, OnlyTelephonyAndLongFormAudioTrackOrientation) {
  for (uint16_t type : {uint16_t{0}, uint16_t{3}, uint16_t{8}, uint16_t{0xFFFF}}) {
    auto session = Started(type);
    EXPECT_FALSE(session->orientationCallbackID().has_value()) << type;
    session->stop();
  }
  Create(42, 2)->stop();  // never started: nothing to unregister
  platform.deviceInfo.SetInt32(kDeviceInfoDeviceClassNumber, 6);
  auto classSix = Started(2);
  EXPECT_FALSE(classSix->shouldReportOrientation());
  EXPECT_FALSE(classSix->orientationCallbackID().has_value());
  EXPECT_TRUE(platform.orientation.History().empty());
  platform.deviceInfo.SetInt32(kDeviceInfoDeviceClassNumber, 5);
  EXPECT_TRUE(classSix->shouldReportOrientation());

  for (uint16_t type : {uint16_t{2}, uint16_t{7}}) {
    const size_t before = platform.orientation.History().size();
    auto session = Started(type);
    EXPECT_TRUE(session->shouldReportOrientation());
    EXPECT_EQ(session->orientationCallbackID(), kCallbackID);
    EXPECT_EQ(session->startDate(), platform.clock.Now());
    session->stop();
    EXPECT_FALSE(session->orientationCallbackID().has_value());
    EXPECT_EQ(platform.orientation.FireDevice("portrait"), 0u);

    const auto history = platform.orientation.History();
    EXPECT_EQ(std::vector<Change>(history.begin() + before, history.end()),
              (std::vector<Change>{{Kind::kDevice, true, kCallbackID},
                                   {Kind::kUI, true, kCallbackID},
                                   {Kind::kDevice, false, kCallbackID},
                                   {Kind::kUI, false, kCallbackID}}));
  }
}

TEST_F(SessionTest, TimesAreRoundedToWholeMilliseconds) {
  platform.orientation.SetText("3", "landscape-left");
  auto session = Started(2);
  platform.clock.Advance(microseconds(12600));
  EXPECT_EQ(platform.orientation.FireUI("3"), 1u);
  platform.clock.Advance(microseconds(2000400 - 12600));
  EXPECT_EQ(platform.orientation.FireDevice("portrait"), 1u);
  platform.clock.Advance(microseconds(500));  // 2.0009 s: rounded, not cut off
  platform.orientation.FireDevice("face-up");

  EXPECT_EQ(Aggregated(session->summaryTexts()), 3u);
  const Dictionary summary{{"Ruvo_Session_Summary_Event", "2"},
                           {"ui_orientation", "landscape-left"},
                           {"ui_orientation_time", "0.013"},
                           {"device_orientation", "portrait,face-up"},
                           {"device_orientation_time", "2,2.001"}};
  EXPECT_EQ(session->createSummaryEventForSession()->dump(), summary.dump());
  // Records are not messages: not counted, not in the nested list.
  EXPECT_EQ(session->messageTypeCounts(), Dictionary::object());
  EXPECT_TRUE(Entries(session->spool()).empty());
}

TEST_F(SessionTest, TheCallbacksHoldTheSessionUntilStopUnregistersThem) {
  std::weak_ptr<RuvoReportingSession> weak = Started(2);
  // Released without stop: still registered, still aggregating.
  ASSERT_FALSE(weak.expired());
  EXPECT_EQ(platform.orientation.FireUI("portrait"), 1u);
  EXPECT_EQ(Aggregated(weak.lock()->summaryTexts()), 1u);

  // A type changed before stop leaves the callbacks registered; what they report after stop is
  // kept nowhere.
  weak.lock()->setServiceType(3);
  weak.lock()->stop();
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kDevice, kCallbackID));
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kUI, kCallbackID));
  EXPECT_EQ(weak.lock()->orientationCallbackID(), kCallbackID);
  EXPECT_EQ(platform.orientation.FireDevice("portrait"), 1u);
  EXPECT_EQ(weak.lock()->summaryTexts(), nullptr);
  EXPECT_EQ(CountMessage("deallocing this session 42"), 0u);
}

TEST_F(SessionTest, ARestartRegistersAgainAndRecordsInterleaveWithMessages) {
  auto session = Started(7);
  session->stop();
  platform.clock.Advance(std::chrono::seconds(30));
  session->start();
  EXPECT_EQ(session->startDate(), platform.clock.Now());
  EXPECT_TRUE(platform.orientation.IsRegistered(Kind::kDevice, kCallbackID));
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  platform.clock.Advance(milliseconds(250));
  platform.orientation.FireDevice("portrait");
  session->sendMessage(Dictionary{{"a", 2}}, 1, 1, nullptr);
  platform.orientation.FireUI("portrait");
  EXPECT_EQ(*session->createSummaryEventForSession(),
            (Dictionary{{"Ruvo_Session_Summary_Event", "7"},
                        {"a", "1,2"},
                        {"device_orientation", "portrait"},
                        {"device_orientation_time", "0.25"},
                        {"ui_orientation", "portrait"},
                        {"ui_orientation_time", "0.25"}}));
  EXPECT_EQ(CountMessage("Orientation handler callback mode=ui orientation=\"portrait\" "
                         "app=\"(null)\", time=0.25, id=\"RuvoReportingService 42\"",
                         LogLevel::kDebug),
            1u);
}

// --- the analytics and power-event sinks every delivered message is offered to --------------

class SinksTest : public SessionTest {
 protected:
  SinksTest() : session(Create(42, 3)) {
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "com.example.game"}});
  }

  // Both sinks, in the order the client instance offers a message to them.
  void Offer(const Dictionary& event, uint32_t category, uint16_t type) {
    RuvoReportingStratikBridge::handleEvent(event, category, type, *session);
    RuvoReportingKelvaneUtility::handleEvent(event, category, type, *session);
  }

  std::shared_ptr<RuvoReportingSession> session;
};

// --- analytics --------------------------------------------------------------------------------

TEST_F(SinksTest, EveryMessageBecomesANamedAnalyticsEventWithTheSessionsApplicationName) {
  Offer(Dictionary{{"latency", 12}, {"route", "speaker"}}, 0x80000001, 1);
  Offer(Dictionary{{"HostApplicationDisplayID", "forged"}}, 12, 6);
  Offer(Dictionary(), 0xFFFFFFFF, 0xFFFF);  // absent: an event all the same
  Offer(Dictionary::object(), 0x90000001, 5);
  RuvoReportingKelvaneUtility::handleEvent(Value::array({"EngineOnTime"}), 1, 1, *session);
  RuvoReportingStratikBridge::handleEvent(Dictionary{{"HostApplicationDisplayID", "forged"}}, 1, 1,
                                          *Create(7, 3));
  const auto events = platform.analytics.Events();
  ASSERT_EQ(events.size(), 5u);
  const std::string names[] = {"Toolbox_Generic.Start", "Undefined.Undefined", "Undefined.Unknown",
                               "_Generic.IssueDetector"};
  for (size_t i = 0; i < 4; ++i) EXPECT_EQ(events[i].name, "com.quorvex.tavrin." + names[i]);
  EXPECT_EQ(events[0].builderCalls, 1u);
  const Dictionary game{{"HostApplicationDisplayID", "com.example.game"}};
  EXPECT_EQ(*events[0].payload, (Dictionary{{"latency", 12},
                                            {"route", "speaker"},
                                            {"HostApplicationDisplayID", "com.example.game"}}));
  for (size_t i = 1; i < 4; ++i) EXPECT_EQ(*events[i].payload, game) << i;
  EXPECT_EQ(*events[4].payload, (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
  // No engine time, or no dictionary: no power event.
  EXPECT_TRUE(platform.powerLog.Events().empty());
  EXPECT_TRUE(log.Messages(LogLevel::kError, "default").empty());
}

TEST_F(SinksTest, TheLazyPayloadIsTheOnePreparedAtSendTimeAndASwitchedOffSinkNeverBuildsIt) {
  platform.analytics.SetBuilders(Builders::kCallLater);
  Offer(Dictionary{{"n", 1}}, 1, 1);
  EXPECT_EQ(platform.analytics.Events()[0].builderCalls, 0u);
  // Changes after the send do not reach the payload built later.
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "changed"}});
  EXPECT_EQ(platform.analytics.RunPendingBuilders(), 1u);
  EXPECT_EQ(*platform.analytics.Events()[0].payload,
            (Dictionary{{"n", 1}, {"HostApplicationDisplayID", "com.example.game"}}));

  platform.analytics.SetBuilders(Builders::kNeverCall);
  Offer(Dictionary{{"n", 2}}, 1, 1);
  const auto events = platform.analytics.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[1].builderCalls, 0u);
  EXPECT_FALSE(events[1].payload.has_value());
}

TEST_F(SinksTest, EngineTimeBecomesAPowerEventAndAMissingTimestampIsLogged) {
  Offer(Dictionary{{"EngineOnTime", 12.5}, {"ruvoreporting_timestamp", 1700000000123}, {"x", 1}}, 3,
        2);
  EXPECT_TRUE(log.Messages(LogLevel::kError, "default").empty());
  Offer(Dictionary{{"EngineOnTime", 3}}, 1, 1);
  const auto events = platform.powerLog.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].agent, 28);
  EXPECT_EQ(events[0].name, "Mediane_Haptics");
  EXPECT_FALSE(events[0].extra.has_value());
  EXPECT_EQ(events[0].payload.dump(), (Dictionary{{"EngineOnDuration", 12.5},
                                                  {"ApplicationName", "com.example.game"},
                                                  {"TimestampEnd", 1700000000123}})
                                          .dump());
  EXPECT_EQ(events[1].payload,
            (Dictionary{{"EngineOnDuration", 3}, {"ApplicationName", "com.example.game"}}));
  EXPECT_EQ(log.Messages(LogLevel::kError, "default"),
            std::vector<std::string>{"failed to get RuvoReporting timestamp for kelvane"});
}

TEST_F(SinksTest, AnAbsentApplicationNameIsLoggedAndLeftOut) {
  // "Unknown" stands in for a missing key; only a present but empty value gives no name.
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", nullptr}});
  Offer(Dictionary{{"EngineOnTime", "7"}, {"ruvoreporting_timestamp", 5}}, 1, 1);
  const auto events = platform.powerLog.Events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", "7"}, {"TimestampEnd", 5}}));
  EXPECT_EQ(log.Messages(LogLevel::kError, "default"),
            std::vector<std::string>{"failed to get app name for kelvane"});

  RuvoReportingKelvaneUtility::handleEvent(Dictionary{{"EngineOnTime", 1}}, 1, 1, *Create(7, 3));
  EXPECT_EQ(platform.powerLog.Events()[1].payload["ApplicationName"], "Unknown");
}

// --- on the real dispatcher, with real threads: the client's sends, orientation callbacks and
// back-end answers arrive from different threads at once ---------------------------------------

// Generous: other builds share the two cores, and sanitizers slow everything down.
constexpr auto kDeadline = std::chrono::seconds(120);

// Polls `done` until it holds or the deadline passes; true when it held.
bool Eventually(const std::function<bool()>& done) {
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(milliseconds(2));
  }
  return true;
}

class SessionThreadsTest : public SessionTestBase {
 protected:
  SessionThreadsTest() {
    services = platform.services;
    services.dispatcher = &dispatcher;
  }
  ~SessionThreadsTest() override { dispatcher.Shutdown(); }

  AsioDispatcher dispatcher;
  PlatformServices services;
};

TEST_F(SessionThreadsTest, MessagesKeepTheirOrderWhileOrientationAndStopRunElsewhere) {
  constexpr int kSessions = 6;
  constexpr int kMessages = 300;
  constexpr int kAfterStop = 5;
  log.SetVerbose(false);
  platform.telvoro.SetDiscovery(Discovery::kAnswerLater);

  std::vector<std::shared_ptr<RuvoReportingSession>> sessions;
  for (int i = 0; i < kSessions; ++i) {
    sessions.push_back(RuvoReportingSession::create(i + 1, {100 + i}, services));
    sessions.back()->setServiceType(2);  // telephony: orientation is tracked
  }

  std::atomic<bool> clientDone{false};
  std::atomic<size_t> fired{0};
  std::thread orientation([&] {
    while (!clientDone.load()) {
      fired += platform.orientation.FireDevice("portrait");
      fired += platform.orientation.FireUI("landscape");
      std::this_thread::yield();
    }
  });
  std::thread backends([&] {
    // Answers each session's discovery as soon as it asks, from this thread.
    size_t answered = 0;
    const auto deadline = std::chrono::steady_clock::now() + kDeadline;
    while (answered < kSessions && std::chrono::steady_clock::now() < deadline) {
      answered += platform.telvoro.AnswerPendingDiscoveries(std::vector<std::string>{"x"});
      std::this_thread::yield();
    }
  });
  std::thread client([&] {
    for (auto& session : sessions) session->start();
    // Let orientation changes reach the started sessions while the messages go out.
    const size_t firedBefore = fired.load();
    while (fired.load() == firedBefore) std::this_thread::yield();
    for (int seq = 0; seq < kMessages; ++seq) {
      for (auto& session : sessions) session->sendMessage(Dictionary{{"seq", seq}}, 1, 1, nullptr);
    }
    for (auto& session : sessions) session->stop();
    for (int n = 0; n < kAfterStop; ++n) {
      for (auto& session : sessions) session->sendMessage(Dictionary{{"late", n}}, 1, 1, nullptr);
    }
    clientDone = true;
  });
  client.join();
  orientation.join();
  backends.join();

  ASSERT_TRUE(Eventually([&] {
    const auto created = platform.telvoro.Sessions();
    return created.size() == kSessions &&
           std::all_of(created.begin(), created.end(),
                       [](const auto& s) { return s->MessagesAtFlush().size() == 1; }) &&
           platform.telvoro.SingleMessages().size() == kSessions * kAfterStop;
  }));

  std::string allSeq;
  for (int seq = 0; seq < kMessages; ++seq) allSeq += (seq ? "," : "") + std::to_string(seq);
  int records = 0;
  for (const auto& fake : platform.telvoro.Sessions()) {
    const auto messages = fake->Messages();
    ASSERT_EQ(messages.size(), size_t{kMessages} + 1);
    for (int seq = 0; seq < kMessages; ++seq) {
      ASSERT_EQ(messages[seq].payload["seq"], seq) << fake->Description();
    }
    // The summary comes last and holds every message, in order, with the orientation records.
    const Dictionary& summary = messages.back().payload;
    EXPECT_EQ(summary["seq"], allSeq);
    EXPECT_FALSE(summary.contains("late"));
    records += summary.contains("device_orientation") || summary.contains("ui_orientation");
    if (summary.contains("device_orientation")) {
      EXPECT_EQ(std::ranges::count(summary["device_orientation"].get<std::string>(), ','),
                std::ranges::count(summary["device_orientation_time"].get<std::string>(), ','));
    }
    EXPECT_EQ(fake->MessagesAtFlush(), std::vector<size_t>{kMessages + 1});
  }
  EXPECT_EQ(CountMessage("failed to find backend"), 0u);
  EXPECT_GT(records, 0);

  // Nothing holds the sessions once their queued work is done and their callbacks are gone.
  std::vector<std::weak_ptr<RuvoReportingSession>> weak(sessions.begin(), sessions.end());
  sessions.clear();
  EXPECT_TRUE(Eventually([&] {
    return std::all_of(weak.begin(), weak.end(), [](const auto& s) { return s.expired(); });
  }));
  EXPECT_EQ(platform.orientation.RegisteredCount(FakeOrientationRegistry::Kind::kDevice), 0u);
}

}  // namespace
}  // namespace tavrin::testing
