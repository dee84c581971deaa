#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

namespace tavrin {

class AnalyticsSink;
class DefaultsDomain;
class DeviceInfoQuery;
class Dispatcher;
class DriverStatsService;
class FileSystem;
class MessageLedger;
class NotificationCenter;
class OrientationRegistry;
class PowerEventLog;
class ProcessInfo;
class RandomSource;
class TelvoroService;

// A boolean fact of the device, asked once even when several threads ask first together.
struct DeviceFactOnce {
  std::once_flag once;
  bool value = false;
};

// The platform services the core uses, gathered in one place: the context that main builds with
// the Linux implementations and passes down to every component, and that a test fills with
// fakes. Nothing reaches the platform any other way. Members are never null once
// filled, and every service outlives the core objects that use it.
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
  // Accounts for every client message; null when nobody reads the counts (tests).
  MessageLedger* ledger = nullptr;
  // Summary files go to "<diagnosticDirectory>/Audio/Reporting".
  std::string diagnosticDirectory = "/var/log/tavrin/DiagnosticLogs";
  // Started sessions spool what they gather here ("<state-dir>/spool").
  std::string spoolDirectory = "/var/lib/tavrin/spool";
  // A session's spool stops growing at this size (the "limits.spool_bytes_per_session" setting).
  uint64_t spoolBytesPerSession = uint64_t(256) << 20;
  // The device's "InternalBuild" fact, asked of `deviceInfo` once and kept: a build does not
  // change while the service runs. Shared by copies of the context.
  std::shared_ptr<DeviceFactOnce> internalBuild = std::make_shared<DeviceFactOnce>();
};

}  // namespace tavrin
