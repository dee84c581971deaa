#pragma once

// The reporting platform services over the configured back-ends (the SQLite store and Kafka):
// TelvoroService (sessions, single messages, discovery, flush), AnalyticsSink and PowerEventLog,
// plus the parser of the `--backend` flags that choose the back-ends.

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/AnalyticsSink.h"
#include "platform/Clock.h"
#include "platform/LogSystem.h"
#include "platform/PowerEventLog.h"
#include "platform/RandomSource.h"
#include "platform/TelvoroSession.h"
#include "platform/linux/backend/ReportingBackend.h"
#include "platform/linux/store/SqliteStore.h"
#include "platform/linux/time/SystemClock.h"

namespace tavrin {

// One `--backend` value.
struct BackendSpec {
  enum class Kind { kSqlite, kKafka, kNone };
  Kind kind = Kind::kSqlite;
  std::string bootstrap;    // kKafka: "host:port[,host:port...]"
  std::string topicPrefix;  // kKafka: put before every topic name
};

// Parses one value: "sqlite", "none" or "kafka:BOOTSTRAP[,topic-prefix=P]" (BOOTSTRAP may list
// several brokers separated by commas). On a bad value returns nothing and sets *error to a
// sentence naming the value and what is wrong with it.
std::optional<BackendSpec> ParseBackendSpec(std::string_view text, std::string* error);

// Parses every `--backend` value given. No value means "sqlite"; "none" (no back-end at all) may
// not be combined with another value; "sqlite" may be given once, and a Kafka bootstrap list
// once.
std::optional<std::vector<BackendSpec>> ParseBackendSpecs(const std::vector<std::string>& texts,
                                                          std::string* error);

struct BackendEnvironment {
  std::string stateDirectory = "/var/lib/tavrin";  // the store's directory
  size_t storeQueueRecords = SqliteStore::kMaxQueuedRecords;
  uint64_t storeBytes = 0;  // the store file's bound; 0 for none but the disk
  const Clock* clock = &SystemClock();
  LogHandle log;
};

// Creates the back-ends of `choices`. A back-end that cannot start is still created, not up (it
// logs why), so that discovery leaves it out and its drops are counted.
std::vector<ReportingBackendPtr> CreateBackends(const std::vector<BackendSpec>& choices,
                                                const BackendEnvironment& environment);

struct BackendStatus {
  std::string name;
  bool up = false;
  BackendStats stats;
};

// The reporting services over a set of back-ends. Every record goes to every back-end.
//
// Records: CreateTelvoroSession writes a `sessions` row (reporter ID from the session info's
// "SessionID", rows numbered on from the highest row in the store); a session's messages go to
// `session_messages` with that row and reporter ID; FlushMessages stamps the row's flushed_at
// (the time of the flush request) and answers once every back-end has committed or acknowledged
// what was handed over before; SendOneMessage writes `single_messages`; SendEventLazy
// `analytics_events`; LogRegisteredEvent `power_events` (the fourth argument is not recorded).
// Received times come from the injected clock, as seconds since the epoch.
//
// Analytics policy, read from the defaults domain by ApplyDefaults (or set by
// SetAnalyticsPolicy):
//   "analytics_enabled"        boolean, default true: false drops every analytics event.
//   "analytics_event_prefixes" array of strings, default: every event. When present, only events
//                              whose name starts with one of the strings are recorded (an empty
//                              array records none).
// An event the policy turns away is not built: its payload builder is never called.
//
// Threads: every method may be called from any thread and none blocks on I/O. Discovery answers
// come from the service's own thread ("tavrin-backends"); flush answers from the thread of the
// back-end that answers last. The service must outlive the sessions it creates.
class BackendReportingService final : public TelvoroService,
                                      public AnalyticsSink,
                                      public PowerEventLog {
 public:
  static constexpr const char* kAnalyticsEnabledKey = "analytics_enabled";
  static constexpr const char* kAnalyticsPrefixesKey = "analytics_event_prefixes";
  // Discovery answers waiting for the service's thread; one per starting session, so more than
  // this means the thread is stuck, and further answers are dropped (and counted).
  static constexpr size_t kMaxPendingAnswers = 4096;

  BackendReportingService(std::vector<ReportingBackendPtr> backends, const Clock& clock,
                          RandomSource& random, LogHandle log = nullptr);
  ~BackendReportingService() override;

  BackendReportingService(const BackendReportingService&) = delete;
  BackendReportingService& operator=(const BackendReportingService&) = delete;

  // TelvoroService. The token is a fresh random non-zero number; the parent is not used.
  TelvoroTokenPtr NewSecureHierarchyToken(const TelvoroTokenPtr& parent) override;
  TelvoroSessionPtr CreateTelvoroSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  // False (with *error) when no back-end took the message.
  bool SendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, uint16_t category,
                      uint16_t type, const Dictionary& payload, Error* error,
                      const DeliveryReceiptPtr& receipt = nullptr) override;

  // AnalyticsSink: calls the builder on the caller's thread when the policy lets the event in.
  void SendEventLazy(const std::string& name, std::function<Dictionary()> buildPayload) override;

  // PowerEventLog.
  void LogRegisteredEvent(int32_t agent, const std::string& name, const Dictionary& payload,
                          const Dictionary* extra) override;

  // `prefixes`: nothing for every event, else only names starting with one of them.
  void SetAnalyticsPolicy(bool enabled, std::optional<std::vector<std::string>> prefixes);
  // Reads the two analytics keys from a defaults dictionary; a key of the wrong type is logged
  // and read as its default.
  void ApplyDefaults(const Dictionary& defaults);
  // Events turned away by the analytics policy.
  uint64_t AnalyticsFiltered() const { return analyticsFiltered_.load(); }

  // True while some back-end's queue is at least half full: the service then reads fewer
  // requests until it drains, so that clients are slowed down instead of losing records.
  bool Congested() const;
  // The fullest bounded back-end queue, as a share of its capacity (0 when none is bounded).
  double BacklogShare() const;
  // Records handed to the back-ends and not yet committed or acknowledged, over all of them.
  size_t Backlog() const;

  // What discovery lists now: the names of the back-ends that are up; nothing when none is.
  BackendList UpBackends() const;
  std::vector<BackendStatus> Status() const;
  // Shuts every back-end down (committing what they accepted) and stops the service's thread.
  // Sessions must not be used afterwards. Idempotent.
  void Shutdown();

 private:
  class Session;

  // Hands `record` to every back-end; the number that took it.
  size_t Deliver(ReportRecordPtr record);
  // The receipt a record for every back-end carries: `receipt` itself for one back-end, else one
  // that tells it once every back-end has settled.
  DeliveryReceiptPtr JoinedReceipt(const DeliveryReceiptPtr& receipt) const;
  bool DeliverOrFail(ReportRecordPtr record, Error* error);
  void FlushAll(FlushCallback done);
  // Runs `work` on the service's thread.
  void Post(std::function<void()> work);
  void AnswerLoop();

  const std::vector<ReportingBackendPtr> backends_;
  const Clock& clock_;
  RandomSource& random_;
  LogHandle log_;
  DropReporter droppedAnswers_;
  std::atomic<int64_t> nextSessionRow_{1};

  struct AnalyticsPolicy {
    bool enabled = true;
    std::optional<std::vector<std::string>> prefixes;
  };
  mutable std::mutex policyMutex_;  // guards policy_
  std::shared_ptr<const AnalyticsPolicy> policy_;
  std::atomic<uint64_t> analyticsFiltered_{0};

  std::mutex mutex_;  // guards the fields below
  std::condition_variable wakeup_;
  std::deque<std::function<void()>> answers_;
  bool stopping_ = false;
  std::mutex shutdownMutex_;
  std::thread answerThread_;
};

}  // namespace tavrin
