// The summary event sent at stop and the summary file written on internal builds.

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "tests/support/SessionTestSupport.h"

namespace tavrin::testing {
namespace {

constexpr const char* kDirectory = "/fake/log/DiagnosticLogs/Audio/Reporting";

class SummaryTest : public SessionTestBase {
 protected:
  ~SummaryTest() override {
    setenv("TZ", "UTC", 1);
    tzset();
  }

  std::shared_ptr<RuvoReportingSession> Started(uint16_t serviceType,
                                                const Dictionary& configuration = Dictionary()) {
    auto session = Create(42, serviceType);
    session->setConfiguration(configuration);
    session->start();
    platform.dispatcher.RunUntilIdle();
    return session;
  }

  std::string OnlyFilePath() {
    const auto files = platform.fileSystem.Files();
    EXPECT_EQ(files.size(), 1u);
    return files.empty() ? std::string() : files.begin()->first;
  }
};

// --- the summary event ------------------------------------------------------------------------

TEST_F(SummaryTest, NothingAggregatedMeansNoSummaryAndNoFile) {
  auto session = Started(3);
  EXPECT_FALSE(session->createSummaryEventForSession().has_value());
  session->stop();
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("sending summary event for reporter 42"), 0u);
  EXPECT_TRUE(platform.telvoro.LastSession()->Messages().empty());
  EXPECT_TRUE(platform.fileSystem.Files().empty());
  EXPECT_TRUE(platform.fileSystem.WriteCalls().empty());
}

TEST_F(SummaryTest, StopSendsTheSummaryThroughTheSessionsOwnPath) {
  auto session = Started(3);
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  platform.dispatcher.RunUntilIdle();
  EXPECT_EQ(CountMessage("sending summary event for reporter 42", LogLevel::kDefault), 1u);
  const auto messages = platform.telvoro.LastSession()->Messages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[1].category, 0xFFFF);
  EXPECT_EQ(messages[1].type, 0xFFFF);
  EXPECT_EQ(messages[1].payload, (Dictionary{{"Ruvo_Session_Summary_Event", "3"}, {"a", "1"}}));
  // Counted like any message.
  EXPECT_EQ(session->messageTypeCounts()["Undefined_Unknown"], 1);
}

// --- the summary file -------------------------------------------------------------------------

TEST_F(SummaryTest, TheFileIsNamedByTimeAppAndServiceInAPrivateDirectory) {
  auto session = Started(3, Dictionary{{"HostApplicationDisplayID", "com.example.player"}});
  session->sendMessage(Dictionary{{"a", 1}, {"b", "x"}}, 0x80000001, 1, nullptr);
  session->sendMessage(Dictionary{{"a", 2}}, 0x80000001, 1, nullptr);
  session->stop();

  const std::string path = OnlyFilePath();
  EXPECT_EQ(path, std::string(kDirectory) +
                      "/20261116-052745+0000-tavrin-com.example.player-haptics.json");
  const auto creates = platform.fileSystem.CreateDirectoriesCalls();
  ASSERT_EQ(creates.size(), 1u);
  EXPECT_EQ(creates[0].first, kDirectory);
  EXPECT_EQ(creates[0].second, 0750u);
  EXPECT_TRUE(SessionMessages(LogLevel::kError).empty());
}

TEST_F(SummaryTest, TheFileNameUsesLocalTimeTheAppNameAndTheServiceName) {
  setenv("TZ", "XYZ-5:30", 1);  // five and a half hours east of UTC
  tzset();
  auto session = Started(200);  // a service type without a name
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  EXPECT_EQ(OnlyFilePath(),
            std::string(kDirectory) + "/20261116-105745+0530-tavrin-unknown-(null).json");
}

TEST_F(SummaryTest, AnAppNameCannotLeaveTheDirectory) {
  auto session = Started(2, Dictionary{{"HostApplicationDisplayID", "../../etc/x"}});
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  EXPECT_EQ(OnlyFilePath(),
            std::string(kDirectory) + "/20261116-052745+0000-tavrin-.._.._etc_x-telephony.json");
}

// Generated sessions (seeded): the summary event and file, built as messages arrive, must equal
// what the plain algorithm makes from every message of the round at stop.
TEST_F(SummaryTest, GeneratedSessionsMatchThePlainAlgorithm) {
  std::mt19937 random(20261124);
  auto pick = [&](size_t n) { return static_cast<size_t>(random() % n); };
  const std::vector<std::string> keys{
      "a", "a b", "a_b", " k ", "_k_", "Ruvo_Session_Summary_Event", "n.m", "", "z"};
  auto value = [&]() -> Value {
    switch (pick(7)) {
      case 0:
        return static_cast<int64_t>(random()) - (1LL << 31);
      case 1:
        return pick(1000) / 8.0;
      case 2:
        return pick(2) == 0;
      case 3:
        return nullptr;
      case 4:
        return Value::array({1, "x", Value{{"in", 2.5}}});
      case 5:
        return Value{{"o", Value::array()}};
      default:
        return std::string(pick(4), 'v') + "w,x y";
    }
  };
  for (int sessionIndex = 0; sessionIndex < 300; ++sessionIndex) {
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
      Dictionary texts{{"Ruvo_Session_Summary_Event", Value::array({std::to_string(serviceType)})}};
      Value file = Value::array({info.is_null() ? Dictionary::object() : info});
      for (const auto& [id, payload] : sent) {
        for (const auto& item : payload.items()) {
          if (!texts.contains(item.key())) texts[item.key()] = Value::array();
          texts[item.key()].push_back(ValueText(item.value()));
        }
        file.push_back(Value{{id, payload}});
      }
      std::optional<Dictionary> expected;
      if (!sent.empty()) {
        expected = Dictionary::object();
        for (const auto& item : texts.items()) {
          std::string joined;
          for (size_t i = 0; i < item.value().size(); ++i) {
            joined += (i > 0 ? "," : "") + item.value()[i].get<std::string>();
          }
          (*expected)[item.key()] = joined;
        }
        // The summary event is itself a message of the session.
        file.push_back(Value{{"Undefined_Unknown_" + std::to_string(++summaryCount), *expected}});
      }
      const auto summary = session->createSummaryEventForSession();
      ASSERT_EQ(summary.has_value(), expected.has_value()) << sessionIndex;
      if (summary) {
        ASSERT_EQ(summary->dump(), expected->dump()) << sessionIndex;
      }
      const size_t writes = platform.fileSystem.WriteCalls().size();
      session->stop();
      ASSERT_EQ(platform.fileSystem.WriteCalls().size(), writes + (sent.empty() ? 0 : 1));
      if (!sent.empty()) {
        ASSERT_EQ(platform.fileSystem.ReadFile(platform.fileSystem.WriteCalls().back()),
                  file.dump(2))
            << sessionIndex;
      }
    }
  }
}

TEST_F(SummaryTest, WritingPutsTheUserInfoFirstEveryTime) {
  auto session = Started(3, Dictionary{{"k", "v"}});
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->writeSummaryJson();
  session->writeSummaryJson();
  const auto entries = Entries(session->nestedAggregatedPayloadData());
  ASSERT_EQ(entries.size(), 3u);
  EXPECT_EQ(entries[0], (Dictionary{{"k", "v"}}));
  EXPECT_EQ(entries[1], (Dictionary{{"k", "v"}}));
}

TEST_F(SummaryTest, ADirectoryErrorIsLoggedTwiceAndTheWriteStillHappens) {
  platform.fileSystem.AddDirectory(kDirectory);
  platform.fileSystem.FailCreateDirectories(Error{"posix", 13, "Permission denied"});
  auto session = Started(3);
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  EXPECT_EQ(SessionMessages(LogLevel::kError),
            (std::vector<std::string>{std::string("can't create logging directory at ") +
                                          kDirectory + ": Permission denied",
                                      "jsonOutput writeToURL: Permission denied"}));
  EXPECT_EQ(platform.fileSystem.Files().size(), 1u);
}

TEST_F(SummaryTest, AWriteErrorIsLoggedOnce) {
  platform.fileSystem.FailWrites(Error{"posix", 28, "No space left on device"});
  auto session = Started(3);
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  EXPECT_EQ(SessionMessages(LogLevel::kError),
            std::vector<std::string>{"jsonOutput writeToURL: No space left on device"});
  EXPECT_TRUE(platform.fileSystem.Files().empty());
}

TEST_F(SummaryTest, AMissingDirectoryFailsBothSteps) {
  platform.fileSystem.FailCreateDirectories(Error{"posix", 30, "Read-only file system"});
  auto session = Started(3);
  session->sendMessage(Dictionary{{"a", 1}}, 1, 1, nullptr);
  session->stop();
  const auto errors = SessionMessages(LogLevel::kError);
  ASSERT_EQ(errors.size(), 2u);
  EXPECT_EQ(errors[0], std::string("can't create logging directory at ") + kDirectory +
                           ": Read-only file system");
  // The write's own error replaces the directory's in the shared slot.
  EXPECT_EQ(errors[1].rfind("jsonOutput writeToURL: No such file or directory", 0), 0u);
}

TEST_F(SummaryTest, AnUnserialisableEntryIsReportedAndNothingIsWritten) {
  auto session = Started(3);
  session->sendMessage(Dictionary{{"bad", std::string("\xff\xfe")}}, 1, 1, nullptr);
  session->stop();
  const auto errors = SessionMessages(LogLevel::kError);
  ASSERT_EQ(errors.size(), 2u);
  EXPECT_EQ(errors[0].rfind("dataWithJSONObject: ", 0), 0u);
  EXPECT_EQ(errors[1], "jsonOutput writeToURL: " + errors[0].substr(20));
  EXPECT_TRUE(platform.fileSystem.WriteCalls().empty());
  // The directory is made all the same.
  EXPECT_EQ(platform.fileSystem.CreateDirectoriesCalls().size(), 1u);
}

}  // namespace
}  // namespace tavrin::testing
