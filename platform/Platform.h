#pragma once

#include <string>

namespace tavrin {

class AnalyticsSink;
class DefaultsDomain;
class DeviceInfoQuery;
class Dispatcher;
class DriverStatsService;
class FileSystem;
class NotificationCenter;
class OrientationRegistry;
class PowerEventLog;
class ProcessInfo;
class RandomSource;
class TelvoroService;

// The platform services the core uses, gathered in one place. The service fills one at start-up
// with the Linux implementations; tests fill one with fakes. Members are never null once
// installed, and every service outlives the core objects that use it.
struct PlatformServices {
  Dispatcher* dispatcher = nullptr;
  RandomSource* random = nullptr;
  TelvoroService* telvoro = nullptr;
  AnalyticsSink* analytics = nullptr;
  PowerEventLog* powerLog = nullptr;
  DriverStatsService* driverStats = nullptr;
  OrientationRegistry* orientation = nullptr;
  DeviceInfoQuery* deviceInfo = nullptr;
  ProcessInfo* processInfo = nullptr;
  FileSystem* fileSystem = nullptr;
  NotificationCenter* notifications = nullptr;
  DefaultsDomain* defaults = nullptr;
  // Summary files go to "<diagnosticDirectory>/Audio/Reporting".
  std::string diagnosticDirectory = "/var/log/tavrin/DiagnosticLogs";
};

// The process-wide services, for class operations that have no instance to carry them.
// Aborts with a message when none is installed.
PlatformServices& CurrentPlatform();
// Installs `services` (nullptr uninstalls) and returns the previous one. Call at start-up or from a
// test fixture, never while the core runs.
PlatformServices* InstallPlatform(PlatformServices* services);

}  // namespace tavrin
