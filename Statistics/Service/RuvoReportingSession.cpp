#include "Statistics/Service/RuvoReportingSession.h"

#include <chrono>
#include <cmath>
#include <ctime>
#include <utility>

#include "Statistics/RuvoReportingUtility.h"
#include "platform/DeviceInfoQuery.h"
#include "platform/FileSystem.h"
#include "platform/RandomSource.h"
#include "platform/TracePoints.h"

namespace tavrin {
namespace {

constexpr const char* kSummaryEventKey = "Ruvo_Session_Summary_Event";
constexpr const char* kHostApplicationKey = "HostApplicationDisplayID";
constexpr const char* kSummaryDirectory = "/Audio/Reporting";
// Ends the name of a summary file written for a recovered session, before ".json".
constexpr const char* kRecoveredFileMark = "-recovered";
// Never world-writable: on a shared machine that would let any local user forge or delete
// summaries. The service's group may read them.
constexpr unsigned kSummaryDirectoryMode = 0750;
// Indentation of the summary file: readable by a person, parsed by tools.
constexpr int kSummaryJsonIndent = 2;
constexpr const char* kOrientationIDFormat = "RuvoReportingService {}";
// Devices of this class never track orientation.
constexpr int32_t kNoOrientationDeviceClass = 6;
constexpr uint32_t kPlatformCategoryMask = 0xFFFF;
// The session ID of single messages, which belong to no session.
constexpr int32_t kSingleMessageSessionID = -1;

// "%@" of an absent name.
constexpr const char* kAbsentText = "(null)";

std::string NameText(const std::optional<std::string>& name) {
  return name ? *name : std::string(kAbsentText);
}

// The payload with every " " in its keys replaced by "_" (the payload itself when no key has
// one). When two keys become equal, the later one's value wins. `changed` tells whether any key
// had a blank.
PayloadPtr CleanedPayload(const PayloadPtr& shared, bool* changed) {
  *changed = false;
  const Dictionary& payload = *shared;
  if (payload.is_null()) return std::make_shared<const Dictionary>(MakeDictionary());
  if (!payload.is_object()) {
    TLOG_ERROR(RuvoReportingSession::SessionLog(), "payload is not a dictionary, sending {{}}: {}",
               JsonText(payload));
    *changed = true;
    return std::make_shared<const Dictionary>(MakeDictionary());
  }
  bool blanks = false;
  for (const auto& item : payload.items()) {
    if (item.key().find(' ') != std::string::npos) {
      blanks = true;
      break;
    }
  }
  if (!blanks) return shared;
  *changed = true;
  Dictionary cleaned = MakeDictionary();
  cleaned.get_ref<Dictionary::object_t&>().reserve(payload.size());
  for (const auto& item : payload.items()) {
    std::string key = item.key();
    for (char& c : key) {
      if (c == ' ') c = '_';
    }
    cleaned[key] = item.value();
  }
  return std::make_shared<const Dictionary>(std::move(cleaned));
}

// Seconds as the dispatcher's delays take them.
Duration Seconds(double seconds) {
  return std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds));
}

// "yyyyMMdd-HHmmssZ" in local time, e.g. "20261116-052745+0000".
std::string SummaryFileTime(WallTime now) {
  const std::time_t seconds = std::chrono::system_clock::to_time_t(now);
  std::tm local{};
  if (localtime_r(&seconds, &local) == nullptr) return "00000000-000000+0000";
  char text[64];
  const size_t length = std::strftime(text, sizeof(text), "%Y%m%d-%H%M%S%z", &local);
  return std::string(text, length);
}

// One element of the summary file as pretty printing puts it inside the top-level array: indented
// by one level, without its separator. Throws for text that is not UTF-8.
std::string SummaryFileElement(Value element) {
  Value wrapper = Value::array();
  wrapper.push_back(std::move(element));
  // Strict: invalid UTF-8 in a client's string is an error here, not silently replaced.
  const std::string text =
      wrapper.dump(kSummaryJsonIndent, ' ', false, Value::error_handler_t::strict);
  // "[\n" + element + "\n]"
  return text.substr(2, text.size() - 4);
}

// The entry of one spooled message in the summary file: {message id: payload}.
Value MessageEntry(const Value& record) {
  Value entry = MakeDictionary();
  entry[record[1].get<std::string>()] = record[2];
  return entry;
}

bool IsMessageRecord(const Value& record) {
  return record.size() == 3 && record[0] == "m" && record[1].is_string();
}

// The kind of a message id "<category>_<type>_<n>": what its count is kept under.
std::string MessageKind(const std::string& messageId) {
  const size_t last = messageId.rfind('_');
  return last == std::string::npos ? messageId : messageId.substr(0, last);
}

// A name part of a file name must not leave the directory.
std::string FileNamePart(std::string text) {
  for (char& c : text) {
    if (c == '/' || c == '\0') c = '_';
  }
  return text;
}

}  // namespace

struct RuvoReportingSession::BackendWait {
  std::mutex mutex;
  bool found = false;    // the back-ends-found flag
  bool waiting = false;  // telvoroQueue is suspended for this wait
  bool ended = false;
  // Kept alive while its queue waits, as a blocked queue item would keep it; released at the end.
  std::shared_ptr<RuvoReportingSession> session;
};

const LogHandle& RuvoReportingSession::SessionLog() {
  static const LogHandle handle = RegisterLogScope(
      true, FourCharCode("rvrr"), "rvrr", "com.quorvex.tavrin", "reporting_session_verbose", 31);
  return handle;
}

std::shared_ptr<RuvoReportingSession> RuvoReportingSession::create(
    int64_t reporterID, std::vector<int32_t> processIdentifiers, PlatformServices& platform) {
  SessionLog();
  return std::shared_ptr<RuvoReportingSession>(
      new RuvoReportingSession(reporterID, std::move(processIdentifiers), platform));
}

RuvoReportingSession::RuvoReportingSession(int64_t reporterID,
                                           std::vector<int32_t> processIdentifiers,
                                           PlatformServices& platform)
    : platform_(platform),
      reporterID_(reporterID),
      telvoroQueue_(
          platform.dispatcher->CreateSerialQueue(kTelvoroQueueLabel, QualityOfService::kUtility)),
      serviceType_(service_type::kUnknown),
      processIdentifiers_(std::move(processIdentifiers)),
      userInfo_(MakeDictionary()),
      serviceName_("unknown"),
      summaryTexts_(std::make_shared<SummaryTexts>()),
      messageTypeCounts_(MakeDictionary()) {
  TLOG_INFO(SessionLog(), "created reporting session for ID: {}", reporterID_);
  EmitTracePoint(trace::kSessionCreated);
}

RuvoReportingSession::~RuvoReportingSession() {
  EmitTracePoint(trace::kSessionReleased);
  TLOG_INFO(SessionLog(), "deallocing this session {}", reporterID_);
}

void RuvoReportingSession::setServiceType(uint16_t serviceType) {
  serviceType_.store(serviceType, std::memory_order_release);
  std::optional<std::string> name = ServiceTypeName(serviceType);
  std::shared_ptr<SessionSpool> running;
  {
    std::lock_guard lock(propertyMutex_);
    serviceName_ = name;
    running = spool_;
  }
  if (running) {
    telvoroQueue_->Async([running, serviceType] { running->AppendServiceType(serviceType); });
  }
  TLOG_INFO(SessionLog(), "setting service type {}", NameText(name));
}

void RuvoReportingSession::setConfiguration(const Dictionary& configuration) {
  if (configuration.is_null()) return;
  if (!configuration.is_object()) {
    TLOG_ERROR(SessionLog(), "configuration for {} is not a dictionary: {}", reporterID_,
               JsonText(configuration));
    return;
  }
  std::shared_ptr<SessionSpool> running;
  Dictionary info;
  {
    std::lock_guard lock(propertyMutex_);
    for (const auto& item : configuration.items()) userInfo_[item.key()] = item.value();
    running = spool_;
    if (running) info = userInfo_;
  }
  if (running) spoolUserInfo(running, std::move(info));
}

void RuvoReportingSession::spoolUserInfo(const std::shared_ptr<SessionSpool>& running,
                                         Dictionary info) {
  telvoroQueue_->Async([running, info = std::move(info)] { running->AppendUserInfo(info); });
}

void RuvoReportingSession::updateDefaults(const Dictionary& defaults) {
  setConfiguration(defaults);
}

void RuvoReportingSession::start() {
  TLOG_DEBUG(SessionLog(), "starting session owned by {}", reporterID_);
  if (started()) {
    TLOG_INFO(SessionLog(), "{} is already started", reporterID_);
    return;
  }
  started_.store(true, std::memory_order_release);
  const int64_t startedAt = std::chrono::duration_cast<std::chrono::nanoseconds>(
                                platform_.dispatcher->GetClock().WallNow().time_since_epoch())
                                .count();
  auto spool = SessionSpool::Create(*platform_.fileSystem, platform_.spoolDirectory, reporterID_,
                                    startedAt, platform_.spoolBytesPerSession);
  {
    std::lock_guard lock(propertyMutex_);
    summaryTexts_ = std::make_shared<SummaryTexts>(spool);
    spool_ = spool;
  }
  EmitTracePoint(trace::kSessionStarted);

  if (shouldReportOrientation()) registerOrientationCallbacks();

  // The user info is read when the queued step runs, so configuration given meanwhile counts.
  std::optional<std::string> name = serviceName();
  const uint16_t type = serviceType();
  telvoroQueue_->Async([self = shared_from_this(), spool = std::move(spool),
                        counts = messageTypeCounts(), name = std::move(name), type] {
    spool->AppendHeader(self->reporterID_, type, self->userInfo(), counts);
    self->createTelvoroSessionOnQueue(name, type);
  });
}

void RuvoReportingSession::createTelvoroSessionOnQueue(
    const std::optional<std::string>& serviceName, uint16_t serviceType) {
  TLOG_OPERATION("start");
  // Test sessions never get a TelvoroSession.
  if (this->serviceType() == service_type::kTest) return;

  TelvoroService& telvoro = *platform_.telvoro;
  TelvoroTokenPtr token = telvoro.NewSecureHierarchyToken(nullptr);
  {
    std::lock_guard lock(propertyMutex_);
    telvoroAgentToken_ = token;
  }

  // Every service type but apiusage is batched; apiusage is real-time.
  Dictionary sessionInfo = MakeDictionary();
  sessionInfo[kTelvoroSessionInfoClientType] = kClientType;
  sessionInfo[kTelvoroSessionInfoClientVersion] = kClientVersion;
  sessionInfo[kTelvoroSessionInfoSessionID] = reporterID_;
  sessionInfo[kTelvoroSessionInfoBatchEvent] = serviceType != service_type::kApiUsage;
  sessionInfo[kTelvoroSessionInfoHierarchyToken] = token ? Value(token->value) : Value();
  sessionInfo[kTelvoroSessionInfoContainsRealtimeEvents] = serviceType == service_type::kApiUsage;
  if (recovered_) sessionInfo[kTelvoroSessionInfoRecovered] = true;

  Dictionary telvoroUserInfo = MakeDictionary();
  telvoroUserInfo[kTelvoroUserInfoClientName] = kClientName;
  if (serviceName) telvoroUserInfo[kTelvoroUserInfoServiceName] = *serviceName + "_session";
  // The client's entries go on top, so a client may rename its service.
  const Dictionary clientUserInfo = userInfo();
  if (clientUserInfo.is_object() && !clientUserInfo.empty()) {
    for (const auto& item : clientUserInfo.items()) telvoroUserInfo[item.key()] = item.value();
  }

  TelvoroSessionPtr session = telvoro.CreateTelvoroSession(sessionInfo, telvoroUserInfo, {});
  setTelvoroSession(session);

  // The wait for the back-ends holds no thread: the queue is suspended (later items wait behind
  // this one, in order) until the answer or the time-out resumes it, whichever comes first.
  auto wait = std::make_shared<BackendWait>();
  wait->found = telvoroSessionStarted();
  wait->session = shared_from_this();
  if (session) {
    session->StartConfiguration([wait](const BackendList& backends) {
      if (!backends) {
        // The wait runs into its time-out.
        TLOG_ERROR(SessionLog(), "No backends found, this session won't get sent to the server");
        return;
      }
      TLOG_DEFAULT(SessionLog(), "List of backends {}", JsonText(Value(*backends)));
      EndBackendWait(wait, true);
    });
  }

  std::lock_guard lock(wait->mutex);
  if (wait->found) {
    // Answered before the wait began: nothing to wait for.
    wait->ended = true;
    wait->session.reset();
    return;
  }
  TLOG_DEFAULT(SessionLog(), "waiting for telvorod to find backends");
  wait->waiting = true;
  telvoroQueue_->Suspend();
  platform_.dispatcher->BackgroundQueue().AsyncAfter(Seconds(kBackendWaitSeconds),
                                                     [wait] { EndBackendWait(wait, false); });
}

bool RuvoReportingSession::EndBackendWait(const std::shared_ptr<BackendWait>& wait, bool found) {
  std::shared_ptr<RuvoReportingSession> session;
  {
    std::lock_guard lock(wait->mutex);
    if (wait->ended) return false;
    if (found) wait->found = true;
    // Not begun yet: the waiter sees the flag and does not wait at all.
    if (!wait->waiting) return false;
    wait->ended = true;
    session = std::move(wait->session);
    if (found) {
      TLOG_DEFAULT(SessionLog(), "continuing");
    } else {
      TLOG_ERROR(SessionLog(), "failed to find backend");
      // The queue is suspended, so nothing of this session runs on it while these change.
      session->setTelvoroSession(nullptr);
      session->telvoroSessionStarted_.store(false, std::memory_order_release);
    }
  }
  session->telvoroQueue_->Resume();
  return true;
}

void RuvoReportingSession::stop() {
  TLOG_OPERATION("stop");
  TLOG_DEBUG(SessionLog(), "ending session {}", reporterID_);
  if (shouldReportOrientation()) {
    std::optional<std::string> id = orientationCallbackID();
    if (id) {
      platform_.orientation->UnregisterDeviceOrientation(*id);
      platform_.orientation->UnregisterUIOrientation(*id);
      std::lock_guard lock(propertyMutex_);
      orientationCallbackID_.reset();
    }
  }
  if (!started()) return;

  TLOG_DEBUG(SessionLog(), "ending session {}", reporterID_);
  EmitTracePoint(trace::kSessionStopped);

  // What this run gathered is taken out now, with the state it is summarised in; the summary
  // event, the file and the flush then run on the session's own queue, behind every message
  // already queued there, so no other client's request waits for them.
  std::shared_ptr<SummaryTexts> texts;
  std::shared_ptr<SessionSpool> spool;
  std::vector<Dictionary> leading;
  {
    std::lock_guard lock(propertyMutex_);
    texts = std::move(summaryTexts_);
    spool = std::move(spool_);
    leading = std::exchange(leadingEntries_, {});
    leading.insert(leading.begin(), userInfo_);
  }
  const uint16_t stoppedServiceType = serviceType();
  const WallTime stoppedAt = platform_.dispatcher->GetClock().WallNow();
  // The summary is a message of the session too: it takes its message id in order with the
  // messages sent before the stop, and is the last entry of the summary file.
  const bool hasSummary = texts && texts->payloadCount() > 0;
  std::string summaryId =
      hasSummary ? messageIdForCategory(kSummaryEventCategory, kSummaryEventType) : std::string();
  started_.store(false, std::memory_order_release);

  telvoroQueue_->Async([self = shared_from_this(), texts = std::move(texts),
                        spool = std::move(spool), leading = std::move(leading), stoppedServiceType,
                        stoppedAt, hasSummary, summaryId = std::move(summaryId)] {
    TLOG_OPERATION("stop");
    self->deliverSpooled();
    Value lastEntry;
    if (hasSummary) {
      if (std::optional<Dictionary> summary = texts->Summary(stoppedServiceType)) {
        TLOG_DEFAULT(SessionLog(), "sending summary event for reporter {}", self->reporterID_);
        EmitTracePoint(trace::kMessageSent);
        bool changed = false;
        PayloadPtr cleaned =
            CleanedPayload(std::make_shared<const Dictionary>(std::move(*summary)), &changed);
        lastEntry = MakeDictionary();
        lastEntry[summaryId] = *cleaned;
        self->deliver(cleaned, cleaned, kSummaryEventCategory, kSummaryEventType,
                      /*startedAtSend=*/true, nullptr);
      }
    }
    self->writeSummaryFile(spool, leading, stoppedServiceType, stoppedAt,
                           lastEntry.is_null() ? nullptr : &lastEntry);
    // The spool goes once the summary is committed: until then a crash still has it to recover
    // from.
    TelvoroSessionPtr session =
        self->serviceType() != service_type::kTest ? self->telvoroSession() : nullptr;
    if (session && spool) {
      session->FlushMessages([spool](const OptionalError& error) {
        if (error) {
          TLOG_ERROR(SessionLog(), "flush error {}", error->LocalizedDescription());
          return;
        }
        spool->Remove();
      });
    } else if (session) {
      session->FlushMessages([](const OptionalError& error) {
        if (error) TLOG_ERROR(SessionLog(), "flush error {}", error->LocalizedDescription());
      });
    } else if (spool) {
      // A recovered summary that found no back-end keeps its spool for the next start.
      if (!self->recovered_ || self->serviceType() == service_type::kTest) spool->Remove();
    }
    self->setTelvoroSession(nullptr);
  });
}

void RuvoReportingSession::sendMessage(const Dictionary& payload, uint32_t category, uint16_t type,
                                       Reply reply) {
  sendMessage(payload, category, type, false, std::move(reply));
}

void RuvoReportingSession::sendMessage(const Dictionary& payload, uint32_t category, uint16_t type,
                                       bool sync, Reply reply, const DeliveryReceiptPtr& receipt) {
  sendMessage(std::make_shared<const Dictionary>(payload), category, type, sync, std::move(reply),
              receipt);
}

void RuvoReportingSession::sendMessage(const PayloadPtr& payload, uint32_t category, uint16_t type,
                                       bool /*sync*/, Reply reply,
                                       const DeliveryReceiptPtr& receipt) {
  TLOG_DEBUG(SessionLog(), "sending message for session owned by {}", reporterID_);
  bool changed = false;
  PayloadPtr cleaned = CleanedPayload(payload, &changed);
  // The message as received is only shown by a debug line at delivery; it is kept apart only
  // when cleaning changed it and debug lines are on.
  PayloadPtr received =
      changed && LogTarget(SessionLog()).ShouldLog(LogLevel::kDebug) ? payload : cleaned;
  std::string messageId = messageIdForCategory(category, type);
  std::shared_ptr<SummaryTexts> texts;
  std::shared_ptr<SessionSpool> spool;
  {
    std::lock_guard lock(propertyMutex_);
    texts = summaryTexts_;
    spool = spool_;
  }
  if (texts) texts->Add(*cleaned);
  EmitTracePoint(trace::kMessageSent);

  // The state at send time decides the road, even if stop runs before delivery. The message
  // reaches the spool before the back-ends, so whatever they commit a crash can recover.
  const bool startedAtSend = started();
  if (!startedAtSend) spool.reset();
  queuedSends_.fetch_add(1);
  telvoroQueue_->Async([self = shared_from_this(), cleaned = std::move(cleaned),
                        received = std::move(received), messageId = std::move(messageId),
                        spool = std::move(spool), category, type, startedAtSend, receipt] {
    const bool lastQueued = self->queuedSends_.fetch_sub(1) == 1;
    if (!spool) {
      self->deliverSpooled();
      self->deliver(cleaned, received, category, type, startedAtSend, receipt);
      return;
    }
    // Spooled in bursts: a message is handed on only after its record is written, and a burst
    // ends when the queue holds no more sends or the buffer is full.
    spool->BufferMessage(messageId, *cleaned);
    self->spooledDeliveries_.push_back(
        SpooledDelivery{cleaned, received, category, type, receipt, spool});
    if (lastQueued || spool->bufferedBytes() >= kSpoolBurstBytes) self->deliverSpooled();
  });
  if (reply) reply(std::nullopt);
}

void RuvoReportingSession::deliverSpooled() {
  if (spooledDeliveries_.empty()) return;
  std::vector<SpooledDelivery> burst;
  burst.swap(spooledDeliveries_);
  for (const SpooledDelivery& delivery : burst) delivery.spool->FlushMessages();
  for (const SpooledDelivery& delivery : burst) {
    deliver(delivery.cleaned, delivery.received, delivery.category, delivery.type,
            /*startedAtSend=*/true, delivery.receipt);
  }
}

void RuvoReportingSession::deliver(const PayloadPtr& cleaned, const PayloadPtr& received,
                                   uint32_t category, uint16_t type, bool startedAtSend,
                                   const DeliveryReceiptPtr& receipt) {
  if (!startedAtSend) {
    TLOG_DEBUG(SessionLog(), "session not started, will send as a single message");
    sendSingleMessage(platform_, *cleaned, category, type, serviceType(), userInfo(), nullptr,
                      receipt);
    return;
  }
  if (serviceType() == service_type::kTest) {
    TLOG_INFO(SessionLog(), "transactions aren't allowed on this platform");
    Settle(receipt, false, DropReason::kTestSession);
    return;
  }
  TelvoroSessionPtr session = telvoroSession();
  if (!session) {
    const Error error{kGeneralErrorDomain, -1, "No valid TelvoroSession"};
    TLOG_ERROR(SessionLog(), "{}", error.LocalizedDescription());
    Settle(receipt, false, DropReason::kNoBackend);
    return;
  }
  // A refused message is dropped without a line: the platform's error says nothing the caller
  // could act on, and the reply has long been given.
  Error error;
  if (session->SendSessionMessage(static_cast<uint16_t>(category & kPlatformCategoryMask), type,
                                  cleaned, &error, receipt)) {
    TLOG_DEBUG(SessionLog(), "TelvoroAgent {} : message {} : category {} : type {}",
               session->Description(), *received, static_cast<int32_t>(category), type);
  }
}

std::string RuvoReportingSession::messageIdForCategory(uint32_t category, uint16_t type) {
  std::string kind = fmt::format("{}_{}", CategoryName(category), TypeName(type));
  int64_t count = 1;
  {
    std::lock_guard lock(countsMutex_);
    Value& slot = messageTypeCounts_[kind];
    if (slot.is_number_integer()) count = slot.get<int64_t>() + 1;
    slot = count;
  }
  return fmt::format("{}_{}", kind, count);
}

void RuvoReportingSession::appendAggregated(const Dictionary& payload) {
  // A stop that ran meanwhile leaves none to add to; an add racing a stop lands in texts nobody
  // reads any more.
  if (std::shared_ptr<SummaryTexts> texts = summaryTexts()) texts->Add(payload);
}

SummaryTexts::SummaryTexts(std::shared_ptr<SessionSpool> spool) : spool_(std::move(spool)) {}

void SummaryTexts::Add(const Dictionary& payload) {
  std::lock_guard lock(mutex_);
  if (texts_.empty()) {
    texts_.emplace_back(kSummaryEventKey, std::string());
    indexOfKey_.emplace(kSummaryEventKey, 0);
  }
  ++payloadCount_;
  if (!payload.is_object()) return;
  for (const auto& item : payload.items()) {
    auto [slot, added] = indexOfKey_.try_emplace(item.key(), texts_.size());
    const size_t index = slot->second;
    if (added) {
      texts_.emplace_back(item.key(), ValueText(item.value()));
    } else {
      // The summary key's text gets the service type in front at the end, so its values too
      // each follow a ",".
      std::string& text = texts_[index].second;
      text += ',';
      text += ValueText(item.value());
    }
    std::string& text = texts_[index].second;
    if (spool_ && text.size() > kSpillBytes && spool_->AppendTextPiece(index, text)) {
      text = std::string();
      spilled_ = true;
    }
  }
}

size_t SummaryTexts::payloadCount() const {
  std::lock_guard lock(mutex_);
  return payloadCount_;
}

std::optional<Dictionary> SummaryTexts::Summary(uint16_t serviceType) const {
  std::lock_guard lock(mutex_);
  if (payloadCount_ == 0) return std::nullopt;
  // Spilled pieces come first: a key's text is its pieces in spool order, then what is in memory.
  std::vector<std::string> pieces(texts_.size());
  if (spilled_) {
    OptionalError error = spool_->Replay([&](const Value& record) {
      if (record.size() == 3 && record[0] == "k" && record[1].is_number_unsigned() &&
          record[2].is_string() && record[1].get<size_t>() < pieces.size()) {
        pieces[record[1].get<size_t>()] += record[2].get_ref<const std::string&>();
      }
    });
    if (error) {
      TLOG_ERROR(RuvoReportingSession::SessionLog(), "summary texts: {}",
                 error->LocalizedDescription());
    }
  }
  Dictionary summary = MakeDictionary();
  for (size_t i = 0; i < texts_.size(); ++i) {
    std::string text = std::move(pieces[i]) + texts_[i].second;
    summary[texts_[i].first] = i == 0 ? std::to_string(serviceType) + text : std::move(text);
  }
  return summary;
}

std::optional<Dictionary> RuvoReportingSession::createSummaryEventForSession() {
  std::shared_ptr<SummaryTexts> texts = summaryTexts();
  if (!texts) return std::nullopt;
  return texts->Summary(serviceType());
}

void RuvoReportingSession::writeSummaryJson() {
  std::vector<Dictionary> leading;
  std::shared_ptr<SessionSpool> spool;
  {
    std::lock_guard lock(propertyMutex_);
    spool = spool_;
    // The user info goes first only into a list that has entries.
    if (leadingEntries_.empty() && !(spool && spool->messageCount() > 0)) return;
    leadingEntries_.insert(leadingEntries_.begin(), userInfo_);
    leading = leadingEntries_;
  }
  writeSummaryFile(spool, leading, serviceType(), platform_.dispatcher->GetClock().WallNow(),
                   nullptr);
}

void RuvoReportingSession::writeSummaryFile(const std::shared_ptr<SessionSpool>& spool,
                                            const std::vector<Dictionary>& leading,
                                            uint16_t serviceType, WallTime now, const Value* last) {
  if (!IsInternalBuild(platform_)) return;
  if (!spool) return;
  // The leading user info stands alone in a file of nothing else.
  if (spool->messageCount() == 0 && last == nullptr && leading.size() <= 1) return;

  // One error slot for the steps, never cleared between them: an earlier error is reported
  // again by the last step.
  OptionalError error;
  const std::string directory = platform_.diagnosticDirectory + kSummaryDirectory;
  if (OptionalError created =
          platform_.fileSystem->CreateDirectories(directory, kSummaryDirectoryMode)) {
    error = std::move(created);
    TLOG_ERROR(SessionLog(), "can't create logging directory at {}: {}", directory,
               error->LocalizedDescription());
  }

  const Dictionary& info = leading.front();
  const auto application = info.find(kHostApplicationKey);
  const std::string applicationName =
      application != info.end() ? ValueText(*application) : std::string("unknown");
  const std::string fileName = fmt::format(
      "{}-{}-{}-{}{}.json", SummaryFileTime(now), "tavrin", FileNamePart(applicationName),
      FileNamePart(NameText(ServiceTypeName(serviceType))), recovered_ ? kRecoveredFileMark : "");

  // Streamed from the spool: the file never has to fit in memory.
  OptionalError writeError;
  std::unique_ptr<WritableFile> file =
      platform_.fileSystem->BeginAtomicWrite(directory + "/" + fileName, &writeError);
  bool first = true;
  auto write = [&](Value element) {
    if (!file) return;
    std::string text = first ? "[\n" : ",\n";
    first = false;
    text += SummaryFileElement(std::move(element));
    if (OptionalError appended = file->Append(text)) {
      writeError = std::move(appended);
      file.reset();
    }
  };
  try {
    for (const Dictionary& entry : leading) write(entry);
    OptionalError replayed = spool->Replay([&](const Value& record) {
      if (IsMessageRecord(record)) write(MessageEntry(record));
    });
    if (replayed) writeError = std::move(replayed);
    if (last) write(*last);
  } catch (const Value::exception& e) {
    error = Error{kGeneralErrorDomain, e.id, e.what()};
    TLOG_ERROR(SessionLog(), "dataWithJSONObject: {}", error->LocalizedDescription());
    file.reset();
  }
  if (file && !writeError) {
    writeError = file->Append("\n]");
    if (!writeError) writeError = file->Commit();
  }
  if (writeError) error = std::move(writeError);
  if (error) TLOG_ERROR(SessionLog(), "jsonOutput writeToURL: {}", error->LocalizedDescription());
}

void RuvoReportingSession::recover(PlatformServices& platform, const std::string& spoolPath) {
  TLOG_OPERATION("recover");
  std::shared_ptr<SessionSpool> spool = SessionSpool::Existing(*platform.fileSystem, spoolPath);
  std::optional<int64_t> reporterID;
  uint16_t serviceType = service_type::kUnknown;
  Dictionary info = MakeDictionary();
  Dictionary counts = MakeDictionary();
  auto texts = std::make_shared<SummaryTexts>();
  uint64_t messages = 0;
  OptionalError error = spool->Replay([&](const Value& record) {
    const std::string& kind = record[0].get_ref<const std::string&>();
    if (kind == "h" && record.size() == 5 && record[1].is_number_integer() &&
        record[2].is_number_unsigned() && record[4].is_object()) {
      reporterID = record[1].get<int64_t>();
      serviceType = record[2].get<uint16_t>();
      info = record[3];
      counts = record[4];
    } else if (IsMessageRecord(record)) {
      texts->Add(record[2]);
      ++messages;
      Value& count = counts[MessageKind(record[1].get<std::string>())];
      count = count.is_number_integer() ? count.get<int64_t>() + 1 : 1;
    } else if (kind == "a" && record.size() == 2) {
      texts->Add(record[1]);
    } else if (kind == "u" && record.size() == 2) {
      info = record[1];
    } else if (kind == "t" && record.size() == 2 && record[1].is_number_unsigned()) {
      serviceType = record[1].get<uint16_t>();
    }
  });
  if (error) TLOG_ERROR(SessionLog(), "{}", error->LocalizedDescription());
  if (!reporterID || texts->payloadCount() == 0) {
    TLOG_DEFAULT(SessionLog(), "nothing to recover from {}, removing it", spoolPath);
    spool->Remove();
    return;
  }
  TLOG_DEFAULT(SessionLog(), "recovering the summary of reporter {} from {} ({} messages)",
               *reporterID, spoolPath, messages);
  spool->setMessageCount(messages);

  std::shared_ptr<RuvoReportingSession> session = create(*reporterID, {}, platform);
  session->recovered_ = true;
  session->setServiceType(serviceType);
  session->setUserInfo(info);
  {
    std::lock_guard lock(session->countsMutex_);
    session->messageTypeCounts_ = std::move(counts);
  }
  {
    std::lock_guard lock(session->propertyMutex_);
    session->summaryTexts_ = std::move(texts);
    session->spool_ = std::move(spool);
  }
  session->started_.store(true, std::memory_order_release);
  std::optional<std::string> name = session->serviceName();
  session->telvoroQueue_->Async([session, name = std::move(name), serviceType] {
    session->createTelvoroSessionOnQueue(name, serviceType);
  });
  session->stop();
}

bool RuvoReportingSession::shouldReportOrientation() {
  if (!IsInternalBuild(platform_)) return false;
  const uint16_t type = serviceType();
  if (type != service_type::kLongFormAudio && type != service_type::kTelephony) return false;
  return platform_.deviceInfo->QueryInt32(kDeviceInfoDeviceClassNumber, 0) !=
         kNoOrientationDeviceClass;
}

void RuvoReportingSession::registerOrientationCallbacks() {
  const std::string id = fmt::format(kOrientationIDFormat, reporterID_);
  {
    std::lock_guard lock(propertyMutex_);
    orientationCallbackID_ = id;
    startDate_ = platform_.dispatcher->GetClock().Now();
  }
  // The callbacks hold the session until they are unregistered.
  platform_.orientation->RegisterDeviceOrientation(
      id, [self = shared_from_this()](const OrientationValue& orientation) {
        self->orientationChanged(OrientationKind::kDevice, orientation);
      });
  platform_.orientation->RegisterUIOrientation(
      id, [self = shared_from_this()](const OrientationValue& orientation) {
        self->orientationChanged(OrientationKind::kUI, orientation);
      });
}

void RuvoReportingSession::orientationChanged(OrientationKind kind,
                                              const OrientationValue& orientation) {
  const std::string text = platform_.orientation->OrientationToString(orientation);
  const std::optional<SteadyTime> start = startDate();
  const SteadyTime now = platform_.dispatcher->GetClock().Now();
  const double elapsed = std::chrono::duration<double>(now - start.value_or(now)).count();
  // Whole milliseconds, half away from zero.
  const double time = std::round(elapsed * 1000) / 1000;

  const bool device = kind == OrientationKind::kDevice;
  if (LogTarget(SessionLog()).ShouldLog(LogLevel::kDebug)) {
    const Dictionary info = userInfo();
    const auto application = info.find(kHostApplicationKey);
    TLOG_DEBUG(SessionLog(),
               "Orientation handler callback mode={} orientation=\"{}\" app=\"{}\", time={}, "
               "id=\"{}\"",
               device ? "device" : "ui", text,
               application != info.end() ? ValueText(*application) : std::string(kAbsentText),
               ValueText(Value(time)), NameText(orientationCallbackID()));
  }

  Dictionary record = MakeDictionary();
  record[device ? "device_orientation" : "ui_orientation"] = text;
  record[device ? "device_orientation_time" : "ui_orientation_time"] = time;
  appendAggregated(record);
  if (std::shared_ptr<SessionSpool> running = spool()) {
    telvoroQueue_->Async([running, record] { running->AppendAggregated(record); });
  }
}

void RuvoReportingSession::sendSingleMessage(PlatformServices& platform, const Dictionary& payload,
                                             uint32_t category, uint16_t type, uint16_t serviceType,
                                             const Dictionary& userInfo, Reply reply,
                                             const DeliveryReceiptPtr& receipt) {
  // `userInfo` is not sent: single messages carry only the service's own identification.
  (void)userInfo;
  const int64_t delaySeconds =
      serviceType == service_type::kAlarms
          ? static_cast<int64_t>(platform.random->UniformBelow(kAlarmsDelaySpreadSeconds))
          : 0;
  TLOG_DEBUG(SessionLog(), "sending single message after delta {} for service {}", delaySeconds,
             static_cast<int>(serviceType));

  bool changed = false;
  auto shared = std::make_shared<const Dictionary>(payload);
  PayloadPtr cleaned = CleanedPayload(shared, &changed);
  PayloadPtr received =
      changed && LogTarget(SessionLog()).ShouldLog(LogLevel::kDebug) ? shared : cleaned;
  Work send = [&platform, cleaned = std::move(cleaned), received = std::move(received), category,
               type, serviceType, reply = std::move(reply), receipt] {
    EmitTracePoint(trace::kMessageSent);
    TLOG_DEBUG(SessionLog(), "sending single message");
    Dictionary sessionInfo = MakeDictionary();
    sessionInfo[kTelvoroSessionInfoClientType] = kClientType;
    sessionInfo[kTelvoroSessionInfoClientVersion] = kClientVersion;
    sessionInfo[kTelvoroSessionInfoSessionID] = kSingleMessageSessionID;
    Dictionary telvoroUserInfo = MakeDictionary();
    telvoroUserInfo[kTelvoroUserInfoClientName] = kClientName;
    if (std::optional<std::string> name = ServiceTypeName(serviceType)) {
      telvoroUserInfo[kTelvoroUserInfoServiceName] = *name;
    }

    Error error;
    OptionalError result;
    if (platform.telvoro->SendOneMessage(sessionInfo, telvoroUserInfo,
                                         static_cast<uint16_t>(category & kPlatformCategoryMask),
                                         type, *cleaned, &error, receipt)) {
      TLOG_DEBUG(SessionLog(), "message {} : category {} : type {}", *received,
                 static_cast<int32_t>(category), type);
    } else {
      TLOG_ERROR(SessionLog(), "sendOneMessageWithSessionInfo {}", error.LocalizedDescription());
      result = std::move(error);
    }
    if (reply) reply(result);
  };
  if (delaySeconds > 0) {
    // Held back, not dropped, when the service stops: it then goes at once.
    platform.dispatcher->AsyncDeferred(platform.dispatcher->BackgroundQueue(),
                                       std::chrono::seconds(delaySeconds), std::move(send));
  } else {
    platform.dispatcher->BackgroundQueue().Async(std::move(send));
  }
}

std::vector<int32_t> RuvoReportingSession::processIdentifiers() const {
  std::lock_guard lock(propertyMutex_);
  return processIdentifiers_;
}

void RuvoReportingSession::setProcessIdentifiers(std::vector<int32_t> processIdentifiers) {
  std::lock_guard lock(propertyMutex_);
  processIdentifiers_ = std::move(processIdentifiers);
}

Dictionary RuvoReportingSession::userInfo() const {
  std::lock_guard lock(propertyMutex_);
  return userInfo_;
}

Value RuvoReportingSession::applicationName() const {
  std::lock_guard lock(propertyMutex_);
  return ApplicationNameFromUserInfo(&userInfo_);
}

void RuvoReportingSession::setUserInfo(Dictionary userInfo) {
  if (userInfo.is_null()) userInfo = MakeDictionary();
  std::shared_ptr<SessionSpool> running;
  {
    std::lock_guard lock(propertyMutex_);
    userInfo_ = userInfo;
    running = spool_;
  }
  if (running) spoolUserInfo(running, std::move(userInfo));
}

Dictionary RuvoReportingSession::messageTypeCounts() const {
  std::lock_guard lock(countsMutex_);
  return messageTypeCounts_;
}

std::optional<std::string> RuvoReportingSession::serviceName() const {
  std::lock_guard lock(propertyMutex_);
  return serviceName_;
}

std::optional<std::string> RuvoReportingSession::orientationCallbackID() const {
  std::lock_guard lock(propertyMutex_);
  return orientationCallbackID_;
}

std::optional<SteadyTime> RuvoReportingSession::startDate() const {
  std::lock_guard lock(propertyMutex_);
  return startDate_;
}

std::shared_ptr<SummaryTexts> RuvoReportingSession::summaryTexts() const {
  std::lock_guard lock(propertyMutex_);
  return summaryTexts_;
}

std::shared_ptr<SessionSpool> RuvoReportingSession::spool() const {
  std::lock_guard lock(propertyMutex_);
  return spool_;
}

TelvoroSessionPtr RuvoReportingSession::telvoroSession() const {
  std::lock_guard lock(propertyMutex_);
  return telvoroSession_;
}

void RuvoReportingSession::setTelvoroSession(TelvoroSessionPtr session) {
  TelvoroSessionPtr previous;
  {
    std::lock_guard lock(propertyMutex_);
    previous = std::exchange(telvoroSession_, std::move(session));
  }
  // `previous` may be the last reference: released outside the lock.
}

TelvoroTokenPtr RuvoReportingSession::telvoroAgentToken() const {
  std::lock_guard lock(propertyMutex_);
  return telvoroAgentToken_;
}

Dictionary RuvoReportingSession::driverSnapShot() const {
  std::lock_guard lock(propertyMutex_);
  return driverSnapShot_;
}

void RuvoReportingSession::setDriverSnapShot(Dictionary snapshot) {
  std::lock_guard lock(propertyMutex_);
  driverSnapShot_ = std::move(snapshot);
}

RuvoReportingSession::TransactionCompleteBlock RuvoReportingSession::transactionCompleteBlock()
    const {
  std::lock_guard lock(propertyMutex_);
  return transactionCompleteBlock_;
}

void RuvoReportingSession::setTransactionCompleteBlock(TransactionCompleteBlock block) {
  std::lock_guard lock(propertyMutex_);
  transactionCompleteBlock_ = std::move(block);
}

}  // namespace tavrin
