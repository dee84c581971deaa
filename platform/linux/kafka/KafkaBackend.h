#pragma once

// The Kafka back-end: every record as a JSON object (one field per column of its table in the
// store, dictionaries nested as JSON) to topic "<prefix><table>": <prefix>sessions,
// <prefix>session_messages, <prefix>single_messages, <prefix>analytics_events,
// <prefix>power_events. Sessions and session messages are keyed by their reporter ID as decimal
// text; other records have no key.
//
// Hand-over (Append) produces into librdkafka's queue and returns at once. While the brokers
// cannot be reached records wait in that queue, up to kMaxQueuedMessages records and
// messageTimeout each; a record that finds the queue full, or whose time runs out, is dropped and
// counted (Stats(), DroppedRecords(), and a rate-limited error line).
//
// A poll thread ("tavrin-kafka") serves delivery reports and answers flushes: a flush callback
// runs once the brokers acknowledged (or librdkafka gave up on) every record produced before it.
//
// The back-end is up while its producer runs: unreachable brokers make records wait, they do not
// take the back-end down. It is not up when the producer could not be created (a bad bootstrap
// list or setting), which is logged once.

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <shared_mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Clock.h"
#include "platform/LogSystem.h"
#include "platform/linux/backend/ReportingBackend.h"
#include "platform/linux/time/SystemClock.h"

typedef struct rd_kafka_s rd_kafka_t;
typedef struct rd_kafka_topic_s rd_kafka_topic_t;
typedef struct rd_kafka_queue_s rd_kafka_queue_t;
typedef struct rd_kafka_message_s rd_kafka_message_t;

namespace tavrin {

struct KafkaBackendOptions {
  // bootstrap.servers: "host:port[,host:port...]".
  std::string bootstrap;
  std::string topicPrefix;
  const Clock* clock = &SystemClock();  // rate-limits the drop lines
  LogHandle log;
  int maxQueuedMessages = 100000;                    // see KafkaProducerBackend::kMaxQueuedMessages
  std::chrono::milliseconds messageTimeout{300000};  // see kMessageTimeout
  // How long Shutdown waits for acknowledgements before it drops what is left.
  std::chrono::milliseconds shutdownTimeout{5000};
  // Further librdkafka settings (name, value), applied last.
  std::vector<std::pair<std::string, std::string>> extraConfig;
};

class KafkaProducerBackend final : public ReportingBackend {
 public:
  // queue.buffering.max.messages: 100,000 records of about 300 bytes, some 30 MB, is what an
  // outage of a minute at a busy device's peak rate produces.
  static constexpr int kMaxQueuedMessages = 100000;
  // message.timeout.ms: records wait five minutes for brokers to return, then count as dropped.
  static constexpr std::chrono::milliseconds kMessageTimeout{300000};

  explicit KafkaProducerBackend(KafkaBackendOptions options);
  ~KafkaProducerBackend() override;

  KafkaProducerBackend(const KafkaProducerBackend&) = delete;
  KafkaProducerBackend& operator=(const KafkaProducerBackend&) = delete;

  // "kafka:<bootstrap>".
  std::string Name() const override;
  bool IsUp() const override;
  bool Append(ReportRecordPtr record) override;
  // After Shutdown the callback is called at once, with an error, on the caller's thread.
  void Flush(FlushCallback done) override;
  BackendStats Stats() const override;
  // Records produced and not yet acknowledged: they count in the service's backlog, so the read
  // gate slows clients down before the producer's queue refuses records.
  size_t Backlog() const override;
  size_t BacklogCapacity() const override { return size_t(options_.maxQueuedMessages); }
  void Shutdown() override;

  uint64_t DroppedRecords() const { return drops_.Total(); }
  uint64_t FailedDeliveries() const { return failed_.load(std::memory_order_relaxed); }
  const std::string& TopicPrefix() const { return options_.topicPrefix; }

 private:
  struct Waiter {
    uint64_t target;  // the last record it covers
    FlushCallback done;
  };

  bool Create();
  void PollLoop();
  void AnswerFlushes(bool all);
  void OnDelivery(const rd_kafka_message_t& message);

  static void DeliveryCallback(rd_kafka_t* rk, const rd_kafka_message_t* message, void* opaque);
  static void ErrorCallback(rd_kafka_t* rk, int error, const char* reason, void* opaque);
  static void LogCallback(const rd_kafka_t* rk, int level, const char* facility, const char* text);
  static void EventCallback(rd_kafka_t* rk, void* opaque);

  const KafkaBackendOptions options_;
  DropReporter drops_;
  rd_kafka_t* producer_ = nullptr;
  rd_kafka_queue_t* mainQueue_ = nullptr;
  // By table: sessions, session_messages, single_messages, analytics_events, power_events.
  std::vector<rd_kafka_topic_t*> topics_;
  std::atomic<bool> up_{false};
  std::atomic<uint64_t> accepted_{0};
  std::atomic<uint64_t> delivered_{0};
  std::atomic<uint64_t> failed_{0};

  mutable std::mutex mutex_;  // guards the fields below
  std::condition_variable wakeup_;
  uint64_t producedSeq_ = 0;
  // Produced, no delivery report yet: the receipt of the client message each carries, if any.
  std::map<uint64_t, DeliveryReceiptPtr> outstanding_;
  std::deque<Waiter> waiters_;
  uint64_t lostReported_ = 0;  // drops counted when the last flush was answered
  bool eventsPending_ = false;
  bool stopping_ = false;

  // Held shared by every hand-over, exclusively by Shutdown while it takes the back-end down.
  std::shared_mutex producerMutex_;
  std::mutex shutdownMutex_;
  std::thread poller_;
};

}  // namespace tavrin
