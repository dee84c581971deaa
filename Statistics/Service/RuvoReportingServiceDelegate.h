#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/RuvoReportingDriverUtility.h"
#include "Statistics/Service/RuvoReportingSession.h"
#include "base/Dictionary.h"
#include "platform/Clock.h"
#include "platform/Dispatcher.h"
#include "platform/LogSystem.h"
#include "platform/MessageLedger.h"
#include "platform/Platform.h"
#include "platform/ServiceListener.h"
#include "protocol/RuvoReportingServiceProtocol.h"

namespace tavrin {

class RuvoReportingServerInstance;
using ServerInstancePtr = std::shared_ptr<RuvoReportingServerInstance>;
using RuvoReportingSessionPtr = std::shared_ptr<RuvoReportingSession>;

// What a client instance needs of the listener delegate. Every operation runs on the shared work
// queue, except findReportingSessionForID, which takes the delegate's lock itself.
class RuvoReportingServiceDelegateProtocol {
 public:
  virtual ~RuvoReportingServiceDelegateProtocol() = default;
  // The session of `reporterID` in any client (the first accepted client that holds it); none for
  // 0 or while reporting is disabled.
  virtual RuvoReportingSessionPtr findReportingSessionForID(int64_t reporterID) = 0;
  // The live client list itself, in order of acceptance. Work queue only.
  virtual const std::vector<ServerInstancePtr>& getAllClients() = 0;
  // The last settings read; none until the first defaults notification.
  virtual std::optional<Dictionary> getDefaults() = 0;
  virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const Dictionary* snapShot) = 0;
  virtual Dictionary getSnapShot() = 0;
  virtual bool isReportingEnabled() = 0;
  virtual void removeClient(const ServerInstancePtr& instance) = 0;
};

// The process's one listener delegate: accepts every connection, creates the client's instance,
// keeps the client list and the settings (re-read on the defaults notification), owns the driver
// statistics utility, and reports each client's connected time to the analytics sink.
class RuvoReportingServiceDelegate final
    : public ServiceListenerDelegate,
      public RuvoReportingServiceDelegateProtocol,
      public std::enable_shared_from_this<RuvoReportingServiceDelegate> {
 public:
  static constexpr const char* kWorkQueueLabel = "com.quorvex.tavrin.reporting.server";
  static constexpr const char* kUptimeEventName = "com.quorvex.tavrin.ruvoreportingclientuptime";

  // Registers the front end's log scope, creates the shared work queue (process-wide; a later
  // delegate replaces it), registers for the defaults notification and creates the driver
  // utility. The settings are not read here.
  static std::shared_ptr<RuvoReportingServiceDelegate> init(PlatformServices& platform);
  ~RuvoReportingServiceDelegate() override;

  // Reads the defaults domain afresh: "device_name" when present, "disable_reporting" always.
  Dictionary RuvoReportingDefaults();
  void listenForDefaultsNotification();

  bool shouldAcceptNewConnection(ServiceListener& listener,
                                 const ClientConnectionPtr& connection) override;

  RuvoReportingSessionPtr findReportingSessionForID(int64_t reporterID) override;
  const std::vector<ServerInstancePtr>& getAllClients() override { return clients_; }
  std::optional<Dictionary> getDefaults() override;
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const Dictionary* snapShot) override;
  Dictionary getSnapShot() override;
  bool isReportingEnabled() override { return reportingEnabled_.load(); }
  void removeClient(const ServerInstancePtr& instance) override;

  RuvoReportingDriverUtility& driverUtility() { return *driverUtility_; }

  // The shared serial work queue of the process (null before the first delegate is made).
  static SerialQueuePtr WorkQueue();
  // The front end's log scope ("rvrs"); may be null (default log).
  static const LogHandle& ServiceLog();

 private:
  explicit RuvoReportingServiceDelegate(PlatformServices& platform);
  void handleDefaultsNotification(int token);
  void reportClientUptime(const std::weak_ptr<RuvoReportingServerInstance>& weakInstance,
                          int32_t pid);
  std::optional<std::string> processNameForPID(int32_t pid);

  PlatformServices& platform_;
  std::atomic<bool> reportingEnabled_{true};
  // Changed on the work queue only.
  std::vector<ServerInstancePtr> clients_;
  std::unique_ptr<RuvoReportingDriverUtility> driverUtility_;
  mutable std::mutex defaultsMutex_;
  std::optional<Dictionary> defaults_;  // guarded by defaultsMutex_
  int ownNotificationToken_ = -1;
  // The lock "on the delegate": instance creation and the cross-client search.
  std::recursive_mutex delegateMutex_;
};

// One client connection's side of the service: owns the client's sessions and carries out the
// remote operations one at a time on the shared work queue.
class RuvoReportingServerInstance final
    : public RuvoReportingServiceProtocol,
      public std::enable_shared_from_this<RuvoReportingServerInstance> {
 public:
  using SessionMap = std::map<int64_t, RuvoReportingSessionPtr>;

  // Called by killService with exit status 2; replaceable so tests can observe it.
  using ProcessExit = std::function<void(int status)>;
  static void SetProcessExit(ProcessExit exit);

  static ServerInstancePtr initWithPID(int32_t pid,
                                       std::weak_ptr<RuvoReportingServiceDelegateProtocol> delegate,
                                       PlatformServices& platform);
  ~RuvoReportingServerInstance() override;

  // Own map first; the other clients too when `acrossAllClients`. Work queue only.
  RuvoReportingSessionPtr findReportingSessionForID(int64_t reporterID, bool acrossAllClients);
  // Queues the disconnect clean-up; a second call finds the instance gone and does nothing.
  void handleConnectionError();

  // The remote operations. Each writes its entry line on the caller's thread and does its work
  // on the shared work queue; killService ends the process on the spot.
  void createReportingSession(int64_t reporterID, BoolReply reply) override;
  void setServiceType(uint16_t serviceType, int64_t reporterID, BoolReply reply) override;
  void getServiceNameForReporterID(int64_t reporterID, ServiceTypeReply reply) override;
  void setConfiguration(const Dictionary& configuration, int64_t reporterID,
                        BoolReply reply) override;
  void startReportingSessionForID(int64_t reporterID, BoolReply reply) override;
  void sendMessage(Dictionary message, uint32_t category, uint16_t type,
                   const std::optional<std::vector<int64_t>>& reporterIDs,
                   ErrorReply reply) override;
  void stopReportingSessionForID(int64_t reporterID, BoolReply reply) override;
  void destroyReportingSession(int64_t reporterID, BoolReply reply) override;
  void reporterID(int64_t reporterID, DictionaryReply valid) override;
  void getAllReporters(ReportersReply reply) override;
  void killService(BoolReply reply) override;

  int32_t processIdentifier() const { return processIdentifier_; }
  std::optional<WallTime> clientStartDate() const;
  void setClientStartDate(WallTime date);
  std::optional<std::string> clientProcessName() const;
  void setClientProcessName(std::optional<std::string> name);
  // Work queue only.
  const SessionMap& clientReportingSessionMap() const { return clientReportingSessionMap_; }
  // The client's account in the message ledger, set once before the first request; null
  // without a ledger.
  void setAccount(LedgerAccountPtr account) { account_ = std::move(account); }
  const LedgerAccountPtr& account() const { return account_; }

 private:
  RuvoReportingServerInstance(int32_t pid,
                              std::weak_ptr<RuvoReportingServiceDelegateProtocol> delegate,
                              PlatformServices& platform);
  // Runs `work` on the shared work queue with this instance kept alive. An idle queue runs it at
  // once on the caller's thread (the connection's), which spares the request a hand-over to a pool
  // thread and back; a busy one queues it behind what waits.
  void enqueue(std::function<void(RuvoReportingServerInstance&)> work);
  void sendMessageOnQueue(const PayloadPtr& message, uint32_t category, uint16_t type,
                          const std::optional<std::vector<int64_t>>& reporterIDs,
                          const ErrorReply& reply);
  void stopOnQueue(int64_t reporterID);
  void cleanUpAfterDisconnect();

  PlatformServices& platform_;
  const int32_t processIdentifier_;
  const std::weak_ptr<RuvoReportingServiceDelegateProtocol> delegate_;
  const SerialQueuePtr workQueue_;

  mutable std::mutex propertyMutex_;
  std::optional<WallTime> clientStartDate_;       // guarded by propertyMutex_
  std::optional<std::string> clientProcessName_;  // guarded by propertyMutex_
  SessionMap clientReportingSessionMap_;          // work queue only
  LedgerAccountPtr account_;
};

}  // namespace tavrin
