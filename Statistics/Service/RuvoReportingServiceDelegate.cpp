#include "Statistics/Service/RuvoReportingServiceDelegate.h"

#include "platform/MessageLedger.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <limits>

#include "Statistics/RuvoReportingKelvaneUtility.h"
#include "Statistics/RuvoReportingStratikBridge.h"
#include "Statistics/RuvoReportingUtility.h"
#include "platform/AnalyticsSink.h"
#include "platform/DefaultsDomain.h"
#include "platform/NotificationCenter.h"
#include "platform/ProcessInfo.h"
#include "platform/TracePoints.h"

namespace tavrin {
namespace {

constexpr const char* kExportedInterfaceName = "RuvoReportingServiceProtocol";
constexpr const char* kSubsystem = "com.quorvex.tavrin";
constexpr int kLogLevelArgument = 31;

// Process-wide front-end state: one delegate is ever made per process.
struct FrontEndGlobals {
  std::mutex mutex;
  LogHandle serviceLog;
  SerialQueuePtr workQueue;
  int notificationToken = -1;
  RuvoReportingServerInstance::ProcessExit processExit;
};

FrontEndGlobals& Globals() {
  static FrontEndGlobals globals;
  return globals;
}

SerialQueuePtr CurrentWorkQueue() {
  std::lock_guard lock(Globals().mutex);
  return Globals().workQueue;
}

// "%@" of something that may be none.
std::string OptionalText(const std::optional<std::string>& text) {
  return text ? *text : std::string("(null)");
}

// "%@" of a session, as the broadcast log lines print them.
std::string SessionText(const RuvoReportingSession& session) {
  return fmt::format("<RuvoReportingSession reporterID={} serviceType={} started={}>",
                     session.reporterID(), session.serviceType(), session.started() ? 1 : 0);
}

std::string SessionMapText(const RuvoReportingServerInstance::SessionMap& map) {
  std::string text = "{";
  bool first = true;
  for (const auto& [id, session] : map) {
    text += fmt::format("{}{} = {}", first ? "" : ", ", id, SessionText(*session));
    first = false;
  }
  return text + "}";
}

std::string SessionListText(const std::vector<RuvoReportingSessionPtr>& sessions) {
  std::string text = "(";
  for (size_t i = 0; i < sessions.size(); ++i) {
    text += (i ? ", " : "") + SessionText(*sessions[i]);
  }
  return text + ")";
}

// The boolean value of a defaults entry: TOML booleans, and numbers as non-zero.
bool DefaultsBool(const Value& value) {
  if (value.is_boolean()) return value.get<bool>();
  if (value.is_number()) return value.get<double>() != 0.0;
  return false;
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// RuvoReportingServiceDelegate

const LogHandle& RuvoReportingServiceDelegate::ServiceLog() {
  // Read without the lock: written once by init before any client exists.
  return Globals().serviceLog;
}

SerialQueuePtr RuvoReportingServiceDelegate::WorkQueue() { return CurrentWorkQueue(); }

RuvoReportingServiceDelegate::RuvoReportingServiceDelegate(PlatformServices& platform)
    : platform_(platform) {}

std::shared_ptr<RuvoReportingServiceDelegate> RuvoReportingServiceDelegate::init(
    PlatformServices& platform) {
  LogHandle log = RegisterLogScope(true, FourCharCode("rvrs"), "rvrs", kSubsystem,
                                   "reporting_server_verbose", kLogLevelArgument);
  {
    std::lock_guard lock(Globals().mutex);
    Globals().serviceLog = std::move(log);
  }
  std::shared_ptr<RuvoReportingServiceDelegate> delegate(
      new RuvoReportingServiceDelegate(platform));
  SerialQueuePtr queue =
      platform.dispatcher->CreateSerialQueue(kWorkQueueLabel, QualityOfService::kUserInteractive);
  {
    std::lock_guard lock(Globals().mutex);
    Globals().workQueue = std::move(queue);
  }
  delegate->listenForDefaultsNotification();
  delegate->driverUtility_ = std::make_unique<RuvoReportingDriverUtility>(*platform.driverStats);
  return delegate;
}

RuvoReportingServiceDelegate::~RuvoReportingServiceDelegate() {
  if (platform_.notifications == nullptr || ownNotificationToken_ < 0) return;
  platform_.notifications->Cancel(ownNotificationToken_);
  std::lock_guard lock(Globals().mutex);
  if (Globals().notificationToken == ownNotificationToken_) Globals().notificationToken = -1;
}

Dictionary RuvoReportingServiceDelegate::RuvoReportingDefaults() {
  Dictionary domain = platform_.defaults != nullptr ? platform_.defaults->Read() : MakeDictionary();
  Dictionary settings = MakeDictionary();
  if (domain.is_object() && domain.contains("device_name")) {
    const Value& name = domain["device_name"];
    settings["device_name"] = name.is_string() ? name : Value(ValueText(name));
  }
  if (domain.is_object() && domain.contains("disable_reporting")) {
    const Value& disable = domain["disable_reporting"];
    if (disable.is_boolean() || disable.is_number()) {
      settings["disable_reporting"] = DefaultsBool(disable);
    } else {
      // A setting someone wrote but that is not a switch fails closed rather than being ignored.
      TLOG_ERROR(ServiceLog(),
                 "defaults key disable_reporting: expected a boolean, got {} {}; reporting stays "
                 "disabled",
                 disable.type_name(), JsonText(disable));
      settings["disable_reporting"] = true;
    }
  } else {
    settings["disable_reporting"] = 0;
  }
  return settings;
}

void RuvoReportingServiceDelegate::listenForDefaultsNotification() {
  // Registration failure is only logged; the service then runs with reporting enabled and no
  // settings.
  constexpr int kNoNotificationCenter = 1;
  int status = kNoNotificationCenter;
  SerialQueuePtr queue = CurrentWorkQueue();
  if (platform_.notifications != nullptr && queue) {
    std::weak_ptr<RuvoReportingServiceDelegate> weakSelf = weak_from_this();
    int token = -1;
    status = platform_.notifications->RegisterNotificationHandler(
        kDefaultsNotificationName, &token, *queue, [weakSelf](int postedToken) {
          if (auto self = weakSelf.lock()) self->handleDefaultsNotification(postedToken);
        });
    ownNotificationToken_ = status == 0 ? token : -1;
    std::lock_guard lock(Globals().mutex);
    Globals().notificationToken = ownNotificationToken_;
  }
  TLOG_DEFAULT(ServiceLog(), "notify setup result {}", status);
}

void RuvoReportingServiceDelegate::handleDefaultsNotification(int token) {
  {
    std::lock_guard lock(Globals().mutex);
    if (token != Globals().notificationToken) return;
  }
  TLOG_DEFAULT(ServiceLog(), "re-reading tavrin defaults");
  Dictionary settings = RuvoReportingDefaults();
  {
    std::lock_guard lock(defaultsMutex_);
    defaults_ = settings;
  }
  TLOG_INFO(ServiceLog(), "defaults {}", JsonText(settings));
  for (const ServerInstancePtr& instance : clients_) {
    for (const auto& [id, session] : instance->clientReportingSessionMap()) {
      session->updateDefaults(settings);
    }
  }
  if (settings.contains("disable_reporting")) {
    reportingEnabled_.store(!DefaultsBool(settings["disable_reporting"]));
  }
}

std::optional<std::string> RuvoReportingServiceDelegate::processNameForPID(int32_t pid) {
  std::optional<std::string> name;
  ProcessInfo* info = platform_.processInfo;
  if (info == nullptr) return name;
  if (pid == info->OwnProcessIdentifier()) name = info->OwnProcessName();
  if (pid >= 1 && (!name || name->empty())) name = info->CommandName(pid);
  return name;
}

bool RuvoReportingServiceDelegate::shouldAcceptNewConnection(
    ServiceListener& /*listener*/, const ClientConnectionPtr& connection) {
  TLOG_OPERATION("shouldAcceptNewConnection");
  const int32_t pid = connection->ProcessIdentifier();
  TLOG_DEFAULT(ServiceLog(), "newConnection: {}", connection->Description());

  ServerInstancePtr instance;
  {
    std::lock_guard lock(delegateMutex_);
    connection->SetExportedInterface(kExportedInterfaceName);
    instance = RuvoReportingServerInstance::initWithPID(pid, weak_from_this(), platform_);
    if (platform_.ledger != nullptr) {
      instance->setAccount(platform_.ledger->OpenAccount(
          pid, connection->UserIdentifier(), processNameForPID(pid).value_or(std::string())));
    }
    connection->SetExportedObject(instance);
  }
  LedgerAccountPtr account = instance->account();
  std::weak_ptr<RuvoReportingServerInstance> weakInstance = instance;
  instance.reset();

  std::weak_ptr<RuvoReportingServiceDelegate> weakSelf = weak_from_this();
  if (SerialQueuePtr queue = CurrentWorkQueue()) {
    queue->Async([weakSelf, weakInstance, pid] {
      auto self = weakSelf.lock();
      ServerInstancePtr added = weakInstance.lock();
      if (!self || !added) return;
      self->clients_.push_back(added);
      added->setClientStartDate(self->platform_.dispatcher->GetClock().WallNow());
      added->setClientProcessName(self->processNameForPID(pid));
    });
  }

  connection->SetInterruptionHandler([weakInstance] {
    TLOG_DEFAULT(ServiceLog(), "InterruptionHandler: connection exited");
    if (ServerInstancePtr gone = weakInstance.lock()) gone->handleConnectionError();
  });
  connection->SetInvalidationHandler([weakSelf, weakInstance, pid, account] {
    // The account leaves the clients list; its messages still in flight keep counting.
    if (account) account->Close();
    if (auto self = weakSelf.lock()) self->reportClientUptime(weakInstance, pid);
  });
  connection->Resume();
  return true;
}

void RuvoReportingServiceDelegate::reportClientUptime(
    const std::weak_ptr<RuvoReportingServerInstance>& weakInstance, int32_t pid) {
  ServerInstancePtr instance = weakInstance.lock();
  if (instance) instance->handleConnectionError();

  const WallTime now = platform_.dispatcher->GetClock().WallNow();
  double uptime = -1;
  const std::optional<WallTime> startDate =
      instance ? instance->clientStartDate() : std::optional<WallTime>();
  const std::optional<std::string> processName =
      instance ? instance->clientProcessName() : std::optional<std::string>();
  if (!startDate) {
    TLOG_DEFAULT(ServiceLog(), "clientStartDate is nil. clientpid={} clientprocessname={}", pid,
                 OptionalText(processName));
  } else {
    uptime = std::fabs(std::chrono::duration<double>(now - *startDate).count());
    if (*startDate > now) {
      // The wording is kept as clients of the logs know it, although the date lies ahead.
      TLOG_DEFAULT(ServiceLog(),
                   "clientStartDate is in the past. clientpid={} clientprocessname={}", pid,
                   OptionalText(processName));
    }
  }
  // Cut to 32 bits the way a C conversion would, saturating instead of overflowing.
  const double bounded = std::clamp(uptime, double(std::numeric_limits<int32_t>::min()),
                                    double(std::numeric_limits<int32_t>::max()));
  TLOG_DEFAULT(ServiceLog(), "InvalidationHandler: connection exited process={} uptime_sec={}",
               OptionalText(processName), static_cast<int32_t>(bounded));
  if (!processName) {
    TLOG_DEFAULT(ServiceLog(), "clientProcessName is nil. clientpid={}", pid);
    return;
  }
  if (platform_.analytics == nullptr) return;
  Dictionary payload = MakeDictionary();
  payload["processName"] = *processName;
  payload["seconds"] = uptime;
  platform_.analytics->SendEventLazy(kUptimeEventName, [payload] { return payload; });
}

RuvoReportingSessionPtr RuvoReportingServiceDelegate::findReportingSessionForID(
    int64_t reporterID) {
  std::lock_guard lock(delegateMutex_);
  if (reporterID == 0 || !reportingEnabled_.load()) return nullptr;
  for (const ServerInstancePtr& instance : clients_) {
    const auto& map = instance->clientReportingSessionMap();
    auto found = map.find(reporterID);
    if (found != map.end()) {
      TLOG_INFO(ServiceLog(), "found reporting session {} for client {}", reporterID,
                instance->processIdentifier());
      return found->second;
    }
  }
  TLOG_ERROR(ServiceLog(), "failed to find reporting session {}", reporterID);
  return nullptr;
}

std::optional<Dictionary> RuvoReportingServiceDelegate::getDefaults() {
  std::lock_guard lock(defaultsMutex_);
  return defaults_;
}

std::optional<Dictionary> RuvoReportingServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const Dictionary* snapShot) {
  return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapShot);
}

Dictionary RuvoReportingServiceDelegate::getSnapShot() { return driverUtility_->getSnapShot(); }

void RuvoReportingServiceDelegate::removeClient(const ServerInstancePtr& instance) {
  auto found = std::find(clients_.begin(), clients_.end(), instance);
  if (found != clients_.end()) clients_.erase(found);
}

// ---------------------------------------------------------------------------------------------
// RuvoReportingServerInstance

void RuvoReportingServerInstance::SetProcessExit(ProcessExit exit) {
  std::lock_guard lock(Globals().mutex);
  Globals().processExit = std::move(exit);
}

RuvoReportingServerInstance::RuvoReportingServerInstance(
    int32_t pid, std::weak_ptr<RuvoReportingServiceDelegateProtocol> delegate,
    PlatformServices& platform)
    : platform_(platform),
      processIdentifier_(pid),
      delegate_(std::move(delegate)),
      workQueue_(CurrentWorkQueue()) {}

ServerInstancePtr RuvoReportingServerInstance::initWithPID(
    int32_t pid, std::weak_ptr<RuvoReportingServiceDelegateProtocol> delegate,
    PlatformServices& platform) {
  ServerInstancePtr instance(new RuvoReportingServerInstance(pid, std::move(delegate), platform));
  TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "new client with pid {}",
               static_cast<uint64_t>(static_cast<int64_t>(pid)));
  return instance;
}

RuvoReportingServerInstance::~RuvoReportingServerInstance() {
  TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "dealloc {} from the server client list",
               processIdentifier_);
}

std::optional<WallTime> RuvoReportingServerInstance::clientStartDate() const {
  std::lock_guard lock(propertyMutex_);
  return clientStartDate_;
}

void RuvoReportingServerInstance::setClientStartDate(WallTime date) {
  std::lock_guard lock(propertyMutex_);
  clientStartDate_ = date;
}

std::optional<std::string> RuvoReportingServerInstance::clientProcessName() const {
  std::lock_guard lock(propertyMutex_);
  return clientProcessName_;
}

void RuvoReportingServerInstance::setClientProcessName(std::optional<std::string> name) {
  std::lock_guard lock(propertyMutex_);
  clientProcessName_ = std::move(name);
}

void RuvoReportingServerInstance::enqueue(std::function<void(RuvoReportingServerInstance&)> work) {
  if (!workQueue_) return;
  workQueue_->RunOrAsync([self = shared_from_this(), work = std::move(work)] { work(*self); });
}

RuvoReportingSessionPtr RuvoReportingServerInstance::findReportingSessionForID(
    int64_t reporterID, bool acrossAllClients) {
  auto found = clientReportingSessionMap_.find(reporterID);
  if (found != clientReportingSessionMap_.end()) return found->second;
  if (!acrossAllClients) return nullptr;
  auto delegate = delegate_.lock();
  return delegate ? delegate->findReportingSessionForID(reporterID) : nullptr;
}

void RuvoReportingServerInstance::createReportingSession(int64_t reporterID, BoolReply reply) {
  TLOG_OPERATION("createReportingSession");
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "creating session for reporter {}",
             reporterID);
  enqueue([reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    EmitTracePoint(trace::kClientCreate);
    RuvoReportingSessionPtr session =
        RuvoReportingSession::create(reporterID, {self.processIdentifier_}, self.platform_);
    if (session) {
      // Replacing an entry releases the earlier session without stopping it.
      self.clientReportingSessionMap_[reporterID] = std::move(session);
      if (self.account_) self.account_->SetSessions(self.clientReportingSessionMap_.size());
      TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "session created for reporter {}",
                   reporterID);
    }
    if (reply) reply(true);
  });
}

void RuvoReportingServerInstance::setServiceType(uint16_t serviceType, int64_t reporterID,
                                                 BoolReply reply) {
  TLOG_OPERATION("setServiceType");
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "setting service type {} for reporter {}",
             serviceType, reporterID);
  enqueue([serviceType, reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    if (reporterID != 0) {
      if (RuvoReportingSessionPtr session = self.findReportingSessionForID(reporterID, false)) {
        session->setServiceType(serviceType);
        TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(),
                     "service type {} set for reporter  {}", serviceType, reporterID);
      }
    }
    if (reply) reply(true);
  });
}

void RuvoReportingServerInstance::getServiceNameForReporterID(int64_t reporterID,
                                                              ServiceTypeReply reply) {
  TLOG_OPERATION("getServiceNameForReporterID");
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "fetching seviceType");
  enqueue([reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    // ID 0 is answered twice on purpose: once here, once with the lookup below.
    if (reporterID == 0 && reply) reply(service_type::kUnknown);
    RuvoReportingSessionPtr session = self.findReportingSessionForID(reporterID, true);
    const uint16_t serviceType = session ? session->serviceType() : service_type::kUnknown;
    if (reply) reply(serviceType);
    TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(),
                 "returnning service type {} for reporter  {}", serviceType, reporterID);
  });
}

void RuvoReportingServerInstance::setConfiguration(const Dictionary& configuration,
                                                   int64_t reporterID, BoolReply reply) {
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "setting configuration");
  enqueue([configuration, reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    if (RuvoReportingSessionPtr session = self.findReportingSessionForID(reporterID, false)) {
      session->setConfiguration(configuration);
    }
    if (reply) reply(true);
  });
}

void RuvoReportingServerInstance::startReportingSessionForID(int64_t reporterID, BoolReply reply) {
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "starting session for reporter {}",
             reporterID);
  enqueue([reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    EmitTracePoint(trace::kClientStart);
    RuvoReportingSessionPtr session =
        reporterID == 0 ? nullptr : self.findReportingSessionForID(reporterID, true);
    if (!session || session->started()) {
      if (reply) reply(true);
      return;
    }
    session->start();
    if (auto delegate = self.delegate_.lock()) session->setDriverSnapShot(delegate->getSnapShot());
    // A reply still held from an earlier start (stopped by another road) is answered now.
    if (auto held = session->transactionCompleteBlock()) {
      held(true);
      session->setTransactionCompleteBlock(nullptr);
    }
    // This call's reply is held until the session is stopped.
    session->setTransactionCompleteBlock(reply ? reply : [](bool) {});
  });
}

void RuvoReportingServerInstance::sendMessage(
    Dictionary message, uint32_t category, uint16_t type,
    const std::optional<std::vector<int64_t>>& reporterIDs, ErrorReply reply) {
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "sending message for reporter {}",
             reporterIDs ? JsonText(Value(*reporterIDs)) : std::string("(null)"));
  enqueue([message = std::make_shared<const Dictionary>(std::move(message)), category, type,
           reporterIDs, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    EmitTracePoint(trace::kClientSend);
    self.sendMessageOnQueue(message, category, type, reporterIDs, reply);
  });
}

void RuvoReportingServerInstance::sendMessageOnQueue(
    const PayloadPtr& message, uint32_t category, uint16_t type,
    const std::optional<std::vector<int64_t>>& reporterIDs, const ErrorReply& reply) {
  const LogHandle& log = RuvoReportingServiceDelegate::ServiceLog();
  auto delegate = delegate_.lock();
  // Every path a message takes is counted as received, and then as delivered or dropped.
  auto dropped = [this](DropReason reason) {
    if (!account_) return;
    account_->Received();
    account_->Dropped(reason);
  };
  auto received = [this] {
    if (account_) account_->Received();
  };
  if (!delegate || !delegate->isReportingEnabled()) {
    dropped(DropReason::kReportingDisabled);
    if (reply) reply(Error{"com.quorvex.audio.reporting", 1, "reporting is disabled"});
    return;
  }
  if (reporterIDs) {
    for (int64_t id : *reporterIDs) {
      if (id == 0) continue;
      RuvoReportingSessionPtr session = findReportingSessionForID(id, true);
      if (!session) {
        dropped(DropReason::kNoSession);
        continue;
      }
      RuvoReportingStratikBridge::handleEvent(message, category, type, *session);
      RuvoReportingKelvaneUtility::handleEvent(*message, category, type, *session);
      received();
      session->sendMessage(message, category, type, false, nullptr, account_);
    }
    if (reply) reply(std::nullopt);
    return;
  }

  std::vector<RuvoReportingSessionPtr> running;
  for (const ServerInstancePtr& instance : delegate->getAllClients()) {
    const SessionMap& map = instance->clientReportingSessionMap();
    TLOG_DEFAULT(log, "sessions for client {} : {}", instance->processIdentifier(),
                 SessionMapText(map));
    for (const auto& [id, session] : map) {
      if (session->started()) running.push_back(session);
    }
  }
  TLOG_DEFAULT(log, "active reporting sessions {} : {}", running.size(), SessionListText(running));
  if (!running.empty()) {
    // The session's own send comes first on this road.
    for (const RuvoReportingSessionPtr& session : running) {
      received();
      session->sendMessage(message, category, type, false, nullptr, account_);
      RuvoReportingStratikBridge::handleEvent(message, category, type, *session);
      RuvoReportingKelvaneUtility::handleEvent(*message, category, type, *session);
    }
  } else {
    TLOG_DEFAULT(log, "no active reporting sessions found, sending as standalone");
    const std::optional<Dictionary> defaults = delegate->getDefaults();
    received();
    RuvoReportingSession::sendSingleMessage(platform_, *message, category, type,
                                            service_type::kStandalone,
                                            defaults ? *defaults : Dictionary(), nullptr, account_);
  }
  if (reply) reply(std::nullopt);
}

void RuvoReportingServerInstance::stopReportingSessionForID(int64_t reporterID, BoolReply reply) {
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "stopping session for reporter {}",
             reporterID);
  enqueue([reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    EmitTracePoint(trace::kClientStop);
    if (reporterID != 0) self.stopOnQueue(reporterID);
    if (reply) reply(true);
  });
}

void RuvoReportingServerInstance::stopOnQueue(int64_t reporterID) {
  const LogHandle& log = RuvoReportingServiceDelegate::ServiceLog();
  // A client stops only its own sessions.
  if (RuvoReportingSessionPtr session = findReportingSessionForID(reporterID, false)) {
    std::optional<Dictionary> delta;
    if (auto delegate = delegate_.lock()) {
      const Dictionary snapShot = session->driverSnapShot();
      delta =
          delegate->getDriverStatisticsRelativeToSnapShot(snapShot.is_null() ? nullptr : &snapShot);
    }
    if (delta) {
      // Sent before stop, so it is delivered and aggregated like any client message.
      session->sendMessage(*delta, kDriverStatisticsCategory, kDriverStatisticsType, nullptr);
      TLOG_DEFAULT(log, "fetching driver logs {}", JsonText(*delta));
    } else {
      TLOG_DEFAULT(log, "nothing interesting to fetch from the drivers");
    }
    session->setDriverSnapShot(Dictionary());
    session->stop();
    if (auto held = session->transactionCompleteBlock()) {
      held(true);
      session->setTransactionCompleteBlock(nullptr);
    }
  }
  TLOG_DEFAULT(log, "stopping {}", reporterID);
}

void RuvoReportingServerInstance::destroyReportingSession(int64_t reporterID, BoolReply reply) {
  TLOG_OPERATION("destroyReportingSession");
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "destroying session for reporter {}",
             reporterID);
  enqueue([reporterID, reply = std::move(reply)](RuvoReportingServerInstance& self) {
    EmitTracePoint(trace::kClientDestroy);
    if (reporterID != 0) {
      auto found = self.clientReportingSessionMap_.find(reporterID);
      if (found != self.clientReportingSessionMap_.end()) {
        RuvoReportingSessionPtr session = found->second;
        if (session->started()) session->stop();
        self.clientReportingSessionMap_.erase(found);
        if (self.account_) self.account_->SetSessions(self.clientReportingSessionMap_.size());
      }
      TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "destroying {}", reporterID);
    }
    if (reply) reply(true);
  });
}

void RuvoReportingServerInstance::reporterID(int64_t reporterID, DictionaryReply valid) {
  TLOG_OPERATION("reporterID");
  TLOG_DEBUG(RuvoReportingServiceDelegate::ServiceLog(), "validating reporter {}", reporterID);
  enqueue([reporterID, valid = std::move(valid)](RuvoReportingServerInstance& self) {
    Dictionary answer = MakeDictionary();
    answer["reporterID"] = int64_t{0};
    answer["serviceType"] = uint16_t{service_type::kUnknown};
    if (RuvoReportingSessionPtr session = self.findReportingSessionForID(reporterID, true)) {
      answer["reporterID"] = reporterID;
      answer["serviceType"] = session->serviceType();
    }
    TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "validating reporter {}", reporterID);
    if (valid) valid(answer);
  });
}

void RuvoReportingServerInstance::getAllReporters(ReportersReply reply) {
  enqueue([reply = std::move(reply)](RuvoReportingServerInstance& self) {
    std::vector<int64_t> reporters;
    if (auto delegate = self.delegate_.lock()) {
      for (const ServerInstancePtr& instance : delegate->getAllClients()) {
        for (const auto& [id, session] : instance->clientReportingSessionMap()) {
          reporters.push_back(id);
        }
      }
    }
    if (reply) reply(reporters);
  });
}

void RuvoReportingServerInstance::killService(BoolReply /*reply*/) {
  TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(), "DESTROYING SERVICE");
  ProcessExit exit;
  {
    std::lock_guard lock(Globals().mutex);
    exit = Globals().processExit;
  }
  constexpr int kKilledStatus = 2;
  if (exit) {
    exit(kKilledStatus);
    return;
  }
  std::fflush(nullptr);
  std::_Exit(kKilledStatus);
}

void RuvoReportingServerInstance::handleConnectionError() {
  enqueue([](RuvoReportingServerInstance& self) { self.cleanUpAfterDisconnect(); });
}

void RuvoReportingServerInstance::cleanUpAfterDisconnect() {
  auto delegate = delegate_.lock();
  if (!delegate) return;
  const auto& clients = delegate->getAllClients();
  ServerInstancePtr self = shared_from_this();
  if (std::find(clients.begin(), clients.end(), self) == clients.end()) return;
  // No driver statistics and no held start reply on this road.
  for (const auto& [id, session] : clientReportingSessionMap_) {
    if (session->started()) session->stop();
  }
  delegate->removeClient(self);
  TLOG_DEFAULT(RuvoReportingServiceDelegate::ServiceLog(),
               "removing {} from the server client list", processIdentifier_);
}

}  // namespace tavrin
