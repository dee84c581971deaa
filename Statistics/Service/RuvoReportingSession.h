#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Statistics/Service/SessionSpool.h"
#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/Clock.h"
#include "platform/Dispatcher.h"
#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"
#include "platform/Platform.h"
#include "platform/TelvoroSession.h"

namespace tavrin {

// The summary event's texts, built as messages arrive so that a session's memory grows with its
// distinct keys, not with its messages: per key, the text forms of its values joined with ",",
// keys in the order first seen, the summary key first. A key's text that grows past kSpillBytes
// goes to the spool in pieces and is put together again for the summary.
class SummaryTexts {
 public:
  static constexpr size_t kSpillBytes = 4096;

  // Without a spool every text stays in memory.
  explicit SummaryTexts(std::shared_ptr<SessionSpool> spool = nullptr);
  void Add(const Dictionary& payload);
  // Payloads added so far (an empty one counts).
  size_t payloadCount() const;
  // The summary event, the summary key's text led by `serviceType`; none when nothing was added.
  std::optional<Dictionary> Summary(uint16_t serviceType) const;

 private:
  const std::shared_ptr<SessionSpool> spool_;
  mutable std::mutex mutex_;
  size_t payloadCount_ = 0;                                 // guarded by mutex_
  std::vector<std::pair<std::string, std::string>> texts_;  // guarded by mutex_
  bool spilled_ = false;                                    // guarded by mutex_
  std::unordered_map<std::string, size_t> indexOfKey_;      // guarded by mutex_
};

// One reporting session of one client, named by its reporter ID. It owns the real-time reporting
// session (TelvoroSession) through which its messages reach the back-ends, gives every message a
// per-session id, aggregates the messages into a summary sent at stop, writes the summary file on
// internal builds and records orientation changes for some service types.
//
// Threads: the caller (the client's work queue) calls every operation; `telvoroQueue` runs every
// TelvoroSession operation of this session, one at a time in order; orientation callbacks arrive
// on the registry's thread; single messages run on the platform's background queue. Every
// accessor may be called from any thread.
//
// Lifetime: shared by the client's map and by the work queued for the session; work queued on
// `telvoroQueue`, the back-end wait and registered orientation callbacks all keep it alive.
class RuvoReportingSession : public std::enable_shared_from_this<RuvoReportingSession> {
 public:
  using Reply = std::function<void(const OptionalError&)>;
  using TransactionCompleteBlock = std::function<void(bool)>;

  // How long start waits for the back-ends before giving up on the TelvoroSession.
  static constexpr double kBackendWaitSeconds = 9.0;
  // Single messages of the "alarms" service type are spread over this many whole seconds.
  static constexpr uint64_t kAlarmsDelaySpreadSeconds = 60;
  // Identify this service to the back-ends.
  static constexpr int32_t kClientType = 19;
  static constexpr double kClientVersion = 2.0;
  static constexpr const char* kClientName = "com.quorvex.tavrin";
  static constexpr const char* kTelvoroQueueLabel = "com.quorvex.tavrin.session.telvoro";

  // Creates a session (stopped, service type 0xFFFF "unknown") that uses `platform` for its
  // queue, the back-ends, orientation and files. The first call registers the session log scope.
  static std::shared_ptr<RuvoReportingSession> create(int64_t reporterID,
                                                      std::vector<int32_t> processIdentifiers,
                                                      PlatformServices& platform);
  ~RuvoReportingSession();
  RuvoReportingSession(const RuvoReportingSession&) = delete;
  RuvoReportingSession& operator=(const RuvoReportingSession&) = delete;

  // Stores the code and its lower-case name (absent for codes without a name).
  void setServiceType(uint16_t serviceType);
  // Both merge the entries of `configuration` into userInfo (later keys overwrite); a null value
  // does nothing. Nothing is re-sent to a running TelvoroSession.
  void setConfiguration(const Dictionary& configuration);
  void updateDefaults(const Dictionary& defaults);

  // Starts the session: fresh aggregation and spool, orientation tracking when it applies, and, on
  // telvoroQueue, a TelvoroSession that waits up to kBackendWaitSeconds for its back-ends while the
  // queue is suspended (messages sent meanwhile wait behind it, in order). Returns at once. A
  // started session only logs "<id> is already started".
  void start();
  // Ends orientation tracking (always), and for a started session takes its aggregation and
  // spool out and hands the rest to telvoroQueue, behind every queued message: the summary
  // event, the summary file, the flush, and the spool's removal once the flush is done.
  void stop();

  // Sends the summary of a session that was open when an earlier run of the service ended, from
  // the spool it left at `spoolPath`: through the back-ends as an ordinary stop would, marked as
  // recovered, with its summary file on internal builds; then removes the spool. A spool without
  // a session's header or without anything aggregated is only removed.
  static void recover(PlatformServices& platform, const std::string& spoolPath);

  // Counts the message, aggregates it while started and queues its delivery: through the
  // TelvoroSession when the session was started at the time of the call, else as a single
  // message. `reply` (optional) is called at once, on the caller's thread, with nil: it means
  // accepted. `sync` is accepted and has no effect: delivery is never awaited.
  void sendMessage(const Dictionary& payload, uint32_t category, uint16_t type, Reply reply);
  // `receipt`, when given, is the sender's account: it is told what became of the message.
  void sendMessage(const Dictionary& payload, uint32_t category, uint16_t type, bool sync,
                   Reply reply, const DeliveryReceiptPtr& receipt = nullptr);
  // The same for a payload that others share: a payload that needs no cleaning is kept, not
  // copied.
  void sendMessage(const PayloadPtr& payload, uint32_t category, uint16_t type, bool sync,
                   Reply reply, const DeliveryReceiptPtr& receipt = nullptr);
  // Counts one message of this kind and returns its id "<category>_<type>_<n>". Call exactly once
  // per message.
  std::string messageIdForCategory(uint32_t category, uint16_t type);

  // The summary event of everything aggregated: every value is a string; none when nothing was
  // aggregated. Does not change the session.
  std::optional<Dictionary> createSummaryEventForSession();
  // On internal builds: puts userInfo first in the nested list (a lasting change) and writes the
  // list, read from the spool, as a pretty-printed JSON file into
  // "<diagnosticDirectory>/Audio/Reporting". Failures are logged only.
  void writeSummaryJson();
  // The same for the spool and service type a stop took out, named by its time: `leading` (the
  // user info first) before the spooled messages, `last` (the summary entry) after them when
  // given.
  void writeSummaryFile(const std::shared_ptr<SessionSpool>& spool,
                        const std::vector<Dictionary>& leading, uint16_t serviceType, WallTime now,
                        const Value* last);
  // Internal build, service type telephony or longformaudio, and a device class other than 6.
  bool shouldReportOrientation();

  // The standalone path: sends one message without any session on the process's background
  // queue, after 0..59 random whole seconds for "alarms" and at once otherwise. `userInfo` is
  // accepted and not sent. `reply` (optional) gets the platform's error or nil, on the background
  // queue.
  static void sendSingleMessage(PlatformServices& platform, const Dictionary& payload,
                                uint32_t category, uint16_t type, uint16_t serviceType,
                                const Dictionary& userInfo, Reply reply,
                                const DeliveryReceiptPtr& receipt = nullptr);

  // The session log scope ("rvrr"); registered once per process. May be null (default log).
  static const LogHandle& SessionLog();

  // Properties.
  PlatformServices& platform() const { return platform_; }
  int64_t reporterID() const { return reporterID_; }
  std::vector<int32_t> processIdentifiers() const;
  void setProcessIdentifiers(std::vector<int32_t> processIdentifiers);
  bool started() const { return started_.load(std::memory_order_acquire); }
  // A copy of the user info as it is now.
  Dictionary userInfo() const;
  // The user info's application name as ApplicationNameFromUserInfo reads it, without copying
  // the user info: read for every message.
  Value applicationName() const;
  void setUserInfo(Dictionary userInfo);
  Dictionary messageTypeCounts() const;
  std::optional<std::string> serviceName() const;
  uint16_t serviceType() const { return serviceType_.load(std::memory_order_acquire); }
  std::optional<std::string> orientationCallbackID() const;
  std::optional<SteadyTime> startDate() const;
  // The aggregation and the spool that holds the nested list, or null while the session is
  // stopped.
  std::shared_ptr<SummaryTexts> summaryTexts() const;
  std::shared_ptr<SessionSpool> spool() const;
  TelvoroSessionPtr telvoroSession() const;
  TelvoroTokenPtr telvoroAgentToken() const;
  const SerialQueuePtr& telvoroQueue() const { return telvoroQueue_; }
  bool telvoroSessionStarted() const {
    return telvoroSessionStarted_.load(std::memory_order_acquire);
  }
  // Stored for the client instance, which sets it at start and reads and clears it at stop; null
  // when there is none.
  Dictionary driverSnapShot() const;
  void setDriverSnapShot(Dictionary snapshot);
  TransactionCompleteBlock transactionCompleteBlock() const;
  void setTransactionCompleteBlock(TransactionCompleteBlock block);

 private:
  struct BackendWait;
  enum class OrientationKind { kDevice, kUI };

  RuvoReportingSession(int64_t reporterID, std::vector<int32_t> processIdentifiers,
                       PlatformServices& platform);

  // The queued half of start, on telvoroQueue.
  void createTelvoroSessionOnQueue(const std::optional<std::string>& serviceName,
                                   uint16_t serviceType);
  // Ends the back-end wait; true when this call ended it (each wait ends exactly once).
  static bool EndBackendWait(const std::shared_ptr<BackendWait>& wait, bool found);
  // A message spooled and waiting for the rest of its burst; telvoroQueue only.
  struct SpooledDelivery {
    PayloadPtr cleaned;
    PayloadPtr received;
    uint32_t category;
    uint16_t type;
    DeliveryReceiptPtr receipt;
    std::shared_ptr<SessionSpool> spool;
  };
  // A burst of spooled messages is written in one piece up to this size.
  static constexpr size_t kSpoolBurstBytes = 64 * 1024;
  // Writes the waiting messages' records, then hands the messages on; telvoroQueue only.
  void deliverSpooled();
  void deliver(const PayloadPtr& cleaned, const PayloadPtr& received, uint32_t category,
               uint16_t type, bool startedAtSend, const DeliveryReceiptPtr& receipt);
  void registerOrientationCallbacks();
  void orientationChanged(OrientationKind kind, const OrientationValue& orientation);
  void appendAggregated(const Dictionary& payload);
  // Records the user info in the spool, in order with the messages.
  void spoolUserInfo(const std::shared_ptr<SessionSpool>& running, Dictionary info);
  void setTelvoroSession(TelvoroSessionPtr session);

  PlatformServices& platform_;
  const int64_t reporterID_;
  const SerialQueuePtr telvoroQueue_;

  std::atomic<bool> started_{false};
  std::atomic<bool> telvoroSessionStarted_{false};
  std::atomic<uint16_t> serviceType_;
  // Sends queued on telvoroQueue and not yet run.
  std::atomic<size_t> queuedSends_{0};
  std::vector<SpooledDelivery> spooledDeliveries_;  // telvoroQueue only
  // Recovered sessions say so in their session info and summary file name; set before sharing.
  bool recovered_ = false;

  // Guards the properties below that are not atomics or lists. Never held while calling out.
  mutable std::mutex propertyMutex_;
  std::vector<int32_t> processIdentifiers_;
  Dictionary userInfo_;
  std::optional<std::string> serviceName_;
  std::optional<std::string> orientationCallbackID_;
  std::optional<SteadyTime> startDate_;
  std::shared_ptr<SummaryTexts> summaryTexts_;
  std::shared_ptr<SessionSpool> spool_;
  std::vector<Dictionary> leadingEntries_;
  TelvoroSessionPtr telvoroSession_;
  TelvoroTokenPtr telvoroAgentToken_;
  Dictionary driverSnapShot_;
  TransactionCompleteBlock transactionCompleteBlock_;

  // Callers count from one queue; the lock only keeps concurrent misuse free of data races.
  mutable std::mutex countsMutex_;
  Dictionary messageTypeCounts_;
};

}  // namespace tavrin
