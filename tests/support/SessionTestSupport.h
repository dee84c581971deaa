#pragma once

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/LogSystem.h"
#include "tests/fakes/FakeLogSystem.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/fakes/FakeTraceRecorder.h"

namespace tavrin::testing {

// The log facility of a whole test executable. Sessions register their log scope once per
// process, with whichever facility is installed at the time, so that facility must outlive every
// test: it is made on first use and never destroyed.
inline FakeLogSystem& ProcessLogSystem() {
  static FakeLogSystem* const system = new FakeLogSystem();
  return *system;
}

// Base of the session tests: a fresh fake platform per test, the process's log facility cleared,
// trace points recorded, local time in UTC. The internal-build answer is fixed for the life of
// the process at its first use, so every test of one executable must ask for the same answer.
class SessionTestBase : public ::testing::Test {
 protected:
  explicit SessionTestBase(bool internalBuild = true) : log(ProcessLogSystem()) {
    log.Clear();
    log.SetVerbose(true);
    log.FailRegistrations(false);
    platform.deviceInfo.SetBool(kDeviceInfoInternalBuild, internalBuild);
    setenv("TZ", "UTC", 1);
    tzset();
  }

  std::shared_ptr<RuvoReportingSession> Create(int64_t reporterID = 42, uint16_t serviceType = 3) {
    auto session = RuvoReportingSession::create(reporterID, {1234}, platform.services);
    session->setServiceType(serviceType);
    return session;
  }
  // A session given `configuration` and started, with the queued half of start run (up to the
  // back-end wait).
  std::shared_ptr<RuvoReportingSession> Started(uint16_t serviceType = 3,
                                                const Dictionary& configuration = Dictionary(),
                                                int64_t reporterID = 42) {
    auto session = Create(reporterID, serviceType);
    session->setConfiguration(configuration);
    StartAndRun(session);
    return session;
  }
  void StartAndRun(const std::shared_ptr<RuvoReportingSession>& session) {
    session->start();
    platform.dispatcher.RunUntilIdle();
  }
  void StopAndRun(const std::shared_ptr<RuvoReportingSession>& session) {
    session->stop();
    platform.dispatcher.RunUntilIdle();
  }

  // Lines whose message (prefix removed) is `message`, of `level` when given.
  size_t CountMessage(const std::string& message, std::optional<LogLevel> level = {}) const {
    return static_cast<size_t>(std::ranges::count(log.Messages(level), message));
  }

  // Payloads aggregated, none when the aggregation is gone.
  static size_t Aggregated(const std::shared_ptr<SummaryTexts>& texts) {
    return texts ? texts->payloadCount() : 0;
  }
  // The messages in a spool as the summary file lists them: {message id: payload}.
  static std::vector<Value> Entries(const std::shared_ptr<SessionSpool>& spool) {
    std::vector<Value> entries;
    if (!spool) return entries;
    spool->Replay([&](const Value& record) {
      if (record[0] == "m") entries.push_back(Value{{record[1].get<std::string>(), record[2]}});
    });
    return entries;
  }

  FakeLogSystem& log;
  FakePlatform platform;
  RecordingTraceRecorder traces;
};

}  // namespace tavrin::testing
