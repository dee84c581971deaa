#include "platform/linux/log/SpdlogLogSystem.h"

#include <gtest/gtest.h>
#include <spdlog/sinks/base_sink.h>
#include <sys/stat.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/log/JournalSink.h"

namespace tavrin {
namespace {

// Counts how often fmt formats it, to prove that filtered lines are never formatted.
struct Counted {
  std::atomic<int>* calls;
};

}  // namespace
}  // namespace tavrin

template <>
struct fmt::formatter<tavrin::Counted> : fmt::formatter<std::string_view> {
  auto format(const tavrin::Counted& counted, fmt::format_context& ctx) const {
    counted.calls->fetch_add(1);
    return fmt::formatter<std::string_view>::format("counted", ctx);
  }
};

namespace tavrin {
namespace {

struct Recorded {
  std::string scope;
  spdlog::level::level_enum level;
  std::string payload;
  std::string formatted;
};

class RecordingSink final : public spdlog::sinks::base_sink<std::mutex> {
 public:
  std::vector<Recorded> Lines() {
    std::lock_guard lock(mutex_);
    return lines_;
  }

 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override {
    spdlog::memory_buf_t formatted;
    formatter_->format(msg, formatted);
    lines_.push_back(Recorded{std::string(msg.logger_name.data(), msg.logger_name.size()),
                              msg.level, std::string(msg.payload.data(), msg.payload.size()),
                              fmt::to_string(formatted)});
  }
  void flush_() override {}

 private:
  std::vector<Recorded> lines_;  // guarded by mutex_
};

class MemoryDefaults final : public DefaultsDomain {
 public:
  Dictionary Read() override {
    std::lock_guard lock(mutex_);
    return values_;
  }
  void Set(const std::string& key, Value value) {
    std::lock_guard lock(mutex_);
    values_[key] = std::move(value);
  }
  void Erase(const std::string& key) {
    std::lock_guard lock(mutex_);
    values_.erase(key);
  }

 private:
  std::mutex mutex_;
  Dictionary values_ = MakeDictionary();
};

constexpr const char* kKey = "reporting_server_verbose";

// The text after a "YYYY-MM-DD HH:MM:SS.mmm " time stamp, or nothing if `line` does not start
// with one.
std::optional<std::string> AfterTimeStamp(std::string_view line) {
  constexpr std::string_view kShape = "0000-00-00 00:00:00.000 ";
  if (line.size() < kShape.size()) return std::nullopt;
  for (size_t i = 0; i < kShape.size(); ++i) {
    const bool digit = line[i] >= '0' && line[i] <= '9';
    if (kShape[i] == '0' ? !digit : line[i] != kShape[i]) return std::nullopt;
  }
  return std::string(line.substr(kShape.size()));
}

class SpdlogLogSystemTest : public ::testing::Test {
 protected:
  LogHandle RegisterServerScope(bool enabled = true) {
    return system_.RegisterLogScope(enabled, FourCharCode("rvrs"), "rvrs", "com.quorvex.tavrin",
                                    kKey, 31);
  }

  MemoryDefaults defaults_;
  std::shared_ptr<RecordingSink> sink_ = std::make_shared<RecordingSink>();
  SpdlogLogSystem system_{defaults_, sink_};
};

TEST_F(SpdlogLogSystemTest, DebugLinesPassOnlyAtVerboseLevelAfterRefresh) {
  std::atomic<int> calls{0};
  LogHandle handle = RegisterServerScope();
  EXPECT_FALSE(handle->ShouldLog(LogLevel::kDebug));
  EXPECT_TRUE(handle->ShouldLog(LogLevel::kInfo));
  EXPECT_TRUE(handle->ShouldLog(LogLevel::kDefault));
  EXPECT_TRUE(handle->ShouldLog(LogLevel::kError));

  TLOG_DEBUG(handle, "quiet {}", Counted{&calls});
  defaults_.Set(kKey, 4);
  system_.Refresh();
  TLOG_DEBUG(handle, "still quiet {}", Counted{&calls});
  defaults_.Set(kKey, 5);
  TLOG_DEBUG(handle, "not refreshed yet {}", Counted{&calls});
  EXPECT_EQ(calls.load(), 0) << "a filtered line formatted its arguments";
  EXPECT_TRUE(sink_->Lines().empty());

  system_.Refresh();
  TLOG_DEBUG(handle, "now heard {}", Counted{&calls});
  EXPECT_EQ(calls.load(), 1);
  ASSERT_EQ(sink_->Lines().size(), 1u);
  EXPECT_EQ(sink_->Lines()[0].level, spdlog::level::debug);
  EXPECT_NE(sink_->Lines()[0].payload.find("now heard counted"), std::string::npos);
}

// Components without a scope of their own (the block throttle) write to the default log: its
// debug lines too can be switched on, by their own key.
TEST_F(SpdlogLogSystemTest, DefaultLogDebugLinesFollowTheirOwnKey) {
  LogScope& log = system_.DefaultLog();
  EXPECT_FALSE(log.ShouldLog(LogLevel::kDebug));
  defaults_.Set(SpdlogLogSystem::kDefaultLogVerbosityKey, 5);
  system_.Refresh();
  TLOG_DEBUG(log, "heard");
  ASSERT_EQ(sink_->Lines().size(), 1u);
  EXPECT_NE(sink_->Lines()[0].payload.find("heard"), std::string::npos);
  defaults_.Set(SpdlogLogSystem::kDefaultLogVerbosityKey, 0);
  system_.Refresh();
  EXPECT_FALSE(log.ShouldLog(LogLevel::kDebug));
}

TEST_F(SpdlogLogSystemTest, VerbosityValuesOfEveryType) {
  LogHandle handle = RegisterServerScope();
  auto verboseAfter = [&](Value value) {
    defaults_.Set(kKey, std::move(value));
    system_.Refresh();
    return handle->ShouldLog(LogLevel::kDebug);
  };
  EXPECT_TRUE(verboseAfter(true));
  EXPECT_FALSE(verboseAfter(false));
  EXPECT_TRUE(verboseAfter(9));
  EXPECT_FALSE(verboseAfter(-1));
  EXPECT_TRUE(verboseAfter(uint64_t(1) << 63)) << "huge values saturate, they do not wrap";
  EXPECT_FALSE(verboseAfter("5")) << "a string is not a verbosity";
  EXPECT_FALSE(verboseAfter(5.5)) << "a double is not a verbosity";
  EXPECT_TRUE(verboseAfter(5));
  defaults_.Erase(kKey);
  system_.Refresh();
  EXPECT_FALSE(handle->ShouldLog(LogLevel::kDebug)) << "a removed key turns verbosity off";
}

TEST_F(SpdlogLogSystemTest, DisabledScopeWritesNothing) {
  std::atomic<int> calls{0};
  defaults_.Set(kKey, 5);
  LogHandle handle = RegisterServerScope(false);
  TLOG_ERROR(handle, "error {}", Counted{&calls});
  TLOG_DEBUG(handle, "debug {}", Counted{&calls});
  handle->Write(LogLevel::kError, "written directly");
  EXPECT_EQ(calls.load(), 0);
  EXPECT_TRUE(sink_->Lines().empty());
}

TEST_F(SpdlogLogSystemTest, MacrosWriteBaseNameLineAndFunctionPrefix) {
  LogHandle handle = RegisterServerScope();
  const int line = __LINE__ + 1;
  TLOG_DEFAULT(handle, "notify setup result {}", 0);
  TLOG_ERROR(handle, "failed to find reporting session {}", int64_t{-7});
  const auto lines = sink_->Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].payload,
            fmt::format("SpdlogLogSystemTest.cpp:{}:TestBody: notify setup result 0", line));
  EXPECT_EQ(lines[1].payload,
            fmt::format("SpdlogLogSystemTest.cpp:{}:TestBody: failed to find reporting session -7",
                        line + 1));
  EXPECT_EQ(lines[1].level, spdlog::level::err);
}

TEST_F(SpdlogLogSystemTest, FormattedLineHasTimeLevelScopeAndText) {
  LogHandle handle = RegisterServerScope();
  handle->Write(LogLevel::kDefault, "a default line");
  handle->Write(LogLevel::kError, "an error line");
  const auto lines = sink_->Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(AfterTimeStamp(lines[0].formatted), "default rvrs: a default line\n")
      << lines[0].formatted;
  EXPECT_EQ(AfterTimeStamp(lines[1].formatted), "error rvrs: an error line\n")
      << lines[1].formatted;
}

TEST_F(SpdlogLogSystemTest, ConcurrentWritersAndRefreshLoseNoLine) {
  constexpr int kThreads = 4;
  constexpr int kLinesPerThread = 400;
  LogHandle handle = RegisterServerScope();
  std::atomic<bool> stop{false};
  std::thread toggler([&] {
    for (int round = 0; !stop.load(); ++round) {
      defaults_.Set(kKey, round % 2 == 0 ? 5 : 0);
      system_.Refresh();
      // Registration races with writers and Refresh too.
      LogHandle extra = system_.RegisterLogScope(true, FourCharCode("rvrr"), "rvrr",
                                                 "com.quorvex.tavrin", kKey, 31);
      std::this_thread::yield();
    }
  });
  std::vector<std::thread> writers;
  for (int t = 0; t < kThreads; ++t) {
    writers.emplace_back([&, t] {
      for (int i = 0; i < kLinesPerThread; ++i) {
        TLOG_DEFAULT(handle, "writer {} line {}", t, i);
        TLOG_DEBUG(handle, "writer {} debug {}", t, i);
      }
    });
  }
  for (auto& writer : writers) writer.join();
  stop = true;
  toggler.join();

  // Every default line arrives once and whole; debug lines only while verbose.
  std::set<std::string> seen;
  int debugs = 0;
  for (const auto& line : sink_->Lines()) {
    constexpr std::string_view kPrefix = "SpdlogLogSystemTest.cpp:";
    ASSERT_EQ(line.payload.rfind(kPrefix, 0), 0u) << line.payload;
    const size_t text = line.payload.find(":operator(): ");
    ASSERT_NE(text, std::string::npos) << line.payload;
    if (line.level == spdlog::level::debug) {
      ++debugs;
    } else {
      EXPECT_TRUE(seen.insert(line.payload.substr(text)).second) << "twice: " << line.payload;
    }
  }
  std::set<std::string> expected;
  for (int t = 0; t < kThreads; ++t) {
    for (int i = 0; i < kLinesPerThread; ++i) {
      expected.insert(fmt::format(":operator(): writer {} line {}", t, i));
    }
  }
  EXPECT_EQ(seen, expected);
  EXPECT_LE(debugs, kThreads * kLinesPerThread);
}

// --- journal -----------------------------------------------------------------------------------

TEST(JournalSinkTest, SendsMessagePriorityScopeSubsystemAndIdentifier) {
  std::mutex mutex;
  std::vector<std::vector<std::string>> sent;
  auto sink = std::make_shared<JournalSink>("com.quorvex.tavrin",
                                            [&](const std::vector<std::string>& fields) {
                                              std::lock_guard lock(mutex);
                                              sent.push_back(fields);
                                              return 0;
                                            });
  spdlog::logger logger("rvrs", sink);
  logger.set_level(spdlog::level::trace);
  for (LogLevel level : {LogLevel::kDebug, LogLevel::kInfo, LogLevel::kDefault, LogLevel::kError}) {
    logger.log(spdlog::source_loc{}, SpdlogLevel(level),
               spdlog::string_view_t("File.cpp:1:f: 100% {}"));
  }
  ASSERT_EQ(sent.size(), 4u);
  const char* priorities[] = {"7", "6", "5", "3"};
  for (size_t i = 0; i < sent.size(); ++i) {
    EXPECT_EQ(sent[i], (std::vector<std::string>{
                           "MESSAGE=File.cpp:1:f: 100% {}",
                           std::string("PRIORITY=") + priorities[i],
                           "SYSLOG_IDENTIFIER=tavrind",
                           "TAVRIN_SCOPE=rvrs",
                           "TAVRIN_SUBSYSTEM=com.quorvex.tavrin",
                       }));
  }
  EXPECT_EQ(sink->FailedSends(), 0u);
}

}  // namespace
}  // namespace tavrin
