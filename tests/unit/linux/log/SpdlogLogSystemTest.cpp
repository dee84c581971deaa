#include "platform/linux/log/SpdlogLogSystem.h"

#include <mutex>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <spdlog/sinks/base_sink.h>

#include "platform/linux/log/JournalSink.h"
#include "tests/fakes/FakeDefaultsDomain.h"

namespace tavrin {
namespace {

// Each line as standard error would show it, with its level.
class RecordingSink final : public spdlog::sinks::base_sink<std::mutex> {
 public:
  std::vector<std::pair<spdlog::level::level_enum, std::string>> Lines() {
    std::lock_guard lock(mutex_);
    return lines_;
  }

 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override {
    spdlog::memory_buf_t formatted;
    formatter_->format(msg, formatted);
    lines_.emplace_back(msg.level, fmt::to_string(formatted));
  }
  void flush_() override {}

 private:
  std::vector<std::pair<spdlog::level::level_enum, std::string>> lines_;  // guarded by mutex_
};

constexpr const char* kKey = "reporting_server_verbose";

class SpdlogLogSystemTest : public ::testing::Test {
 protected:
  LogHandle RegisterScope(bool enabled = true) {
    return system_.RegisterLogScope(enabled, FourCharCode("rvrs"), "rvrs", "com.quorvex.tavrin",
                                    kKey, 31);
  }

  testing::FakeDefaultsDomain defaults_;
  std::shared_ptr<RecordingSink> sink_ = std::make_shared<RecordingSink>();
  SpdlogLogSystem system_{defaults_, sink_};
};

// Verbosity is read at registration and on Refresh only. The default log (components without a
// scope of their own) follows a key of its own.
TEST_F(SpdlogLogSystemTest, DebugLinesFollowTheVerbosityValueAsOfTheLastRefresh) {
  LogHandle handle = RegisterScope();
  LogHandle disabled = RegisterScope(false);
  // "VALUE VERBOSE": huge values saturate, they do not wrap; strings and doubles are no verbosity.
  for (std::string_view c : {"true 1", "false 0", "9 1", "-1 0", "5 1", "4 0", "\"5\" 0", "5.5 0",
                             "null 0", "9223372036854775808 1"}) {
    const Value value = Value::parse(c.substr(0, c.find(' ')));
    const bool verbose = c.back() == '1';
    for (const char* key : {kKey, SpdlogLogSystem::kDefaultLogVerbosityKey}) {
      defaults_.Set(key, !verbose);  // the opposite first, so that the case changes something
    }
    system_.Refresh();
    defaults_.Set(kKey, value);
    defaults_.Set(SpdlogLogSystem::kDefaultLogVerbosityKey, value);
    EXPECT_NE(handle->ShouldLog(LogLevel::kDebug), verbose) << "before Refresh: " << value.dump();
    system_.Refresh();
    EXPECT_EQ(handle->ShouldLog(LogLevel::kDebug), verbose) << value.dump();
    EXPECT_EQ(system_.DefaultLog().ShouldLog(LogLevel::kDebug), verbose) << value.dump();
    TLOG_DEBUG(handle, "debug");
    TLOG_ERROR(disabled, "from a disabled scope");
  }
  EXPECT_EQ(sink_->Lines().size(), 4u);
  defaults_.Remove(kKey);
  system_.Refresh();
  EXPECT_FALSE(handle->ShouldLog(LogLevel::kDebug)) << "a removed key turns verbosity off";
  EXPECT_TRUE(handle->ShouldLog(LogLevel::kInfo));
}

TEST(JournalSinkTest, SendsMessagePriorityScopeSubsystemAndIdentifierAndCountsRefusals) {
  std::vector<std::vector<std::string>> sent;
  auto sink = std::make_shared<JournalSink>(
      "com.quorvex.tavrin", [&](const std::vector<std::string>& fields) {
        sent.push_back(fields);
        return sent.size() == 4 ? -11 : 0;  // the journal refuses the last one
      });
  spdlog::logger logger("rvrs", sink);
  logger.set_level(spdlog::level::trace);
  for (LogLevel level : {LogLevel::kDebug, LogLevel::kInfo, LogLevel::kDefault, LogLevel::kError}) {
    logger.log(spdlog::source_loc{}, SpdlogLevel(level), spdlog::string_view_t("F:1:f: 100% {}"));
  }
  ASSERT_EQ(sent.size(), 4u);
  const char* priorities[] = {"7", "6", "5", "3"};
  for (size_t i = 0; i < sent.size(); ++i) {
    EXPECT_EQ(sent[i], (std::vector<std::string>{"MESSAGE=F:1:f: 100% {}",
                                                 std::string("PRIORITY=") + priorities[i],
                                                 "SYSLOG_IDENTIFIER=tavrind", "TAVRIN_SCOPE=rvrs",
                                                 "TAVRIN_SUBSYSTEM=com.quorvex.tavrin"}));
  }
  EXPECT_EQ(sink->FailedSends(), 1u);
}

}  // namespace
}  // namespace tavrin
