// The C interface of libtavrin and its real-time send: the audio thread copies a message into a
// preallocated single-producer queue; a background thread turns it into a dictionary and sends
// it over an ordinary Client, reconnecting (and re-creating this client's sessions) when the
// service comes back.

// The queue orders its producer and consumer with fences, which ThreadSanitizer does not model;
// it comes with happens-before annotations, switched on only by clang's feature test. Under g++'s
// ThreadSanitizer they are switched on here.
#ifdef __SANITIZE_THREAD__
extern "C" void AnnotateHappensBefore(const char*, int, void*);
extern "C" void AnnotateHappensAfter(const char*, int, void*);
inline int tavrinQueueTsanAnchor;
#define AE_TSAN_ANNOTATE_RELEASE() AnnotateHappensBefore(__FILE__, __LINE__, &tavrinQueueTsanAnchor)
#define AE_TSAN_ANNOTATE_ACQUIRE() AnnotateHappensAfter(__FILE__, __LINE__, &tavrinQueueTsanAnchor)
#endif
#include <readerwriterqueue/readerwriterqueue.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "tavrin/Client.h"
#include "tavrin/tavrin.h"

namespace {

using tavrin::client::Client;
using tavrin::client::Dictionary;
using tavrin::client::Errc;

// How often the background thread looks at the queue while it is empty, and tries to reconnect
// while the service is away. Reporting tolerates a millisecond of latency; a sleeping thread costs
// the audio thread nothing, unlike a semaphore it would have to post.
constexpr auto kIdlePoll = std::chrono::milliseconds(1);
constexpr auto kReconnectPause = std::chrono::milliseconds(500);
constexpr auto kControlTimeout = std::chrono::seconds(5);

// One field as the audio thread left it: fixed size, so that queueing never allocates.
struct RtField {
  char key[TAVRIN_RT_MAX_KEY + 1];
  tavrin_field_kind kind;
  int64_t integer;
  double number;
  char text[TAVRIN_RT_MAX_STRING + 1];
};

struct RtMessage {
  uint32_t category;
  uint16_t type;
  uint8_t fieldCount;
  uint8_t reporterCount;  // 0: every running session
  int64_t reporters[TAVRIN_RT_MAX_REPORTERS];
  RtField fields[TAVRIN_RT_MAX_FIELDS];
};

// Copies at most `capacity` bytes of `text` and a terminating zero.
void CopyBounded(char* into, const char* text, size_t capacity) {
  size_t length = 0;
  if (text != nullptr) {
    while (length < capacity && text[length] != '\0') ++length;
    std::memcpy(into, text, length);
  }
  into[length] = '\0';
}

tavrin_status StatusOf(Errc code) {
  switch (code) {
    case Errc::kNotRunning:
      return TAVRIN_ERR_NOT_RUNNING;
    case Errc::kPermissionDenied:
      return TAVRIN_ERR_PERMISSION;
    case Errc::kConnectionLost:
      return TAVRIN_ERR_CONNECTION_LOST;
    case Errc::kTimedOut:
      return TAVRIN_ERR_TIMED_OUT;
    default:
      return TAVRIN_ERR_REFUSED;
  }
}

template <typename T>
tavrin_status StatusOf(const tavrin::client::Result<T>& result) {
  return result.ok() ? TAVRIN_OK : StatusOf(result.error().code);
}

// What the client knows of one of its sessions, to open it again after a reconnect.
struct SessionState {
  uint16_t serviceType = 0xFFFF;
  Dictionary configuration = Dictionary::object();
  bool started = false;
};

Dictionary ToDictionary(const RtMessage& message) {
  Dictionary payload = Dictionary::object();
  for (uint8_t i = 0; i < message.fieldCount; ++i) {
    const RtField& field = message.fields[i];
    switch (field.kind) {
      case TAVRIN_FIELD_INT:
        payload[field.key] = field.integer;
        break;
      case TAVRIN_FIELD_DOUBLE:
        payload[field.key] = field.number;
        break;
      case TAVRIN_FIELD_BOOL:
        payload[field.key] = field.integer != 0;
        break;
      case TAVRIN_FIELD_STRING:
        payload[field.key] = field.text;
        break;
    }
  }
  return payload;
}

}  // namespace

struct tavrin_client {
  tavrin_client(std::string path, size_t capacity, std::shared_ptr<Client> connected)
      : socketPath(std::move(path)), queue(capacity), client(std::move(connected)) {}

  const std::string socketPath;
  moodycamel::ReaderWriterQueue<RtMessage> queue;  // audio thread in, background thread out
  std::atomic<uint64_t> dropped{0};
  std::atomic<uint64_t> sent{0};
  std::atomic<uint64_t> queued{0};  // messages the audio thread queued
  std::atomic<uint64_t> taken{0};   // of those, the ones the background thread has handled
  std::atomic<bool> running{true};

  std::mutex mutex;
  std::shared_ptr<Client> client;            // guarded by mutex; null while the service is away
  std::map<int64_t, SessionState> sessions;  // guarded by mutex
  std::thread worker;

  std::shared_ptr<Client> Current() {
    std::lock_guard lock(mutex);
    return client;
  }

  // Connects again and opens this client's sessions as they were. Background thread.
  bool Reconnect() {
    auto fresh = Client::Connect({socketPath, kControlTimeout});
    if (!fresh.ok()) return false;
    std::shared_ptr<Client> connected = std::move(fresh.value());
    std::lock_guard lock(mutex);
    for (const auto& [id, state] : sessions) {
      (void)connected->createReportingSession(id, kControlTimeout);
      (void)connected->setServiceType(state.serviceType, id, kControlTimeout);
      (void)connected->setConfiguration(state.configuration, id, kControlTimeout);
      if (state.started) connected->startReportingSessionForID(id, [](auto) {});
    }
    client = std::move(connected);
    return true;
  }

  // Waits until the background thread has handled what was queued before the call, so that a
  // session's messages reach the service before its stop. Ordinary threads only.
  void Drain() {
    const uint64_t target = queued.load(std::memory_order_acquire);
    const auto deadline = std::chrono::steady_clock::now() + kControlTimeout;
    while (taken.load(std::memory_order_acquire) < target &&
           std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(kIdlePoll);
    }
  }

  void Run() {
    RtMessage message;
    auto nextReconnect = std::chrono::steady_clock::now();
    for (;;) {
      std::shared_ptr<Client> current = Current();
      if (!current || !current->connected()) {
        // Away: what waits is lost, counted, and the queue stays free for the audio thread.
        while (queue.try_dequeue(message)) {
          dropped.fetch_add(1, std::memory_order_relaxed);
          taken.fetch_add(1, std::memory_order_release);
        }
        if (!running.load()) return;
        if (std::chrono::steady_clock::now() >= nextReconnect) {
          if (!Reconnect()) nextReconnect = std::chrono::steady_clock::now() + kReconnectPause;
        }
        std::this_thread::sleep_for(kIdlePoll);
        continue;
      }
      bool any = false;
      while (queue.try_dequeue(message)) {
        any = true;
        std::optional<std::vector<int64_t>> reporters;
        if (message.reporterCount > 0) {
          reporters.emplace(message.reporters, message.reporters + message.reporterCount);
        }
        const auto written = current->sendMessage(ToDictionary(message), message.category,
                                                  message.type, std::move(reporters));
        (written.ok() ? sent : dropped).fetch_add(1, std::memory_order_relaxed);
        taken.fetch_add(1, std::memory_order_release);
      }
      if (!any) {
        if (!running.load()) return;
        std::this_thread::sleep_for(kIdlePoll);
      }
    }
  }
};

extern "C" {

tavrin_client* tavrin_open(const char* socket_path, size_t rt_capacity, tavrin_status* status) {
  auto fail = [&](tavrin_status why) -> tavrin_client* {
    if (status != nullptr) *status = why;
    return nullptr;
  };
  if (rt_capacity == 0) return fail(TAVRIN_ERR_INVALID);
  tavrin::client::ConnectOptions options;
  options.socketPath = tavrin::client::ResolveSocketPath(socket_path ? socket_path : "");
  options.timeout = kControlTimeout;
  auto connected = Client::Connect(options);
  if (!connected.ok()) return fail(StatusOf(connected.error().code));
  auto* client = new tavrin_client(options.socketPath, rt_capacity,
                                   std::shared_ptr<Client>(std::move(connected.value())));
  client->worker = std::thread([client] { client->Run(); });
  if (status != nullptr) *status = TAVRIN_OK;
  return client;
}

void tavrin_close(tavrin_client* client) {
  if (client == nullptr) return;
  client->running.store(false);
  client->worker.join();
  delete client;
}

tavrin_status tavrin_create_session(tavrin_client* client, int64_t reporter_id,
                                    uint16_t service_type, const char* configuration_json) {
  if (client == nullptr) return TAVRIN_ERR_INVALID;
  SessionState state;
  state.serviceType = service_type;
  if (configuration_json != nullptr) {
    state.configuration =
        Dictionary::parse(configuration_json, nullptr, /*allow_exceptions=*/false);
    if (!state.configuration.is_object()) return TAVRIN_ERR_INVALID;
  }
  auto current = client->Current();
  if (!current) return TAVRIN_ERR_CONNECTION_LOST;
  tavrin_status status = StatusOf(current->createReportingSession(reporter_id, kControlTimeout));
  if (status == TAVRIN_OK) {
    status = StatusOf(current->setServiceType(service_type, reporter_id, kControlTimeout));
  }
  if (status == TAVRIN_OK) {
    status = StatusOf(current->setConfiguration(state.configuration, reporter_id, kControlTimeout));
  }
  if (status == TAVRIN_OK) {
    std::lock_guard lock(client->mutex);
    client->sessions[reporter_id] = std::move(state);
  }
  return status;
}

tavrin_status tavrin_start_session(tavrin_client* client, int64_t reporter_id) {
  if (client == nullptr) return TAVRIN_ERR_INVALID;
  auto current = client->Current();
  if (!current) return TAVRIN_ERR_CONNECTION_LOST;
  // The service answers a start at the stop; a round trip after it shows it was taken.
  current->startReportingSessionForID(reporter_id, [](auto) {});
  const tavrin_status status = StatusOf(current->reporterID(reporter_id, kControlTimeout));
  if (status == TAVRIN_OK) {
    std::lock_guard lock(client->mutex);
    client->sessions[reporter_id].started = true;
  }
  return status;
}

tavrin_status tavrin_stop_session(tavrin_client* client, int64_t reporter_id) {
  if (client == nullptr) return TAVRIN_ERR_INVALID;
  auto current = client->Current();
  if (!current) return TAVRIN_ERR_CONNECTION_LOST;
  client->Drain();
  {
    std::lock_guard lock(client->mutex);
    if (auto found = client->sessions.find(reporter_id); found != client->sessions.end()) {
      found->second.started = false;
    }
  }
  return StatusOf(current->stopReportingSessionForID(reporter_id, kControlTimeout));
}

tavrin_status tavrin_destroy_session(tavrin_client* client, int64_t reporter_id) {
  if (client == nullptr) return TAVRIN_ERR_INVALID;
  auto current = client->Current();
  if (!current) return TAVRIN_ERR_CONNECTION_LOST;
  {
    std::lock_guard lock(client->mutex);
    client->sessions.erase(reporter_id);
  }
  return StatusOf(current->destroyReportingSession(reporter_id, kControlTimeout));
}

tavrin_status tavrin_send_rt(tavrin_client* client, const int64_t* reporter_ids,
                             size_t reporter_count, uint32_t category, uint16_t type,
                             const tavrin_field* fields, size_t field_count) {
  if (client == nullptr) return TAVRIN_ERR_INVALID;
  auto refuse = [client](tavrin_status why) {
    client->dropped.fetch_add(1, std::memory_order_relaxed);
    return why;
  };
  if ((fields == nullptr && field_count > 0) || (reporter_ids == nullptr && reporter_count > 0)) {
    return refuse(TAVRIN_ERR_INVALID);
  }
  if (field_count > TAVRIN_RT_MAX_FIELDS || reporter_count > TAVRIN_RT_MAX_REPORTERS) {
    return refuse(TAVRIN_ERR_TOO_LARGE);
  }
  RtMessage message;
  message.category = category;
  message.type = type;
  message.fieldCount = static_cast<uint8_t>(field_count);
  message.reporterCount = static_cast<uint8_t>(reporter_count);
  std::copy(reporter_ids, reporter_ids + reporter_count, message.reporters);
  for (size_t i = 0; i < field_count; ++i) {
    RtField& field = message.fields[i];
    CopyBounded(field.key, fields[i].key, TAVRIN_RT_MAX_KEY);
    field.kind = fields[i].kind;
    field.integer = fields[i].kind == TAVRIN_FIELD_BOOL  ? (fields[i].value.b != 0)
                    : fields[i].kind == TAVRIN_FIELD_INT ? fields[i].value.i
                                                         : 0;
    field.number = fields[i].kind == TAVRIN_FIELD_DOUBLE ? fields[i].value.d : 0.0;
    if (fields[i].kind == TAVRIN_FIELD_STRING) {
      CopyBounded(field.text, fields[i].value.s, TAVRIN_RT_MAX_STRING);
    } else {
      field.text[0] = '\0';
    }
  }
  if (!client->queue.try_enqueue(message)) return refuse(TAVRIN_ERR_QUEUE_FULL);
  client->queued.fetch_add(1, std::memory_order_release);
  return TAVRIN_OK;
}

uint64_t tavrin_rt_dropped(const tavrin_client* client) {
  return client ? client->dropped.load(std::memory_order_relaxed) : 0;
}

uint64_t tavrin_rt_sent(const tavrin_client* client) {
  return client ? client->sent.load(std::memory_order_relaxed) : 0;
}

}  // extern "C"
