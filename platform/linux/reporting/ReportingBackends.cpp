#include "platform/linux/reporting/ReportingBackends.h"

#include <pthread.h>

#include <algorithm>
#include <limits>

#include "platform/linux/kafka/KafkaBackend.h"
#include "platform/linux/store/SqliteStore.h"

namespace tavrin {
namespace {

constexpr std::string_view kKafkaScheme = "kafka:";
constexpr std::string_view kTopicPrefixOption = "topic-prefix=";

std::vector<std::string_view> SplitCommas(std::string_view text) {
  std::vector<std::string_view> parts;
  size_t start = 0;
  for (;;) {
    const size_t comma = text.find(',', start);
    parts.push_back(text.substr(start, comma - start));
    if (comma == std::string_view::npos) return parts;
    start = comma + 1;
  }
}

std::optional<int64_t> ReporterIdOf(const Dictionary& sessionInfo) {
  if (!sessionInfo.is_object()) return std::nullopt;
  const auto found = sessionInfo.find(kTelvoroSessionInfoSessionID);
  if (found == sessionInfo.end()) return std::nullopt;
  if (found->is_number_integer()) return found->get<int64_t>();
  return std::nullopt;
}

bool IsRecovered(const Dictionary& sessionInfo) {
  if (!sessionInfo.is_object()) return false;
  const auto found = sessionInfo.find(kTelvoroSessionInfoRecovered);
  return found != sessionInfo.end() && found->is_boolean() && found->get<bool>();
}

double Seconds(const Clock& clock) { return SecondsSinceEpoch(clock.WallNow()); }

}  // namespace

std::optional<BackendSpec> ParseBackendSpec(std::string_view text, std::string* error) {
  const auto bad = [&](std::string_view why) -> std::optional<BackendSpec> {
    *error = fmt::format(
        "bad --backend \"{}\": {} (expected sqlite, none or "
        "kafka:BOOTSTRAP[,topic-prefix=P])",
        text, why);
    return std::nullopt;
  };
  if (text == "sqlite") return BackendSpec{BackendSpec::Kind::kSqlite, {}, {}};
  if (text == "none") return BackendSpec{BackendSpec::Kind::kNone, {}, {}};
  if (!text.starts_with(kKafkaScheme)) return bad("unknown back-end");

  BackendSpec choice{BackendSpec::Kind::kKafka, {}, {}};
  bool prefixSeen = false;
  for (std::string_view part : SplitCommas(text.substr(kKafkaScheme.size()))) {
    if (part.starts_with(kTopicPrefixOption)) {
      if (prefixSeen) return bad("topic-prefix given twice");
      prefixSeen = true;
      choice.topicPrefix = part.substr(kTopicPrefixOption.size());
      continue;
    }
    if (part.find('=') != std::string_view::npos) {
      return bad(fmt::format("unknown option \"{}\"", part));
    }
    if (part.empty()) return bad("empty broker address");
    if (part.find_first_of(" \t") != std::string_view::npos) {
      return bad(fmt::format("broker address \"{}\" holds a blank", part));
    }
    if (!choice.bootstrap.empty()) choice.bootstrap += ',';
    choice.bootstrap += part;
  }
  if (choice.bootstrap.empty()) return bad("no broker address");
  return choice;
}

std::optional<std::vector<BackendSpec>> ParseBackendSpecs(const std::vector<std::string>& texts,
                                                          std::string* error) {
  if (texts.empty()) return std::vector<BackendSpec>{BackendSpec{}};
  std::vector<BackendSpec> choices;
  bool none = false;
  for (const std::string& text : texts) {
    std::optional<BackendSpec> choice = ParseBackendSpec(text, error);
    if (!choice) return std::nullopt;
    if (choice->kind == BackendSpec::Kind::kNone) {
      none = true;
      continue;
    }
    const bool duplicate =
        std::any_of(choices.begin(), choices.end(), [&](const BackendSpec& seen) {
          return seen.kind == choice->kind &&
                 (seen.kind == BackendSpec::Kind::kSqlite || seen.bootstrap == choice->bootstrap);
        });
    if (duplicate) {
      *error = fmt::format("--backend \"{}\" is given twice", text);
      return std::nullopt;
    }
    choices.push_back(std::move(*choice));
  }
  if (none && !choices.empty()) {
    *error = "--backend none cannot be combined with another back-end";
    return std::nullopt;
  }
  return choices;
}

std::vector<ReportingBackendPtr> CreateBackends(const std::vector<BackendSpec>& choices,
                                                const BackendEnvironment& environment) {
  std::vector<ReportingBackendPtr> backends;
  for (const BackendSpec& choice : choices) {
    switch (choice.kind) {
      case BackendSpec::Kind::kSqlite: {
        SqliteStoreOptions options;
        options.stateDirectory = environment.stateDirectory;
        options.queueCapacity = environment.storeQueueRecords;
        options.maxPageCount =
            static_cast<int64_t>(environment.storeBytes / SqliteStore::kPageBytes);
        options.clock = environment.clock;
        options.log = environment.log;
        backends.push_back(std::make_unique<SqliteStore>(std::move(options)));
        break;
      }
      case BackendSpec::Kind::kKafka: {
        KafkaBackendOptions options;
        options.bootstrap = choice.bootstrap;
        options.topicPrefix = choice.topicPrefix;
        options.clock = environment.clock;
        options.log = environment.log;
        backends.push_back(std::make_unique<KafkaProducerBackend>(std::move(options)));
        break;
      }
      case BackendSpec::Kind::kNone:
        break;
    }
  }
  return backends;
}

// One session: its row in `sessions` and its reporter ID tag every message it hands over.
class BackendReportingService::Session final : public TelvoroSession {
 public:
  Session(BackendReportingService& service, SessionRecord record)
      : service_(service), record_(std::move(record)) {}

  void StartConfiguration(std::function<void(const BackendList&)> done) override {
    service_.Post(
        [this_service = &service_, done = std::move(done)] { done(this_service->UpBackends()); });
  }

  bool SendSessionMessage(uint16_t category, uint16_t type, const PayloadPtr& payload, Error* error,
                          const DeliveryReceiptPtr& receipt) override {
    return service_.DeliverOrFail(std::make_shared<const ReportRecord>(SessionMessageRecord{
                                      record_.row, record_.reporterId, category, type, payload,
                                      Seconds(service_.clock_), service_.JoinedReceipt(receipt)}),
                                  error);
  }

  void FlushMessages(std::function<void(const OptionalError&)> done) override {
    SessionRecord flushed = record_;
    flushed.flushedAt = Seconds(service_.clock_);
    service_.Deliver(std::make_shared<const ReportRecord>(std::move(flushed)));
    service_.FlushAll(std::move(done));
  }

  std::string Description() const override {
    return fmt::format("<TelvoroSession row {} reporter {}>", record_.row,
                       record_.reporterId ? std::to_string(*record_.reporterId) : "none");
  }

 private:
  BackendReportingService& service_;
  const SessionRecord record_;
};

BackendReportingService::BackendReportingService(std::vector<ReportingBackendPtr> backends,
                                                 const Clock& clock, RandomSource& random,
                                                 LogHandle log)
    : backends_(std::move(backends)),
      clock_(clock),
      random_(random),
      log_(std::move(log)),
      droppedAnswers_(clock, log_, "reporting service"),
      policy_(std::make_shared<const AnalyticsPolicy>()) {
  int64_t lastRow = 0;
  for (const auto& backend : backends_) lastRow = std::max(lastRow, backend->LastSessionRow());
  nextSessionRow_.store(lastRow + 1);
  answerThread_ = std::thread([this] { AnswerLoop(); });
}

BackendReportingService::~BackendReportingService() { Shutdown(); }

TelvoroTokenPtr BackendReportingService::NewSecureHierarchyToken(const TelvoroTokenPtr&) {
  // Uniform over [1, 2^64 - 1]: never the "no token" value 0.
  const uint64_t value = random_.UniformBelow(std::numeric_limits<uint64_t>::max()) + 1;
  return std::make_shared<const TelvoroSecureHierarchyToken>(TelvoroSecureHierarchyToken{value});
}

TelvoroSessionPtr BackendReportingService::CreateTelvoroSession(const Dictionary& sessionInfo,
                                                                const Dictionary& userInfo,
                                                                const std::vector<std::string>&) {
  SessionRecord record{nextSessionRow_.fetch_add(1),
                       ReporterIdOf(sessionInfo),
                       sessionInfo,
                       userInfo,
                       Seconds(clock_),
                       std::nullopt,
                       IsRecovered(sessionInfo)};
  Deliver(std::make_shared<const ReportRecord>(record));
  return std::make_shared<Session>(*this, std::move(record));
}

bool BackendReportingService::SendOneMessage(const Dictionary& sessionInfo,
                                             const Dictionary& userInfo, uint16_t category,
                                             uint16_t type, const Dictionary& payload, Error* error,
                                             const DeliveryReceiptPtr& receipt) {
  return DeliverOrFail(
      std::make_shared<const ReportRecord>(SingleMessageRecord{
          sessionInfo, userInfo, category, type, payload, Seconds(clock_), JoinedReceipt(receipt)}),
      error);
}

namespace {

// One message handed to several back-ends: delivered once any of them commits it, dropped (with
// the first reason) only when every one of them lost it.
class AnyBackendReceipt final : public DeliveryReceipt {
 public:
  AnyBackendReceipt(DeliveryReceiptPtr receipt, size_t backends)
      : receipt_(std::move(receipt)), pending_(backends) {}
  void Delivered() override {
    delivered_.store(true);
    Settled();
  }
  void Dropped(DropReason reason) override {
    uint8_t none = kNoReason;
    firstReason_.compare_exchange_strong(none, uint8_t(reason));
    Settled();
  }

 private:
  static constexpr uint8_t kNoReason = 0xFF;
  void Settled() {
    if (pending_.fetch_sub(1) != 1) return;
    Settle(receipt_, delivered_.load(), DropReason(firstReason_.load()));
  }
  const DeliveryReceiptPtr receipt_;
  std::atomic<size_t> pending_;
  std::atomic<bool> delivered_{false};
  std::atomic<uint8_t> firstReason_{kNoReason};
};

}  // namespace

DeliveryReceiptPtr BackendReportingService::JoinedReceipt(const DeliveryReceiptPtr& receipt) const {
  if (!receipt || backends_.size() <= 1) return receipt;
  return std::make_shared<AnyBackendReceipt>(receipt, backends_.size());
}

void BackendReportingService::SendEventLazy(const std::string& name,
                                            std::function<Dictionary()> buildPayload) {
  std::shared_ptr<const AnalyticsPolicy> policy;
  {
    std::lock_guard lock(policyMutex_);
    policy = policy_;
  }
  bool wanted = policy->enabled;
  if (wanted && policy->prefixes) {
    wanted = std::any_of(policy->prefixes->begin(), policy->prefixes->end(),
                         [&](const std::string& prefix) { return name.starts_with(prefix); });
  }
  if (!wanted) {
    analyticsFiltered_.fetch_add(1, std::memory_order_relaxed);
    return;
  }
  Dictionary payload = buildPayload ? buildPayload() : MakeDictionary();
  Deliver(std::make_shared<const ReportRecord>(
      AnalyticsEventRecord{name, std::move(payload), Seconds(clock_)}));
}

void BackendReportingService::LogRegisteredEvent(int32_t agent, const std::string& name,
                                                 const Dictionary& payload, const Dictionary*) {
  Deliver(std::make_shared<const ReportRecord>(
      PowerEventRecord{agent, name, payload, Seconds(clock_)}));
}

void BackendReportingService::SetAnalyticsPolicy(bool enabled,
                                                 std::optional<std::vector<std::string>> prefixes) {
  auto policy =
      std::make_shared<const AnalyticsPolicy>(AnalyticsPolicy{enabled, std::move(prefixes)});
  std::lock_guard lock(policyMutex_);
  policy_ = std::move(policy);
}

void BackendReportingService::ApplyDefaults(const Dictionary& defaults) {
  bool enabled = true;
  std::optional<std::vector<std::string>> prefixes;
  if (defaults.is_object()) {
    if (const auto found = defaults.find(kAnalyticsEnabledKey); found != defaults.end()) {
      if (found->is_boolean()) {
        enabled = found->get<bool>();
      } else if (found->is_number()) {
        enabled = found->get<double>() != 0;
      } else {
        TLOG_ERROR(log_, "defaults key {} must be a boolean, not {}; analytics stay on",
                   kAnalyticsEnabledKey, JsonText(*found));
      }
    }
    if (const auto found = defaults.find(kAnalyticsPrefixesKey); found != defaults.end()) {
      const bool allStrings =
          found->is_array() && std::all_of(found->begin(), found->end(),
                                           [](const Value& item) { return item.is_string(); });
      if (allStrings) {
        prefixes.emplace();
        for (const Value& item : *found) prefixes->push_back(item.get<std::string>());
      } else {
        TLOG_ERROR(log_, "defaults key {} must be an array of strings, not {}; every event passes",
                   kAnalyticsPrefixesKey, JsonText(*found));
      }
    }
  }
  SetAnalyticsPolicy(enabled, std::move(prefixes));
}

bool BackendReportingService::Congested() const { return BacklogShare() >= 0.5; }

double BackendReportingService::BacklogShare() const {
  double share = 0;
  for (const auto& backend : backends_) {
    const size_t capacity = backend->BacklogCapacity();
    if (capacity > 0) {
      share = std::max(share, static_cast<double>(backend->Backlog()) / double(capacity));
    }
  }
  return share;
}

size_t BackendReportingService::Backlog() const {
  size_t backlog = 0;
  for (const auto& backend : backends_) backlog += backend->Backlog();
  return backlog;
}

BackendList BackendReportingService::UpBackends() const {
  std::vector<std::string> names;
  for (const auto& backend : backends_) {
    if (backend->IsUp()) names.push_back(backend->Name());
  }
  if (names.empty()) return std::nullopt;
  return names;
}

std::vector<BackendStatus> BackendReportingService::Status() const {
  std::vector<BackendStatus> status;
  for (const auto& backend : backends_) {
    status.push_back(BackendStatus{backend->Name(), backend->IsUp(), backend->Stats()});
  }
  return status;
}

size_t BackendReportingService::Deliver(ReportRecordPtr record) {
  size_t taken = 0;
  for (const auto& backend : backends_) taken += backend->Append(record) ? 1 : 0;
  return taken;
}

bool BackendReportingService::DeliverOrFail(ReportRecordPtr record, Error* error) {
  if (backends_.empty()) SettleRecord(*record, false, DropReason::kNoBackend);
  if (Deliver(std::move(record)) > 0) return true;
  if (error) {
    *error = Error{kGeneralErrorDomain, -1,
                   backends_.empty() ? std::string("no reporting back-end is configured")
                                     : fmt::format("none of the {} reporting back-end(s) took the "
                                                   "message",
                                                   backends_.size())};
  }
  return false;
}

void BackendReportingService::FlushAll(FlushCallback done) {
  if (backends_.empty()) {
    Post([done = std::move(done)] { done(std::nullopt); });
    return;
  }
  // Answered by whichever back-end answers last, with the first error any of them gave.
  struct Join {
    std::atomic<size_t> remaining;
    std::mutex mutex;  // guards error
    OptionalError error;
    FlushCallback done;
  };
  auto join = std::make_shared<Join>();
  join->remaining = backends_.size();
  join->done = std::move(done);
  for (const auto& backend : backends_) {
    backend->Flush([join](const OptionalError& error) {
      if (error) {
        std::lock_guard lock(join->mutex);
        if (!join->error) join->error = error;
      }
      if (join->remaining.fetch_sub(1) == 1 && join->done) {
        OptionalError first;
        {
          std::lock_guard lock(join->mutex);
          first = join->error;
        }
        join->done(first);
      }
    });
  }
}

void BackendReportingService::Post(std::function<void()> work) {
  {
    std::lock_guard lock(mutex_);
    if (!stopping_ && answers_.size() < kMaxPendingAnswers) {
      answers_.push_back(std::move(work));
      wakeup_.notify_one();
      return;
    }
  }
  droppedAnswers_.Dropped(1, "discovery answer not sent: the service is stopping or stuck");
}

void BackendReportingService::AnswerLoop() {
  pthread_setname_np(pthread_self(), "tavrin-backends");
  for (;;) {
    std::function<void()> work;
    {
      std::unique_lock lock(mutex_);
      wakeup_.wait(lock, [this] { return stopping_ || !answers_.empty(); });
      if (answers_.empty()) return;
      work = std::move(answers_.front());
      answers_.pop_front();
    }
    work();
  }
}

void BackendReportingService::Shutdown() {
  std::lock_guard shutdownLock(shutdownMutex_);
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
    wakeup_.notify_one();
  }
  // Pending answers run before the thread ends.
  if (answerThread_.joinable()) answerThread_.join();
  for (const auto& backend : backends_) backend->Shutdown();
}

}  // namespace tavrin
