// Entry point of tavrind: builds the Linux platform services, creates the one listener delegate
// and runs the listener until SIGTERM or SIGINT, which flush the store and exit 0.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <CLI/CLI.hpp>

#include "Statistics/Service/MetricsText.h"
#include "Statistics/Service/RuvoReportingServiceDelegate.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "Statistics/Service/ServiceWatchdog.h"
#include "Statistics/Service/SessionSpool.h"
#include "platform/LogSystem.h"
#include "platform/MessageLedger.h"
#include "platform/Platform.h"
#include "platform/linux/dispatch/AsioDispatcher.h"
#include "platform/linux/driverstats/CountersTreeDriverStats.h"
#include "platform/linux/files/PosixFileSystem.h"
#include "platform/linux/log/SpdlogLogSystem.h"
#include "platform/linux/orientation/OrientationRegistries.h"
#include "platform/linux/process/LinuxProcessInfo.h"
#include "platform/linux/process/SystemdNotify.h"
#include "platform/linux/reporting/ReportingBackends.h"
#include "platform/linux/settings/LinuxNotificationCenter.h"
#include "platform/linux/settings/TomlDefaultsDomain.h"
#include "platform/linux/settings/TomlDeviceInfo.h"
#include "platform/linux/socket/UnixServiceListener.h"
#include "platform/linux/time/SystemClock.h"

namespace {

// Exit statuses besides 0 (clean stop) and 2 (killService).
constexpr int kUsageError = 64;     // a flag or value that cannot be used
constexpr int kStartupFailure = 1;  // the socket cannot be set up

// Decoded requests and deliveries waiting for a thread, beyond which requests are left unread:
// about 16 MB of typical messages.
constexpr uint64_t kMaxQueuedWorkItems = 16384;

// How long a stop waits for queued work: longer than a session's wait for its back-ends (9 s), so
// that messages queued behind a waiting session are still delivered.
constexpr std::chrono::seconds kShutdownDrainLimit{10};
// How long the start waits for a back-end to come up before it tells the service manager it is
// ready all the same.
constexpr std::chrono::seconds kReadyWaitLimit{5};

struct Options {
  std::string root;
  std::string socket = "/run/tavrin/reporting.sock";
  std::string socketMode = "0660";
  std::string defaults = "/etc/tavrin/com.quorvex.tavrin.toml";
  std::string deviceInfo = "/etc/tavrin/device.toml";
  std::string stateDir = "/var/lib/tavrin";
  std::string diagnosticDir = "/var/log/tavrin/DiagnosticLogs";
  std::string driverStatsRoot = "/run/tavrin/driverstats";
  std::string orientation = "none";
  std::vector<std::string> backends;
  std::string logTarget = "stderr";
  std::string metricsFile;
};

// With --root, every path that was not given explicitly moves under the root.
void ApplyRoot(Options& options, const CLI::App& app) {
  if (options.root.empty()) return;
  const std::filesystem::path root = std::filesystem::absolute(options.root);
  auto place = [&](const char* flag, std::string& value, const std::filesystem::path& relative) {
    if (app.count(flag) == 0) value = (root / relative).string();
  };
  place("--socket", options.socket, "run/reporting.sock");
  place("--defaults", options.defaults, "etc/com.quorvex.tavrin.toml");
  place("--device-info", options.deviceInfo, "etc/device.toml");
  place("--state-dir", options.stateDir, "lib");
  place("--diagnostic-dir", options.diagnosticDir, "log/DiagnosticLogs");
  place("--driver-stats-root", options.driverStatsRoot, "driverstats");
  std::error_code ignored;
  for (const auto& directory :
       {root / "run", root / "etc", root / "lib", root / "log", root / "driverstats"}) {
    std::filesystem::create_directories(directory, ignored);
  }
}

// The listener's settings from the defaults file's [limits] table. A value of the wrong type is
// an error line naming the key and what it should hold, and the default stays; a number below a
// limit's floor is raised to the floor.
struct ListenerSettings {
  tavrin::protocol::RequestLimits limits;
  std::vector<uint32_t> killUids;  // besides root and the service's own uid
  // Read once, at start.
  uint64_t frameBytes = tavrin::protocol::kDefaultFrameLimit;
  uint64_t connectionsPerUid = tavrin::UnixListenerOptions{}.connectionsPerUid;
  uint64_t replyBytesPerConnection = tavrin::UnixListenerOptions{}.replyBytesPerConnection;
  uint64_t replyBytesTotal = tavrin::UnixListenerOptions{}.replyBytesTotal;
  uint64_t spoolBytesPerSession = tavrin::SessionSpool::kDefaultByteLimit;
  uint64_t storeQueueRecords = tavrin::SqliteStore::kMaxQueuedRecords;
  uint64_t storeBytes = 0;  // no bound but the disk
};

ListenerSettings ReadListenerSettings(const tavrin::Dictionary& defaults) {
  TLOG_OPERATION("ReadListenerSettings");
  using tavrin::protocol::RequestLimits;
  ListenerSettings settings;
  auto table = defaults.find("limits");
  if (table == defaults.end()) return settings;
  if (!table->is_object()) {
    TLOG_ERROR(nullptr, "limits: expected a table, got {}", table->type_name());
    return settings;
  }
  auto readCount = [&](const char* key, uint64_t floor, uint64_t& into) {
    auto value = table->find(key);
    if (value == table->end()) return;
    if (!value->is_number_integer() || value->get<int64_t>() < 0) {
      TLOG_ERROR(nullptr, "limits.{}: expected a non-negative integer, got {}; keeping {}", key,
                 tavrin::JsonText(*value), into);
      return;
    }
    into = std::max<uint64_t>(value->get<uint64_t>(), floor);
  };
  readCount("entries_per_frame", RequestLimits::kMinEntriesPerFrame,
            settings.limits.entriesPerFrame);
  readCount("reporter_ids_per_message", RequestLimits::kMinReporterIDsPerMessage,
            settings.limits.reporterIDsPerMessage);
  readCount("sessions_per_connection", RequestLimits::kMinSessionsPerConnection,
            settings.limits.sessionsPerConnection);
  readCount("frame_bytes", 64 * 1024, settings.frameBytes);
  settings.frameBytes = std::min<uint64_t>(settings.frameBytes, UINT32_MAX);
  readCount("connections_per_uid", 8, settings.connectionsPerUid);
  readCount("reply_bytes_per_connection", 64 * 1024, settings.replyBytesPerConnection);
  readCount("reply_bytes_total", 1024 * 1024, settings.replyBytesTotal);
  readCount("spool_bytes_per_session", tavrin::SessionSpool::kMinByteLimit,
            settings.spoolBytesPerSession);
  readCount("store_queue_records", 1024, settings.storeQueueRecords);
  // 0 means no bound but the disk; any other value is raised to the floor.
  readCount("store_bytes", 0, settings.storeBytes);
  if (settings.storeBytes > 0)
    settings.storeBytes = std::max<uint64_t>(settings.storeBytes, 1 << 20);
  auto list = table->find("kill_uids");
  if (list == table->end()) return settings;
  if (!list->is_array()) {
    TLOG_ERROR(nullptr, "limits.kill_uids: expected an array of uids, got {}", list->type_name());
    return settings;
  }
  for (const auto& uid : *list) {
    if (uid.is_number_integer() && uid.get<int64_t>() >= 0 && uid.get<int64_t>() <= UINT32_MAX) {
      settings.killUids.push_back(uid.get<uint32_t>());
    } else {
      TLOG_ERROR(nullptr, "limits.kill_uids: expected uids (integers 0..{}), got {}", UINT32_MAX,
                 tavrin::JsonText(uid));
    }
  }
  return settings;
}

void ApplyListenerSettings(tavrin::UnixServiceListener& listener,
                           const tavrin::Dictionary& defaults) {
  ListenerSettings settings = ReadListenerSettings(defaults);
  listener.SetRequestLimits(settings.limits);
  listener.SetKillUids(std::move(settings.killUids));
}

// How often --metrics-file is rewritten: well within a textfile collector's scrape interval.
constexpr auto kMetricsInterval = std::chrono::seconds(5);

// The process's resident memory, from /proc/self/statm; 0 when it cannot be read.
uint64_t ResidentBytes() {
  std::FILE* statm = std::fopen("/proc/self/statm", "r");
  if (statm == nullptr) return 0;
  unsigned long long size = 0, resident = 0;
  const int read = std::fscanf(statm, "%llu %llu", &size, &resident);
  std::fclose(statm);
  return read == 2 ? resident * uint64_t(::sysconf(_SC_PAGESIZE)) : 0;
}

// Sessions that were open when the service last ended left their spools: their summaries are
// sent now, before any new session spools beside them.
void RecoverSpooledSessions(tavrin::PlatformServices& services) {
  TLOG_OPERATION("recover");
  if (tavrin::OptionalError error = services.fileSystem->CreateDirectories(
          services.spoolDirectory, tavrin::SessionSpool::kDirectoryMode)) {
    TLOG_ERROR(nullptr, "sessions cannot spool: {}", error->LocalizedDescription());
    return;
  }
  for (const std::string& name : services.fileSystem->ListFiles(services.spoolDirectory)) {
    if (!name.ends_with(tavrin::SessionSpool::kFileSuffix)) continue;
    tavrin::RuvoReportingSession::recover(services, services.spoolDirectory + "/" + name);
  }
}

}  // namespace

int main(int argc, char** argv) {
  TLOG_OPERATION("main");
  CLI::App app{"tavrind: the reporting service of the audio stack"};
  Options options;
  app.add_option("--root", options.root, "put every path under DIR (the embedded default)")
      ->envname("TAVRIN_ROOT");
  app.add_option("--socket", options.socket, "listening socket (ignored under socket activation)")
      ->envname("TAVRIN_SOCKET");
  app.add_option("--socket-mode", options.socketMode, "permissions of the socket file");
  app.add_option("--defaults", options.defaults, "the defaults domain (a TOML file)")
      ->envname("TAVRIN_DEFAULTS");
  app.add_option("--device-info", options.deviceInfo, "device facts (a TOML file)");
  app.add_option("--state-dir", options.stateDir, "directory of the store tavrin.db");
  app.add_option("--diagnostic-dir", options.diagnosticDir,
                 "summary files go to DIR/Audio/Reporting");
  app.add_option("--driver-stats-root", options.driverStatsRoot, "the counters tree");
  app.add_option("--orientation", options.orientation, "none, iio or feed:PATH");
  app.add_option("--backend", options.backends,
                 "sqlite, kafka:BOOTSTRAP[,topic-prefix=P] or none (repeatable)");
  app.add_option("--metrics-file", options.metricsFile,
                 "rewrite PATH every few seconds with the status counts as OpenMetrics text")
      ->type_name("PATH");
  app.add_option("--log-target", options.logTarget, "stderr or journal")
      ->check(CLI::IsMember({"stderr", "journal"}));
  CLI11_PARSE(app, argc, argv);
  // Whatever the service creates (store, WAL, directories, summary files) is readable by its group
  // at most and writable by nobody else.
  ::umask(027);
  ApplyRoot(options, app);

  unsigned socketMode = 0;
  try {
    socketMode = static_cast<unsigned>(std::stoul(options.socketMode, nullptr, 8));
  } catch (const std::exception&) {
    std::fprintf(stderr, "tavrind: --socket-mode %s is not an octal mode\n",
                 options.socketMode.c_str());
    return kUsageError;
  }

  using namespace tavrin;
  TomlDefaultsDomain defaults(options.defaults);
  SpdlogLogSystem logSystem(
      defaults, options.logTarget == "journal" ? LogTargetKind::kJournal : LogTargetKind::kStderr);
  InstallLogSystem(&logSystem);

  std::string error;
  auto choices = ParseBackendSpecs(options.backends, &error);
  if (!choices) {
    TLOG_ERROR(nullptr, "{}", error);
    return kUsageError;
  }
  std::unique_ptr<OrientationRegistry> orientation =
      MakeOrientationRegistry(options.orientation, nullptr, &error);
  if (!orientation) {
    TLOG_ERROR(nullptr, "--orientation: {}", error);
    return kUsageError;
  }

  const ListenerSettings startSettings = ReadListenerSettings(defaults.Read());
  UnixListenerOptions listenerOptions{options.socket, socketMode};
  listenerOptions.frameLimit = static_cast<uint32_t>(startSettings.frameBytes);
  listenerOptions.connectionsPerUid = startSettings.connectionsPerUid;
  listenerOptions.replyBytesPerConnection = startSettings.replyBytesPerConnection;
  listenerOptions.replyBytesTotal = startSettings.replyBytesTotal;
  UnixServiceListener listener(listenerOptions);
  try {
    listener.Open();
  } catch (const std::system_error& failure) {
    TLOG_ERROR(nullptr, "cannot listen: {}", failure.what());
    return kStartupFailure;
  }

  AsioDispatcher dispatcher;
  LinuxNotificationCenter notifications(listener.Io());
  if (OptionalError watchError = notifications.WatchDefaults(options.defaults)) {
    TLOG_ERROR(nullptr, "defaults {} are not watched for changes: {}", options.defaults,
               watchError->LocalizedDescription());
  }
  TomlDeviceInfo deviceInfo(options.deviceInfo);
  LinuxProcessInfo processInfo;
  PosixFileSystem fileSystem;
  CountersTreeDriverStats driverStats(options.driverStatsRoot);

  BackendEnvironment environment;
  environment.stateDirectory = options.stateDir;
  environment.storeQueueRecords = startSettings.storeQueueRecords;
  environment.storeBytes = startSettings.storeBytes;
  // Declared before the back-ends: records still in their queues carry the ledger's accounts.
  MessageLedger ledger;
  const auto startedAt = std::chrono::steady_clock::now();
  BackendReportingService reporting(CreateBackends(*choices, environment), SystemClock(),
                                    SystemRandom());
  reporting.ApplyDefaults(defaults.Read());
  ApplyListenerSettings(listener, defaults.Read());

  PlatformServices services;
  services.dispatcher = &dispatcher;
  services.random = &SystemRandom();
  services.telvoro = &reporting;
  services.analytics = &reporting;
  services.powerLog = &reporting;
  services.driverStats = &driverStats;
  services.orientation = orientation.get();
  services.deviceInfo = &deviceInfo;
  services.processInfo = &processInfo;
  services.fileSystem = &fileSystem;
  services.notifications = &notifications;
  services.defaults = &defaults;
  services.ledger = &ledger;
  services.diagnosticDirectory = options.diagnosticDir;
  services.spoolDirectory = options.stateDir + "/spool";
  services.spoolBytesPerSession = startSettings.spoolBytesPerSession;
  RecoverSpooledSessions(services);

  // Log verbosity and the analytics policy follow the defaults as the settings do.
  int refreshToken = -1;
  notifications.RegisterNotificationHandler(kDefaultsNotificationName, &refreshToken,
                                            dispatcher.BackgroundQueue(), [&](int) {
                                              logSystem.Refresh();
                                              const Dictionary settings = defaults.Read();
                                              reporting.ApplyDefaults(settings);
                                              ApplyListenerSettings(listener, settings);
                                            });

  auto delegate = RuvoReportingServiceDelegate::init(services);
  listener.SetDelegate(delegate.get());
  // Settings are applied on their first change, except that a file that does not parse at start
  // must not leave reporting on: the domain then reads as disabled, and this applies it now.
  if (LoadTomlFile(options.defaults).status == TomlFileLoad::Status::kFailed) {
    notifications.Post(kDefaultsNotificationName);
  }
  // Clients that send faster than the store commits are slowed down through their sockets rather
  // than have their records dropped.
  const auto serviceStatus = [&] {
    Dictionary status = ledger.ToDictionary();
    status["uptime_s"] =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - startedAt).count();
    status["rss_bytes"] = ResidentBytes();
    status["store_backlog"] = reporting.Backlog();
    status["queued_work_items"] = dispatcher.QueuedItems() + dispatcher.DeferredCount();
    status["refusals"] = listener.RefusalsByLimit();
    return status;
  };
  listener.SetStatusProvider(serviceStatus);
  const auto writeMetrics = [&] {
    if (options.metricsFile.empty()) return;
    if (OptionalError error =
            fileSystem.WriteFileAtomically(options.metricsFile, MetricsText(serviceStatus()))) {
      TLOG_ERROR(nullptr, "metrics file not written: {}", error->LocalizedDescription());
    }
  };
  listener.SetReadGate([&] {
    // Single messages held back on a timer are owed to their clients as much as queued work.
    const uint64_t queued = dispatcher.QueuedItems() + dispatcher.DeferredCount();
    const double backlog = reporting.BacklogShare();
    // Far behind, everyone waits; behind, only those who send more than their share, so that
    // a client making round trips keeps getting answers while another floods.
    if (queued >= 2 * kMaxQueuedWorkItems || backlog >= 0.75) return ReadGate::kAllWait;
    if (queued >= kMaxQueuedWorkItems || backlog >= 0.5) return ReadGate::kHeavySendersWait;
    return ReadGate::kOpen;
  });

  asio::signal_set stopSignals(listener.Io(), SIGTERM, SIGINT);
  stopSignals.async_wait([&](const asio::error_code& waitError, int signal) {
    if (waitError) return;
    TLOG_DEFAULT(nullptr, "stopping on signal {}", signal);
    listener.Stop();
  });

  TLOG_DEFAULT(nullptr, "tavrind listening on {}{}; store in {}", options.socket,
               listener.SocketActivated() ? " (socket activation)" : "", options.stateDir);

  // The service manager hears READY once the socket listens and a back-end is up (or, when none
  // comes up within a few seconds, ready all the same: it then counts what it drops), and the
  // watchdog only while the work queue turns.
  const auto statusLine = [&] {
    return fmt::format(
        "serving; {} queued work items, {} held-back messages, store backlog {:.0f}%",
        dispatcher.QueuedItems(), dispatcher.DeferredCount(), 100 * reporting.BacklogShare());
  };
  const auto upBy = std::chrono::steady_clock::now() + kReadyWaitLimit;
  while (!choices->empty() && !reporting.UpBackends() && std::chrono::steady_clock::now() < upBy) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  systemd_notify::Ready(statusLine());
  std::mutex watchdogMutex;
  std::condition_variable watchdogWake;
  bool stopping = false;
  std::thread watchdogThread;
  if (const std::optional<Duration> interval = systemd_notify::WatchdogInterval()) {
    watchdogThread = std::thread([&, interval = *interval] {
      pthread_setname_np(pthread_self(), "tavrin-watchdog");
      ServiceWatchdog watchdog(RuvoReportingServiceDelegate::WorkQueue(), SystemClock(), interval,
                               systemd_notify::WatchdogPing);
      std::unique_lock lock(watchdogMutex);
      do {
        watchdog.Tick();
        systemd_notify::Status(statusLine());
      } while (!watchdogWake.wait_for(lock, interval / 2, [&] { return stopping; }));
    });
  }
  std::thread metricsThread;
  if (!options.metricsFile.empty()) {
    metricsThread = std::thread([&] {
      pthread_setname_np(pthread_self(), "tavrin-metrics");
      std::unique_lock lock(watchdogMutex);
      do {
        lock.unlock();
        writeMetrics();
        lock.lock();
      } while (!watchdogWake.wait_for(lock, kMetricsInterval, [&] { return stopping; }));
    });
  }
  listener.Resume();

  if (watchdogThread.joinable() || metricsThread.joinable()) {
    {
      std::lock_guard lock(watchdogMutex);
      stopping = true;
    }
    watchdogWake.notify_all();
    if (watchdogThread.joinable()) watchdogThread.join();
    if (metricsThread.joinable()) metricsThread.join();
  }
  systemd_notify::Status("stopping: sending held-back messages and committing the store");
  systemd_notify::ExtendTimeout(kShutdownDrainLimit + std::chrono::seconds(10));

  // Orderly stop: client clean-ups and queued deliveries run, including messages held behind a
  // session that still waits for its back-ends, then the store commits everything it accepted.
  notifications.Cancel(refreshToken);
  if (const size_t deferred = dispatcher.RunDeferredNow()) {
    TLOG_DEFAULT(nullptr, "sending {} held-back single message(s) now", deferred);
  }
  if (!dispatcher.WaitUntilDrained(kShutdownDrainLimit)) {
    TLOG_ERROR(nullptr, "stopping with {} work items still queued after {} s",
               dispatcher.QueuedItems(), kShutdownDrainLimit.count());
  }
  dispatcher.Shutdown();
  reporting.Shutdown();
  // The last counts, with everything committed.
  writeMetrics();
  listener.SetDelegate(nullptr);
  delegate.reset();
  TLOG_DEFAULT(nullptr, "tavrind stopped; refusals by limit: {}", listener.RefusalCounts());
  InstallLogSystem(nullptr);
  return 0;
}
