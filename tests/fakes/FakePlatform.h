#pragma once

#include "platform/Platform.h"
#include "tests/fakes/FakeAnalyticsSink.h"
#include "tests/fakes/FakeClock.h"
#include "tests/fakes/FakeDeviceInfoQuery.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeDriverStatsService.h"
#include "tests/fakes/FakeFileSystem.h"
#include "tests/fakes/FakeOrientationRegistry.h"
#include "tests/fakes/FakePowerEventLog.h"
#include "tests/fakes/FakeRandomSource.h"
#include "tests/fakes/FakeTelvoroSession.h"

namespace tavrin::testing {

// One fake of each platform service, gathered in `services`, the context a test passes to the
// objects it makes. Time moves
// only through `dispatcher` (or `clock`); nothing runs until the test runs the dispatcher.
//
// Members are declared so that the dispatcher goes first on destruction: work still queued may
// hold sessions, and those hold references into the other fakes.
struct FakePlatform {
  FakePlatform();
  ~FakePlatform();
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;

  static constexpr const char* kDiagnosticDirectory = "/fake/log/DiagnosticLogs";
  static constexpr const char* kSpoolDirectory = "/fake/lib/spool";

  FakeClock clock;
  FakeRandom random;
  FakeTelvoroService telvoro;
  FakeAnalyticsSink analytics;
  FakePowerEventLog powerLog;
  FakeDriverStatsService driverStats;
  FakeOrientationRegistry orientation;
  FakeDeviceInfo deviceInfo;
  FakeFileSystem fileSystem;
  FakeDispatcher dispatcher{clock};
  // processInfo, notifications and defaults are left null: fill them in a test that needs them.
  PlatformServices services;
};

}  // namespace tavrin::testing
