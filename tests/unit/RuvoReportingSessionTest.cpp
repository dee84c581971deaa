// Session lifecycle against the back-ends, the message path and the standalone single-message
// path, on the fake platform (time moves only when a test moves it).

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/RuvoReportingUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/TracePoints.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using Discovery = FakeTelvoroService::Discovery;

class SessionTest : public SessionTestBase {
 protected:
  // A session started, with the queued half of start run (up to the back-end wait).
  std::shared_ptr<RuvoReportingSession> Started(int64_t reporterID = 42, uint16_t type = 3) {
    auto session = Create(reporterID, type);
    StartAndRun(session);
    return session;
  }
  void StartAndRun(const std::shared_ptr<RuvoReportingSession>& session) {
    session->start();
    platform.dispatcher.RunUntilIdle();
  }
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
  EXPECT_EQ(SessionMessages(LogLevel::kError).size(), 1u);

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
  EXPECT_EQ(session->telvoroSession(), fake);
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
  EXPECT_EQ(CountMessage("List of backends [\"sqlite:/l.db\"]"), 1u);
  EXPECT_EQ(CountMessage("continuing"), 0u);
  EXPECT_EQ(session->telvoroSession(), nullptr);

  // Still aggregating, so the summary is made; it too finds no session, and nothing is flushed.
  session->sendMessage(Dictionary{{"seq", 3}}, 1, 1, reply);
  EXPECT_EQ(replies, 4);
  EXPECT_EQ(Aggregated(session->summaryTexts()), 4u);
  session->stop();
  platform.dispatcher.RunUntilIdle();
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
  EXPECT_EQ(CountMessage("List of backends [\"sqlite:/a.db\",\"kafka:b\"]", LogLevel::kDefault),
            1u);
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
  EXPECT_EQ(info, (Dictionary{{"ClientType", 19},
                              {"ClientVersion", 2.0},
                              {"SessionID", reporter},
                              {"BatchEvent", true},
                              {"HierarchyToken", token->value},
                              {"ContainsRealtimeEvents", false}}));
  EXPECT_TRUE(info["ClientType"].is_number_integer());
  EXPECT_TRUE(info["ClientVersion"].is_number_float());
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
    auto session = Create(1, c.type);
    session->setConfiguration(c.configuration);
    StartAndRun(session);
    const auto fake = platform.telvoro.LastSession();
    EXPECT_EQ(fake->UserInfo(), c.userInfo) << c.type;
    // Only API-usage sessions are real-time.
    EXPECT_EQ(fake->SessionInfo()["BatchEvent"], c.type != 12) << c.type;
    EXPECT_EQ(fake->SessionInfo()["ContainsRealtimeEvents"], c.type == 12) << c.type;
  }
}

// --- start and stop ---------------------------------------------------------------------------

TEST_F(SessionTest, TestSessionsGetNoBackEndButStillSummarise) {
  auto session = Started(5, 11);
  EXPECT_TRUE(platform.telvoro.Tokens().empty());
  EXPECT_TRUE(platform.telvoro.Sessions().empty());
  EXPECT_EQ(session->telvoroAgentToken(), nullptr);

  Send(session, Dictionary{{"a", 1}});
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("transactions aren't allowed on this platform", LogLevel::kInfo), 1u);

  session->stop();
  platform.dispatcher.RunUntilIdle();
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
  session->stop();
  platform.dispatcher.RunUntilIdle();
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
  const FakeTelvoroMessage summary = fake->Messages().back();
  EXPECT_EQ(summary.category, 0xFFFF);
  EXPECT_EQ(summary.type, 0xFFFF);
  EXPECT_EQ(summary.payload, (Dictionary{{"Ruvo_Session_Summary_Event", "3"}, {"seq", "0,1,2"}}));
  EXPECT_EQ(session->telvoroSession(), nullptr);
  EXPECT_EQ(CountMessage("flush error disk full", LogLevel::kError), 1u);
  EXPECT_EQ(log.Count(":stop: flush error disk full"), 1u);
}

TEST_F(SessionTest, StartingTwiceChangesNothingButARestartGetsANewBackEndAndFreshLists) {
  auto session = Started();
  Send(session, Dictionary{{"a", 1}});
  const auto list = session->summaryTexts();
  session->start();
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("42 is already started", LogLevel::kInfo), 1u);
  EXPECT_EQ(session->summaryTexts(), list);
  EXPECT_EQ(Aggregated(list), 1u);
  EXPECT_EQ(platform.telvoro.Sessions().size(), 1u);
  EXPECT_EQ(traces.Count(trace::kSessionStarted), 1u);

  Send(session, Dictionary{{"a", 2}});
  session->stop();
  platform.dispatcher.RunUntilIdle();
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
  EXPECT_EQ(SessionMessages(LogLevel::kError).size(), 1u);

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
  EXPECT_EQ(SessionMessages(LogLevel::kError).size(), 1u);
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
  platform.dispatcher.RunUntilIdle();
  for (const auto& message : platform.telvoro.LastSession()->Messages()) {
    EXPECT_EQ(message.category, 1);
  }
}

TEST_F(SessionTest, AfterStopMessagesGoAloneAndReachNoSummary) {
  auto session = Create(42, 2);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "app"}});
  StartAndRun(session);
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
  const auto summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary.has_value());
  EXPECT_FALSE(summary->contains("late_key"));
  EXPECT_TRUE(summary->contains("next"));
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
  EXPECT_EQ(singles[0].sessionInfo,
            (Dictionary{{"ClientType", 19}, {"ClientVersion", 2.0}, {"SessionID", -1}}));
  EXPECT_TRUE(singles[0].sessionInfo["ClientVersion"].is_number_float());
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

}  // namespace
}  // namespace tavrin::testing
