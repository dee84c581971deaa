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

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/Clock.h"
#include "platform/Dispatcher.h"
#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"
#include "platform/Platform.h"
#include "platform/TelvoroSession.h"

namespace tavrin {

// A payload as the session keeps it: cleaned once, then shared by the aggregation lists and the
// delivery queued for it (nothing modifies it after it is made).
using PayloadPtr = std::shared_ptr<const Dictionary>;

// One entry of the nested aggregation list: {messageId: payload} for a message, or a bare value
// (the user info that the summary file puts first) when `messageId` is absent.
struct NestedPayloadEntry {
  std::optional<std::string> messageId;
  PayloadPtr payload;

  // The entry as it appears in the summary file.
  Value ToValue() const;
};

// A list shared between the caller's queue, orientation callbacks and stop. The lock belongs to
// the list object itself, so a stop that swaps the session's list for none leaves a writer that
// already holds the old list's lock appending to an object nobody reads any more.
template <typename T>
struct LockedList {
  std::recursive_mutex mutex;
  std::vector<T> items;  // guarded by mutex

  std::vector<T> Snapshot() {
    std::lock_guard lock(mutex);
    return items;
  }
};
using NestedPayloadList = LockedList<NestedPayloadEntry>;

// The summary event's texts, built as messages arrive so that a session's memory grows with its
// distinct keys and their texts, not with copies of every payload: per key, the text forms of its
// values joined with ",", keys in the order first seen, the summary key first.
class SummaryTexts {
 public:
  void Add(const Dictionary& payload);
  // Payloads added so far (an empty one counts).
  size_t payloadCount() const;
  // The summary event, the summary key's text led by `serviceType`; none when nothing was added.
  std::optional<Dictionary> Summary(uint16_t serviceType) const;

 private:
  mutable std::mutex mutex_;
  size_t payloadCount_ = 0;                                 // guarded by mutex_
  std::vector<std::pair<std::string, std::string>> texts_;  // guarded by mutex_
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

  // Starts the session: fresh aggregation lists, orientation tracking when it applies, and, on
  // telvoroQueue, a TelvoroSession that waits up to kBackendWaitSeconds for its back-ends while the
  // queue is suspended (messages sent meanwhile wait behind it, in order). Returns at once. A
  // started session only logs "<id> is already started".
  void start();
  // Ends orientation tracking (always), and for a started session: sends the summary event,
  // writes the summary file, queues the flush behind every queued message and drops the lists.
  void stop();

  // Counts the message, aggregates it while started and queues its delivery: through the
  // TelvoroSession when the session was started at the time of the call, else as a single
  // message. `reply` (optional) is called at once, on the caller's thread, with nil: it means
  // accepted. `sync` is accepted and has no effect: delivery is never awaited.
  void sendMessage(const Dictionary& payload, uint32_t category, uint16_t type, Reply reply);
  void sendMessage(const Dictionary& payload, uint32_t category, uint16_t type, bool sync,
                   Reply reply);
  // Counts one message of this kind and returns its id "<category>_<type>_<n>". Call exactly once
  // per message.
  std::string messageIdForCategory(uint32_t category, uint16_t type);

  // The summary event of everything aggregated: every value is a string; none when nothing was
  // aggregated. Does not change the session.
  std::optional<Dictionary> createSummaryEventForSession();
  // On internal builds: puts userInfo first in the nested list (a lasting change) and writes the
  // list as a pretty-printed JSON file into "<diagnosticDirectory>/Audio/Reporting". Failures are
  // logged only.
  void writeSummaryJson();
  // The same for the list, user info and service type a stop took out, named by its time.
  void writeSummaryFile(const std::shared_ptr<NestedPayloadList>& list, const Dictionary& info,
                        uint16_t serviceType, WallTime now);
  // Internal build, service type telephony or longformaudio, and a device class other than 6.
  bool shouldReportOrientation();

  // The standalone path: sends one message without any session on the process's background
  // queue, after 0..59 random whole seconds for "alarms" and at once otherwise. `userInfo` is
  // accepted and not sent. `reply` (optional) gets the platform's error or nil, on the background
  // queue.
  static void sendSingleMessage(PlatformServices& platform, const Dictionary& payload,
                                uint32_t category, uint16_t type, uint16_t serviceType,
                                const Dictionary& userInfo, Reply reply);

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
  void setUserInfo(Dictionary userInfo);
  Dictionary messageTypeCounts() const;
  std::optional<std::string> serviceName() const;
  uint16_t serviceType() const { return serviceType_.load(std::memory_order_acquire); }
  std::optional<std::string> orientationCallbackID() const;
  std::optional<SteadyTime> startDate() const;
  // The aggregation, or null while the session is stopped. The nested list is kept only on
  // internal builds, the only ones that write it; lock its own mutex to read it.
  std::shared_ptr<SummaryTexts> summaryTexts() const;
  std::shared_ptr<NestedPayloadList> nestedAggregatedPayloadData() const;
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
  void deliver(const PayloadPtr& cleaned, const PayloadPtr& received, uint32_t category,
               uint16_t type, bool startedAtSend);
  void registerOrientationCallbacks();
  void orientationChanged(OrientationKind kind, const OrientationValue& orientation);
  void appendAggregated(const Dictionary& payload);
  void appendNested(NestedPayloadEntry entry);
  void setTelvoroSession(TelvoroSessionPtr session);

  PlatformServices& platform_;
  const int64_t reporterID_;
  const SerialQueuePtr telvoroQueue_;

  std::atomic<bool> started_{false};
  std::atomic<bool> telvoroSessionStarted_{false};
  std::atomic<uint16_t> serviceType_;

  // Guards the properties below that are not atomics or lists. Never held while calling out.
  mutable std::mutex propertyMutex_;
  std::vector<int32_t> processIdentifiers_;
  Dictionary userInfo_;
  std::optional<std::string> serviceName_;
  std::optional<std::string> orientationCallbackID_;
  std::optional<SteadyTime> startDate_;
  std::shared_ptr<SummaryTexts> summaryTexts_;
  std::shared_ptr<NestedPayloadList> nestedAggregatedPayloadData_;
  TelvoroSessionPtr telvoroSession_;
  TelvoroTokenPtr telvoroAgentToken_;
  Dictionary driverSnapShot_;
  TransactionCompleteBlock transactionCompleteBlock_;

  // Callers count from one queue; the lock only keeps concurrent misuse free of data races.
  mutable std::mutex countsMutex_;
  Dictionary messageTypeCounts_;
};

}  // namespace tavrin
