#include "platform/linux/kafka/KafkaBackend.h"

#include <librdkafka/rdkafka.h>
#include <pthread.h>

namespace tavrin {
namespace {

// The order of ReportRecord's alternatives.
constexpr const char* kTables[] = {"sessions", "session_messages", "single_messages",
                                   "analytics_events", "power_events"};
static_assert(std::size(kTables) == std::variant_size_v<ReportRecord>);

// The poll thread wakes on librdkafka's event callback; this bound only guards against a missed
// wake-up and costs one idle wake-up a second.
constexpr std::chrono::milliseconds kIdlePollInterval{1000};
// How long Shutdown waits for the reports of purged records.
constexpr int kPurgeReportTimeoutMs = 500;

void* SeqOpaque(uint64_t seq) { return reinterpret_cast<void*>(static_cast<uintptr_t>(seq)); }
uint64_t OpaqueSeq(void* opaque) { return reinterpret_cast<uintptr_t>(opaque); }

}  // namespace

KafkaProducerBackend::KafkaProducerBackend(KafkaBackendOptions options)
    : options_(std::move(options)), drops_(*options_.clock, options_.log, Name()) {
  if (Create()) up_.store(true, std::memory_order_release);
  // The poll thread runs even when the producer is not up: it answers flushes from its own thread.
  poller_ = std::thread([this] { PollLoop(); });
}

KafkaProducerBackend::~KafkaProducerBackend() { Shutdown(); }

std::string KafkaProducerBackend::Name() const { return "kafka:" + options_.bootstrap; }

bool KafkaProducerBackend::IsUp() const { return up_.load(std::memory_order_acquire); }

bool KafkaProducerBackend::Create() {
  char error[512];
  rd_kafka_conf_t* conf = rd_kafka_conf_new();
  std::vector<std::pair<std::string, std::string>> settings = {
      {"bootstrap.servers", options_.bootstrap},
      {"queue.buffering.max.messages", std::to_string(options_.maxQueuedMessages)},
      {"message.timeout.ms", std::to_string(options_.messageTimeout.count())},
      // Small batches on the wire within a few milliseconds, as the store does.
      {"linger.ms", "5"},
      {"client.id", "tavrind"},
      // Retries after a lost acknowledgement must not write a record twice or out of order: the
      // ledger counts each message delivered once.
      {"enable.idempotence", "true"},
  };
  settings.insert(settings.end(), options_.extraConfig.begin(), options_.extraConfig.end());
  for (const auto& [name, value] : settings) {
    if (rd_kafka_conf_set(conf, name.c_str(), value.c_str(), error, sizeof error) !=
        RD_KAFKA_CONF_OK) {
      TLOG_ERROR(options_.log, "{} is not up: setting {}={} refused: {}", Name(), name, value,
                 error);
      rd_kafka_conf_destroy(conf);
      return false;
    }
  }
  rd_kafka_conf_set_opaque(conf, this);
  rd_kafka_conf_set_dr_msg_cb(conf, &KafkaProducerBackend::DeliveryCallback);
  rd_kafka_conf_set_error_cb(conf, &KafkaProducerBackend::ErrorCallback);
  rd_kafka_conf_set_log_cb(conf, &KafkaProducerBackend::LogCallback);

  producer_ = rd_kafka_new(RD_KAFKA_PRODUCER, conf, error, sizeof error);
  if (!producer_) {
    rd_kafka_conf_destroy(conf);  // rd_kafka_new keeps it only on success
    TLOG_ERROR(options_.log, "{} is not up: the producer could not be created: {}", Name(), error);
    return false;
  }
  for (const char* table : kTables) {
    const std::string topic = options_.topicPrefix + table;
    rd_kafka_topic_t* handle = rd_kafka_topic_new(producer_, topic.c_str(), nullptr);
    if (!handle) {
      TLOG_ERROR(options_.log, "{} is not up: topic {}: {}", Name(), topic,
                 rd_kafka_err2str(rd_kafka_last_error()));
      for (rd_kafka_topic_t* made : topics_) rd_kafka_topic_destroy(made);
      topics_.clear();
      rd_kafka_destroy(producer_);
      producer_ = nullptr;
      return false;
    }
    topics_.push_back(handle);
  }
  mainQueue_ = rd_kafka_queue_get_main(producer_);
  rd_kafka_queue_cb_event_enable(mainQueue_, &KafkaProducerBackend::EventCallback, this);
  TLOG_INFO(options_.log, "{} producing to topics {}*", Name(), options_.topicPrefix);
  return true;
}

bool KafkaProducerBackend::Append(ReportRecordPtr record) {
  std::shared_lock running(producerMutex_);
  if (!IsUp()) {
    drops_.Dropped(1, producer_ ? "the producer is shut down" : "the producer is not up");
    SettleRecord(*record, false, DropReason::kBackendDown);
    return false;
  }
  const std::string value = JsonText(RecordJson(*record));
  const std::optional<int64_t> reporter = RecordReporterId(*record);
  const std::string key = reporter ? std::to_string(*reporter) : std::string();
  uint64_t seq = 0;
  {
    std::lock_guard lock(mutex_);
    seq = ++producedSeq_;
    outstanding_.emplace(seq, RecordReceipt(*record));
  }
  rd_kafka_topic_t* topic = topics_[record->index()];
  const rd_kafka_resp_err_t error =
      rd_kafka_producev(producer_, RD_KAFKA_V_RKT(topic), RD_KAFKA_V_MSGFLAGS(RD_KAFKA_MSG_F_COPY),
                        RD_KAFKA_V_VALUE(const_cast<char*>(value.data()), value.size()),
                        RD_KAFKA_V_KEY((reporter ? key.data() : nullptr), key.size()),
                        RD_KAFKA_V_OPAQUE(SeqOpaque(seq)), RD_KAFKA_V_END);
  if (error == RD_KAFKA_RESP_ERR_NO_ERROR) {
    accepted_.fetch_add(1, std::memory_order_relaxed);
    return true;
  }
  {
    std::lock_guard lock(mutex_);
    outstanding_.erase(seq);
    eventsPending_ = true;  // a flush may have waited for this one
    wakeup_.notify_one();
  }
  // A record over the producer's message.max.bytes (a summary event of a very long session
  // can be) is refused here, never sent in part: it is counted with its size, and the store,
  // which has no such limit, keeps it when it is configured too.
  std::string reason;
  DropReason code = DropReason::kDeliveryFailed;
  if (error == RD_KAFKA_RESP_ERR__QUEUE_FULL) {
    reason = fmt::format("the producer queue is full ({} records)", options_.maxQueuedMessages);
    code = DropReason::kQueueFull;
  } else if (error == RD_KAFKA_RESP_ERR_MSG_SIZE_TOO_LARGE) {
    reason = fmt::format("a record of {} bytes is over message.max.bytes", value.size());
    code = DropReason::kTooLarge;
  } else {
    reason = rd_kafka_err2str(error);
  }
  drops_.Dropped(1, reason);
  SettleRecord(*record, false, code);
  return false;
}

void KafkaProducerBackend::Flush(FlushCallback done) {
  std::unique_lock lock(mutex_);
  if (stopping_) {
    // No poll thread is left to answer from.
    lock.unlock();
    if (done) done(Error{kGeneralErrorDomain, -1, fmt::format("{} is shut down", Name())});
    return;
  }
  waiters_.push_back(Waiter{producedSeq_, std::move(done)});
  eventsPending_ = true;
  wakeup_.notify_one();
}

BackendStats KafkaProducerBackend::Stats() const {
  return BackendStats{accepted_.load(std::memory_order_relaxed),
                      delivered_.load(std::memory_order_relaxed), drops_.Total()};
}

size_t KafkaProducerBackend::Backlog() const {
  std::lock_guard lock(mutex_);
  return outstanding_.size();
}

void KafkaProducerBackend::PollLoop() {
  pthread_setname_np(pthread_self(), "tavrin-kafka");
  for (;;) {
    {
      std::unique_lock lock(mutex_);
      wakeup_.wait_for(lock, kIdlePollInterval, [this] { return eventsPending_ || stopping_; });
      if (stopping_) return;
      eventsPending_ = false;
    }
    // Serve every queued report: the event callback fires only when the queue was empty.
    while (producer_ && rd_kafka_poll(producer_, 0) > 0) {
    }
    AnswerFlushes(false);
  }
}

void KafkaProducerBackend::OnDelivery(const rd_kafka_message_t& message) {
  if (message.err == RD_KAFKA_RESP_ERR_NO_ERROR) {
    delivered_.fetch_add(1, std::memory_order_relaxed);
  } else {
    failed_.fetch_add(1, std::memory_order_relaxed);
    drops_.Dropped(1, fmt::format("delivery failed: {}", rd_kafka_err2str(message.err)));
  }
  DeliveryReceiptPtr receipt;
  {
    std::lock_guard lock(mutex_);
    const auto found = outstanding_.find(OpaqueSeq(message._private));
    if (found == outstanding_.end()) return;
    receipt = std::move(found->second);
    outstanding_.erase(found);
  }
  Settle(receipt, message.err == RD_KAFKA_RESP_ERR_NO_ERROR, DropReason::kDeliveryFailed);
}

void KafkaProducerBackend::AnswerFlushes(bool all) {
  std::vector<std::pair<FlushCallback, OptionalError>> ready;
  {
    std::lock_guard lock(mutex_);
    // Every flush answered now covers the records lost since the previous answer.
    const uint64_t lostNow = drops_.Total();
    const uint64_t lost = lostNow - lostReported_;
    while (!waiters_.empty()) {
      Waiter& waiter = waiters_.front();
      const bool acknowledged = outstanding_.empty() || outstanding_.begin()->first > waiter.target;
      if (!acknowledged && !all) break;
      OptionalError error;
      lostReported_ = lostNow;
      if (!producer_) {
        error = Error{kGeneralErrorDomain, -1, fmt::format("{} is not up", Name())};
      } else if (!acknowledged) {
        error = Error{kGeneralErrorDomain, -1,
                      fmt::format("{} shut down before every record was acknowledged", Name())};
      } else if (lost > 0) {
        error = Error{
            kGeneralErrorDomain, -1,
            fmt::format("{} dropped {} record(s) since the previous flush answer", Name(), lost)};
      }
      ready.emplace_back(std::move(waiter.done), std::move(error));
      waiters_.pop_front();
    }
  }
  for (auto& [done, error] : ready) {
    if (done) done(error);
  }
}

void KafkaProducerBackend::Shutdown() {
  std::lock_guard shutdownLock(shutdownMutex_);
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
    wakeup_.notify_one();
  }
  {
    // Waits for hand-overs in progress; later ones see the back-end down.
    std::unique_lock noAppends(producerMutex_);
    up_.store(false, std::memory_order_release);
  }
  if (poller_.joinable()) poller_.join();
  if (!producer_) {
    AnswerFlushes(true);
    return;
  }

  // Reports are served on this thread from here on.
  rd_kafka_flush(producer_, static_cast<int>(options_.shutdownTimeout.count()));
  if (const int left = rd_kafka_outq_len(producer_); left > 0) {
    rd_kafka_purge(producer_, RD_KAFKA_PURGE_F_QUEUE | RD_KAFKA_PURGE_F_INFLIGHT);
    rd_kafka_flush(producer_, kPurgeReportTimeoutMs);
  }
  AnswerFlushes(true);
  // Whatever got no report even after the purge is lost with the producer.
  std::map<uint64_t, DeliveryReceiptPtr> unreported;
  {
    std::lock_guard lock(mutex_);
    unreported.swap(outstanding_);
  }
  for (const auto& [seq, receipt] : unreported) Settle(receipt, false, DropReason::kDeliveryFailed);
  if (mainQueue_) {
    rd_kafka_queue_cb_event_enable(mainQueue_, nullptr, nullptr);
    rd_kafka_queue_destroy(mainQueue_);
    mainQueue_ = nullptr;
  }
  for (rd_kafka_topic_t* topic : topics_) rd_kafka_topic_destroy(topic);
  topics_.clear();
  rd_kafka_destroy(producer_);
  TLOG_INFO(options_.log, "{} closed: {} records acknowledged, {} dropped", Name(),
            delivered_.load(), drops_.Total());
  // producer_ keeps its value: Append and Flush tell "shut down" from "never up" by it.
}

void KafkaProducerBackend::DeliveryCallback(rd_kafka_t*, const rd_kafka_message_t* message,
                                            void* opaque) {
  static_cast<KafkaProducerBackend*>(opaque)->OnDelivery(*message);
}

void KafkaProducerBackend::ErrorCallback(rd_kafka_t*, int error, const char* reason, void* opaque) {
  auto* self = static_cast<KafkaProducerBackend*>(opaque);
  TLOG_ERROR(self->options_.log, "{}: {}: {}", self->Name(),
             rd_kafka_err2name(static_cast<rd_kafka_resp_err_t>(error)), reason);
}

void KafkaProducerBackend::LogCallback(const rd_kafka_t* rk, int level, const char* facility,
                                       const char* text) {
  auto* self = static_cast<KafkaProducerBackend*>(rd_kafka_opaque(rk));
  if (!self) return;
  // librdkafka uses syslog levels: 0-3 errors, 4-5 warnings and notices, 6 info, 7 debug.
  const LogLevel ours = level <= 3   ? LogLevel::kError
                        : level <= 5 ? LogLevel::kDefault
                        : level == 6 ? LogLevel::kInfo
                                     : LogLevel::kDebug;
  TAVRIN_LOG(self->options_.log, ours, "{}: librdkafka {}: {}", self->Name(), facility, text);
}

void KafkaProducerBackend::EventCallback(rd_kafka_t*, void* opaque) {
  auto* self = static_cast<KafkaProducerBackend*>(opaque);
  std::lock_guard lock(self->mutex_);
  self->eventsPending_ = true;
  self->wakeup_.notify_one();
}

}  // namespace tavrin
