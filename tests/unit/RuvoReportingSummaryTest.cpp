// The summary event sent at stop and the summary file written on internal builds.

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

constexpr const char* kDirectory = "/fake/log/DiagnosticLogs/Audio/Reporting";

// The base sets TZ to UTC for every test, so a zone a case sets does not outlive it.
using SummaryTest = SessionTestBase;

TEST_F(SummaryTest, TheFileIsNamedByLocalTimeAppAndServiceInAPrivateDirectory) {
  const struct {
    const char *zone, *app;
    uint16_t serviceType;
    const char* name;
  } cases[] = {
      {"UTC", "player", 3, "20261116-052745+0000-tavrin-player-haptics.json"},
      // Five and a half hours east of UTC; a service type without a name.
      {"XYZ-5:30", nullptr, 200, "20261116-105745+0530-tavrin-unknown-(null).json"},
      // An app name cannot leave the directory.
      {"UTC", "../../etc/x", 2, "20261116-052745+0000-tavrin-.._.._etc_x-telephony.json"},
  };
  for (const auto& c : cases) {
    setenv("TZ", c.zone, 1);
    tzset();
    auto session = Started(c.serviceType,
                           c.app ? Dictionary{{"HostApplicationDisplayID", c.app}} : Dictionary());
    session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
    StopAndRun(session);  // the file is written on the session's queue
    ASSERT_FALSE(platform.fileSystem.WriteCalls().empty());
    EXPECT_EQ(platform.fileSystem.WriteCalls().back(), std::string(kDirectory) + "/" + c.name);
    const auto creates = platform.fileSystem.CreateDirectoriesCalls();
    ASSERT_FALSE(creates.empty());
    EXPECT_EQ(creates.back(), std::make_pair(std::string(kDirectory), 0750u));
  }
  EXPECT_EQ(platform.fileSystem.Files().size(), 3u);
  EXPECT_TRUE(log.Messages(LogLevel::kError, "rvrr").empty());
}

// Generated sessions (seeded): the summary event and file, built as messages arrive, must equal
// what the plain algorithm makes from every message of the round at stop; a round without
// messages has neither.
TEST_F(SummaryTest, GeneratedSessionsMatchThePlainAlgorithm) {
  std::mt19937 random(20261124);
  auto pick = [&](size_t n) { return static_cast<size_t>(random() % n); };
  const std::vector<std::string> keys{
      "a", "a b", "a_b", " k ", "_k_", "Ruvo_Session_Summary_Event", "n.m", "", "z"};
  auto value = [&]() -> Value {
    const Value values[] = {static_cast<int64_t>(random()) - (1LL << 31),
                            pick(1000) / 8.0,
                            pick(2) == 0,
                            nullptr,
                            Value::array({1, "x", Value{{"in", 2.5}}}),
                            Value{{"o", Value::array()}},
                            std::string(pick(4), 'v') + "w,x y"};
    return values[pick(7)];
  };
  for (int sessionIndex = 0; sessionIndex < 300; ++sessionIndex) {
    SCOPED_TRACE(sessionIndex);
    const uint16_t serviceType = static_cast<uint16_t>(pick(12));
    const Dictionary info =
        pick(2) ? Dictionary{{"HostApplicationDisplayID", "app"}} : Dictionary();
    auto session = Started(serviceType, info);
    size_t messageCount = 0, summaryCount = 0;
    for (size_t round = 0, rounds = 1 + pick(3); round < rounds; ++round) {
      if (round > 0) session->start();
      std::vector<std::pair<std::string, Dictionary>> sent;  // {id, cleaned payload}
      for (size_t m = 0, n = pick(7); m < n; ++m) {
        Dictionary payload = Dictionary::object(), cleaned = Dictionary::object();
        for (size_t k = 0, width = pick(5); k < width; ++k) {
          const std::string& key = keys[pick(keys.size())];
          payload[key] = value();
        }
        for (const auto& item : payload.items()) {
          std::string key = item.key();
          std::replace(key.begin(), key.end(), ' ', '_');
          cleaned[key] = item.value();
        }
        session->sendMessage(payload, 1, 1, nullptr);
        sent.emplace_back("Generic_Start_" + std::to_string(++messageCount), cleaned);
      }
      Dictionary expected{{"Ruvo_Session_Summary_Event", std::to_string(serviceType)}};
      Value file = Value::array({info.is_null() ? Dictionary::object() : info});
      for (const auto& [id, payload] : sent) {
        for (const auto& item : payload.items()) {
          Value& text = expected[item.key()];
          text = (text.is_null() ? "" : text.get<std::string>() + ",") + ValueText(item.value());
        }
        file.push_back(Value{{id, payload}});
      }
      // The summary event is itself a message of the session.
      if (!sent.empty()) {
        file.push_back(Value{{"Undefined_Unknown_" + std::to_string(++summaryCount), expected}});
      }
      const auto summary = session->createSummaryEventForSession();
      ASSERT_EQ(summary ? summary->dump() : "none", sent.empty() ? "none" : expected.dump());
      const size_t writes = platform.fileSystem.WriteCalls().size();
      StopAndRun(session);
      const auto calls = platform.fileSystem.WriteCalls();
      ASSERT_EQ(calls.size(), writes + (sent.empty() ? 0 : 1));
      if (!sent.empty()) {
        ASSERT_EQ(platform.fileSystem.ReadFile(calls.back()), file.dump(2));
      }
    }
  }
}

// A key whose text outgrows memory goes to the spool in pieces; the summary puts them together
// again in order, the key order unchanged.
TEST_F(SummaryTest, LongTextsSpillToTheSpoolAndComeBackWhole) {
  auto session = Started(3);
  std::string longs, shorts;
  for (int i = 0; i < 400; ++i) {
    const std::string text = std::string(size_t(i % 50), 'a' + char(i % 26)) + std::to_string(i);
    session->sendMessage(Dictionary{{"long", text}, {"short", i % 2}}, 1, 1, nullptr);
    longs += (i ? "," : "") + text;
    shorts += (i ? "," : "") + std::to_string(i % 2);
  }
  platform.dispatcher.RunUntilIdle();
  size_t pieces = 0;
  session->spool()->Replay([&](const Value& record) { pieces += record[0] == "k" ? 1 : 0; });
  EXPECT_GE(pieces, 2u);
  EXPECT_EQ(session->createSummaryEventForSession(),
            (Dictionary{{"Ruvo_Session_Summary_Event", "3"}, {"long", longs}, {"short", shorts}}));
}

// A full spool says so once and keeps what it has; the summary event stays whole because texts
// that cannot spill stay in memory, and the file lists the messages spooled before it filled.
TEST_F(SummaryTest, AFullSpoolLeavesLaterMessagesOutOfTheFileButNotOfTheSummary) {
  platform.services.spoolBytesPerSession = 600;
  auto session = Started(3);
  std::string joined;
  for (int i = 0; i < 100; ++i) {
    session->sendMessage(Dictionary{{"k", std::string(100, 'k') + std::to_string(i)}}, 1, 1,
                         nullptr);
    platform.dispatcher.RunUntilIdle();
    joined += (i ? "," : "") + std::string(100, 'k') + std::to_string(i);
  }
  platform.dispatcher.RunUntilIdle();
  const size_t spooled = Entries(session->spool()).size();
  EXPECT_GT(spooled, 0u);
  EXPECT_LT(spooled, 10u);
  EXPECT_EQ(session->createSummaryEventForSession(),
            (Dictionary{{"Ruvo_Session_Summary_Event", "3"}, {"k", joined}}));
  StopAndRun(session);
  const auto errors = log.Messages(LogLevel::kError, "rvrr");
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_NE(errors[0].find("the spool is full"), std::string::npos) << errors[0];
  const Value file =
      Value::parse(*platform.fileSystem.ReadFile(platform.fileSystem.WriteCalls().back()));
  EXPECT_EQ(file.size(), spooled + 2) << "user info, the spooled messages, the summary";
}

// What a crash leaves: the spool of an open session. Recovery sends its summary through a session
// marked as recovered, with the file named so, and removes the spool; a torn last record only
// loses that record, and a spool without its header is removed with nothing sent.
TEST_F(SummaryTest, ASpoolLeftByACrashBecomesARecoveredSummary) {
  auto session = Started(3, Dictionary{{"HostApplicationDisplayID", "app"}});
  for (int i = 0; i < 3; ++i) session->sendMessage(Dictionary{{"n", i}}, 1, 1, nullptr);
  platform.dispatcher.RunUntilIdle();
  const std::string spooled = *platform.fileSystem.ReadFile(session->spool()->path());
  const std::string directory = FakePlatform::kSpoolDirectory;
  // Records are a 4-byte little-endian length and their bytes; the header comes first.
  const size_t headerBytes = 4 + (uint8_t(spooled[0]) | size_t(uint8_t(spooled[1])) << 8);
  const struct {
    std::string name, contents, numbers;
  } cases[] = {
      {"whole", spooled, "0,1,2"},
      {"torn", spooled.substr(0, spooled.size() - 3), "0,1"},
      {"headless", spooled.substr(headerBytes), ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string path = directory + "/" + c.name + ".spool";
    ASSERT_EQ(platform.fileSystem.WriteFileAtomically(path, c.contents), std::nullopt);
    const size_t sessions = platform.telvoro.Sessions().size();
    RuvoReportingSession::recover(platform.services, path);
    platform.dispatcher.RunUntilIdle();
    EXPECT_FALSE(platform.fileSystem.ReadFile(path)) << "the spool is removed";
    if (c.numbers.empty()) {
      EXPECT_EQ(platform.telvoro.Sessions().size(), sessions);
      continue;
    }
    ASSERT_EQ(platform.telvoro.Sessions().size(), sessions + 1);
    const auto recovered = platform.telvoro.LastSession();
    EXPECT_EQ(recovered->SessionInfo()["Recovered"], true);
    EXPECT_EQ(recovered->SessionInfo()["SessionID"], 42);
    const auto messages = recovered->Messages();
    ASSERT_EQ(messages.size(), 1u);
    EXPECT_EQ(messages[0].payload,
              (Dictionary{{"Ruvo_Session_Summary_Event", "3"}, {"n", c.numbers}}));
    const std::string file = platform.fileSystem.WriteCalls().back();
    EXPECT_TRUE(file.ends_with("-tavrin-app-haptics-recovered.json")) << file;
    const Value entries = Value::parse(*platform.fileSystem.ReadFile(file));
    EXPECT_EQ(entries.front(), (Dictionary{{"HostApplicationDisplayID", "app"}}));
    // The summary continues the session's count of its kind.
    EXPECT_EQ(entries.back().begin().key(), "Undefined_Unknown_1");
  }
  // No back-end within the wait: the spool stays for the next start to try again.
  platform.telvoro.SetDiscovery(FakeTelvoroService::Discovery::kAnswerNil);
  const std::string path = directory + "/later.spool";
  ASSERT_EQ(platform.fileSystem.WriteFileAtomically(path, spooled), std::nullopt);
  RuvoReportingSession::recover(platform.services, path);
  platform.dispatcher.RunUntilIdle();
  platform.dispatcher.AdvanceBy(std::chrono::seconds(10));
  EXPECT_EQ(platform.fileSystem.ReadFile(path), spooled);
}

TEST_F(SummaryTest, WritingPutsTheUserInfoFirstEveryTime) {
  auto session = Started(3, Dictionary{{"k", "v"}});
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  platform.dispatcher.RunUntilIdle();
  session->writeSummaryJson();
  session->writeSummaryJson();
  const Value info{{"k", "v"}};
  const Value file = Value::array({info, info, Value{{"Generic_Start_1", Value{{"a", 1}}}}});
  ASSERT_FALSE(platform.fileSystem.WriteCalls().empty());
  EXPECT_EQ(platform.fileSystem.ReadFile(platform.fileSystem.WriteCalls().back()), file.dump(2));
}

// The serialisation, directory and write steps share one error slot: the last line reports the
// error of an earlier step again unless the write had its own.
TEST_F(SummaryTest, FileErrorsAreLoggedAndTheStepsAfterThemStillRun) {
  const std::string d = std::string("can't create logging directory at ") + kDirectory + ": ";
  const std::string w = "jsonOutput writeToURL: ";
  auto failure = [](const char* text) {
    return text ? OptionalError(Error{"posix", 1, text}) : std::nullopt;
  };
  const struct {
    bool directoryExists;
    const char *createError, *writeError, *value;
    std::vector<std::string> errors;  // the start of each error line
    size_t files;
  } cases[] = {
      {true, "denied", nullptr, "x", {d + "denied", w + "denied"}, 1},
      {false, nullptr, "full", "x", {w + "full"}, 0},
      {false, "read-only", nullptr, "x", {d + "read-only", w + "No such file or directory"}, 0},
      // Not UTF-8: nothing is written, yet the directory is made.
      {false, nullptr, nullptr, "\xff\xfe", {"dataWithJSONObject: ", w}, 0},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.errors.front());
    FakeFileSystem files;
    files.AddDirectory(FakePlatform::kSpoolDirectory);
    if (c.directoryExists) files.AddDirectory(kDirectory);
    files.FailCreateDirectories(failure(c.createError));
    files.FailWrites(failure(c.writeError));
    platform.services.fileSystem = &files;
    log.Clear();
    auto session = Started(3);
    session->sendMessage(Dictionary{{"bad", c.value}}, 1, 1, nullptr);
    StopAndRun(session);
    platform.services.fileSystem = &platform.fileSystem;

    const auto errors = log.Messages(LogLevel::kError, "rvrr");
    ASSERT_EQ(errors.size(), c.errors.size());
    for (size_t i = 0; i < errors.size(); ++i) EXPECT_EQ(errors[i].rfind(c.errors[i], 0), 0u);
    const bool valid = std::string(c.value) == "x";
    EXPECT_TRUE(valid || errors[1] == w + errors[0].substr(20)) << errors[1];
    EXPECT_EQ(files.CreateDirectoriesCalls().size(), 1u);
    EXPECT_EQ(files.WriteCalls().size(), valid ? 1u : 0u);
    EXPECT_EQ(files.Files().size(), c.files);
  }
}

}  // namespace
}  // namespace tavrin::testing
