#pragma once

// The measurements of the built tavrind over its socket that the harnesses in bench/ share: each
// starts a fresh service in a temporary --root, talks to it with the wire codec and reads its
// store file on a read-only connection of its own. Included by one source file per harness.

#include <sqlite3.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <sstream>
#include <string>
#include <thread>
#include <variant>
#include <vector>

#include "base/Dictionary.h"
#include "protocol/Codec.h"
#include "protocol/Frame.h"

namespace tavrin::bench {
// The binary the e2e support starts: the build's own tavrind unless --tavrind names another.
inline std::string gTavrindPath = TAVRIN_BUILT_TAVRIND;
}  // namespace tavrin::bench
#define TAVRIND_PATH ::tavrin::bench::gTavrindPath
#include "tests/support/TavrindProcess.h"

namespace tavrin::bench {

using testing::TavrindProcess;
using testing::TestClient;
using SteadyClock = std::chrono::steady_clock;

// What a run sends: every op 6 of a run carries this payload, category and type.
struct BenchMessage {
  Dictionary payload;
  uint32_t category = 0;
  uint16_t type = 0;
  // The store keeps category & 0xFFFF. The stop's summary (0xFFFF) and driver statistics (9) land
  // under other categories, so counting this one counts exactly the messages a run sent.
  int64_t StoredCategory() const { return category & 0xFFFF; }
};
// Frames per write in the bulk senders (about 80 KB), as a client library that batches would.
constexpr int kFramesPerWrite = 512;
// Reporter IDs of the harness's sessions start here (clear of 0, which means "none").
constexpr int64_t kFirstReporter = 1000;
// Messages a paced run lets be sent and not yet committed. Each message makes two store records
// (its row and the analytics event derived from it), so this keeps the store's queue (65,536
// records) at most half full.
constexpr int64_t kDefaultWindow = 16384;
// An unpaced run's count is final once it has not moved for this long after the work queue has
// run every message.
constexpr auto kUnpacedSettle = std::chrono::seconds(2);
// How often the store file is polled while waiting for rows.
constexpr auto kStorePollInterval = std::chrono::milliseconds(5);
// A wait for rows or replies gives up when nothing has moved for this long: a stalled service,
// not a slow one.
constexpr auto kStallLimit = std::chrono::seconds(20);
// Time the service gets to settle before its memory is read.
constexpr auto kSettle = std::chrono::seconds(1);
// The reader's chunk in (d), as the service reads its sockets.
constexpr size_t kReadChunk = 64 * 1024;

inline double SecondsBetween(SteadyClock::time_point from, SteadyClock::time_point to) {
  return std::chrono::duration<double>(to - from).count();
}

inline std::string LoadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string one, five, fifteen;
  in >> one >> five >> fifteen;
  return one + " " + five + " " + fifteen;
}

inline std::vector<uint8_t> RequestFrame(std::optional<uint64_t> call,
                                         protocol::Arguments arguments) {
  return protocol::EncodeFrame(
      protocol::EncodeRequest(protocol::Request{call, std::move(arguments)}));
}

inline protocol::SendMessage MessageFor(const BenchMessage& message, int64_t reporterID) {
  return protocol::SendMessage{message.payload, message.category, message.type,
                               std::vector<int64_t>{reporterID}};
}

// `count` copies of the nil-call sendMessage frame for `reporterID`, back to back.
inline std::vector<uint8_t> MessageFrames(const BenchMessage& message, int64_t reporterID,
                                          int count) {
  const std::vector<uint8_t> frame = RequestFrame(std::nullopt, MessageFor(message, reporterID));
  std::vector<uint8_t> frames;
  frames.reserve(frame.size() * static_cast<size_t>(count));
  for (int i = 0; i < count; ++i) frames.insert(frames.end(), frame.begin(), frame.end());
  return frames;
}

inline bool SendAll(int fd, const uint8_t* data, size_t size) {
  while (size > 0) {
    const ssize_t n = ::send(fd, data, size, MSG_NOSIGNAL);
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// Sends `messages` frames of `chunk` (kFramesPerWrite frames of `frameSize` bytes) over `send`.
template <typename SendBytes>
inline bool SendMessages(SendBytes send, const std::vector<uint8_t>& chunk, size_t frameSize,
                         int64_t messages) {
  while (messages > 0) {
    const int64_t now = std::min<int64_t>(messages, kFramesPerWrite);
    if (!send(chunk.data(), frameSize * static_cast<size_t>(now))) return false;
    messages -= now;
  }
  return true;
}

// A status 0 reply to `call`, or a line on stderr.
inline bool ExpectReply(TestClient& client, uint64_t call, const char* what) {
  std::optional<protocol::Reply> reply = client.Read();
  if (!reply || reply->call != call || reply->status != protocol::Status::kOk) {
    std::fprintf(stderr, "%s: no good reply to call %" PRIu64 "\n", what, call);
    return false;
  }
  return true;
}

// VmRSS or VmHWM of `pid` in KiB; -1 when it cannot be read.
inline int64_t StatusKiB(pid_t pid, const std::string& field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(field + ":", 0) == 0) {
      std::istringstream values(line.substr(field.size() + 1));
      int64_t kib = -1;
      values >> kib;
      return kib;
    }
  }
  return -1;
}

// Reads the service's store file on a read-only connection of its own while the service writes.
class StoreReader {
 public:
  // Counts messages of `storedCategory` (BenchMessage::StoredCategory()).
  StoreReader(std::string path, int64_t firstReporter, int64_t lastReporter, int64_t storedCategory)
      : path_(std::move(path)),
        firstReporter_(firstReporter),
        lastReporter_(lastReporter),
        storedCategory_(storedCategory) {}
  ~StoreReader() {
    if (count_ != nullptr) sqlite3_finalize(count_);
    if (db_ != nullptr) sqlite3_close(db_);
  }
  StoreReader(const StoreReader&) = delete;
  StoreReader& operator=(const StoreReader&) = delete;

  // Rows of our reporters and category in session_messages committed so far. Each call reads
  // only the rows added since the last one: there is one writer, so a row committed later always
  // has a higher row number than every row already visible.
  int64_t Messages() {
    if (!Open()) return 0;
    sqlite3_bind_int64(count_, 1, lastRow_);
    if (sqlite3_step(count_) == SQLITE_ROW) {
      messages_ += sqlite3_column_int64(count_, 0);
      if (sqlite3_column_type(count_, 1) != SQLITE_NULL) {
        lastRow_ = sqlite3_column_int64(count_, 1);
      }
    }
    sqlite3_reset(count_);
    return messages_;
  }

  // A count over our reporters (reporter column `column`) or over a whole table (empty column).
  int64_t Count(const std::string& table, const std::string& column = "") {
    if (!Open()) return 0;
    std::string sql = "SELECT count(*) FROM " + table;
    if (!column.empty()) sql += " WHERE " + column + " BETWEEN ?1 AND ?2";
    sqlite3_stmt* statement = nullptr;
    int64_t count = 0;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK) {
      if (!column.empty()) {
        sqlite3_bind_int64(statement, 1, firstReporter_);
        sqlite3_bind_int64(statement, 2, lastReporter_);
      }
      if (sqlite3_step(statement) == SQLITE_ROW) count = sqlite3_column_int64(statement, 0);
    }
    sqlite3_finalize(statement);
    return count;
  }

 private:
  bool Open() {
    if (count_ != nullptr) return true;
    if (db_ == nullptr &&
        sqlite3_open_v2(path_.c_str(), &db_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      sqlite3_close(db_);
      db_ = nullptr;
      return false;
    }
    sqlite3_busy_timeout(db_, 1000);
    const char* sql =
        "SELECT count(*) FILTER (WHERE reporter_id BETWEEN ?2 AND ?3 AND category = ?4), max(row) "
        "FROM session_messages WHERE row > ?1";
    if (sqlite3_prepare_v2(db_, sql, -1, &count_, nullptr) != SQLITE_OK) {
      // The service has not made its tables yet.
      count_ = nullptr;
      return false;
    }
    sqlite3_bind_int64(count_, 2, firstReporter_);
    sqlite3_bind_int64(count_, 3, lastReporter_);
    sqlite3_bind_int64(count_, 4, storedCategory_);
    return true;
  }

  std::string path_;
  int64_t firstReporter_;
  int64_t lastReporter_;
  int64_t storedCategory_;
  sqlite3* db_ = nullptr;
  sqlite3_stmt* count_ = nullptr;
  int64_t lastRow_ = 0;
  int64_t messages_ = 0;
};

// Polls `value` until it reaches `target`; the time it was first seen there, or nothing when it
// stopped moving for kStallLimit.
template <typename Value>
inline std::optional<SteadyClock::time_point> WaitForCount(Value value, int64_t target) {
  int64_t last = -1;
  auto lastMove = SteadyClock::now();
  for (;;) {
    const int64_t now = value();
    const auto at = SteadyClock::now();
    if (now >= target) return at;
    if (now != last) {
      last = now;
      lastMove = at;
    } else if (at - lastMove > kStallLimit) {
      std::fprintf(stderr, "stalled at %" PRId64 " of %" PRId64 "\n", now, target);
      return std::nullopt;
    }
    std::this_thread::sleep_for(kStorePollInterval);
  }
}

// Creates and starts session `reporterID` on `client` and waits until the service has run both.
// The start goes with a nil call: its reply is held until the session stops.
// Starts a fresh service; says why on stderr when it does not come up.
inline bool StartService(TavrindProcess& service) {
  if (service.Start()) return true;
  std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
  return false;
}

inline bool OpenSession(TestClient& client, int64_t reporterID) {
  if (!client.Send(1, protocol::CreateReportingSession{reporterID}) ||
      !ExpectReply(client, 1, "create")) {
    return false;
  }
  if (!client.SendNoReply(protocol::StartReportingSessionForID{reporterID})) return false;
  // Requests of one connection run in order: this answer comes after the start has run.
  return client.Send(2, protocol::ReporterIDValid{reporterID}) && ExpectReply(client, 2, "valid");
}

// Stops the service with SIGTERM; false (with its log) when it did not exit cleanly.
inline bool StopService(TavrindProcess& service) {
  const std::optional<int> status = service.Stop(SIGTERM);
  if (status == 0) return true;
  std::fprintf(stderr, "tavrind did not stop cleanly (status %d); its log:\n%s\n",
               status ? *status : -1, service.Log().c_str());
  return false;
}

// Lines of the service's log that report lost work.
inline size_t LossLines(const TavrindProcess& service) {
  return service.LogCount(": dropped ") + service.LogCount("failed to find backend");
}

// CPU seconds of the threads of `pid` by thread name (the pool's threads together), from /proc.
// Clock ticks of 10 ms: fine over runs of seconds.
inline std::map<std::string, double> ThreadCpuSeconds(pid_t pid) {
  std::map<std::string, double> seconds;
  const double ticksPerSecond = static_cast<double>(::sysconf(_SC_CLK_TCK));
  std::error_code error;
  for (const auto& task :
       std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", error)) {
    std::ifstream in(task.path() / "stat");
    std::string text;
    std::getline(in, text);
    const size_t open = text.find('(');
    const size_t close = text.rfind(')');
    if (open == std::string::npos || close == std::string::npos || close + 2 > text.size())
      continue;
    std::string name = text.substr(open + 1, close - open - 1);
    if (name.rfind("tavrin-pool", 0) == 0) name = "tavrin-pool";
    // After the name: state and ten more fields, then utime and stime.
    std::istringstream fields(text.substr(close + 2));
    std::string skipped;
    for (int i = 0; i < 11; ++i) fields >> skipped;
    uint64_t user = 0, system = 0;
    fields >> user >> system;
    seconds[name] += static_cast<double>(user + system) / ticksPerSecond;
  }
  return seconds;
}

inline std::map<std::string, double> Difference(const std::map<std::string, double>& after,
                                                const std::map<std::string, double>& before) {
  std::map<std::string, double> difference;
  for (const auto& [name, value] : after) {
    const auto found = before.find(name);
    difference[name] = value - (found == before.end() ? 0.0 : found->second);
  }
  return difference;
}

// CPU seconds (user and system) of the whole process `pid`, from /proc/<pid>/stat: its threads
// that ended count too. -1 when it cannot be read.
inline double ProcessCpuSeconds(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text;
  std::getline(in, text);
  const size_t close = text.rfind(')');
  if (close == std::string::npos || close + 2 > text.size()) return -1;
  // After the name: state and ten more fields, then utime and stime.
  std::istringstream fields(text.substr(close + 2));
  std::string skipped;
  for (int i = 0; i < 11; ++i) fields >> skipped;
  uint64_t user = 0, system = 0;
  if (!(fields >> user >> system)) return -1;
  return static_cast<double>(user + system) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

// CPU seconds of the calling thread.
inline double CallingThreadCpuSeconds() {
  timespec now{};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

struct ThroughputResult {
  int clients = 0;
  int64_t window = 0;                        // 0: unpaced
  int64_t messages = 0;                      // sent
  int64_t committed = 0;                     // their rows in the store at the end
  double sentSeconds = 0;                    // the last byte was taken by the kernel
  double acceptedSeconds = 0;                // the work queue had run every message
  double committedSeconds = 0;               // the last of the rows was seen committed
  double rate = 0;                           // committed / committedSeconds
  double acceptedRate = 0;                   // messages / acceptedSeconds
  double stopSeconds = 0;                    // the longest stop, from request to answer
  std::map<std::string, double> cpuSeconds;  // the service's threads, while the messages ran
  double cpuMicrosPerMessage = 0;
  // The whole process's CPU (/proc/<pid>/stat) over the same span, per committed message.
  double processCpuMicrosPerCommitted = 0;
  int64_t rssBeforeKiB = 0;   // the service's resident memory before the first message
  int64_t rssCountedKiB = 0;  // and when the count was final, the sessions still running
  int64_t rssStoppedKiB = 0;  // and once every session was stopped
  int64_t analyticsRows = 0;  // analytics_events rows the run added
  size_t lossLines = 0;
};

// The run as one JSON object, as both harnesses print it.
inline Value ToJson(const ThroughputResult& r) {
  Value cpu = MakeDictionary();
  for (const auto& [name, seconds] : r.cpuSeconds) cpu[name] = seconds;
  return {{"clients", r.clients},
          {"window", r.window},
          {"messages", r.messages},
          {"committed", r.committed},
          {"sent_s", r.sentSeconds},
          {"accepted_s", r.acceptedSeconds},
          {"committed_s", r.committedSeconds},
          {"committed_per_s", r.rate},
          {"accepted_per_s", r.acceptedRate},
          {"stop_s", r.stopSeconds},
          {"service_cpu_s", cpu},
          {"service_cpu_us_per_message", r.cpuMicrosPerMessage},
          {"process_cpu_us_per_committed", r.processCpuMicrosPerCommitted},
          {"rss_before_kib", r.rssBeforeKiB},
          {"rss_counted_kib", r.rssCountedKiB},
          {"rss_stopped_kib", r.rssStoppedKiB},
          {"analytics_rows", r.analyticsRows},
          {"loss_lines", r.lossLines}};
}

// Sends `messages` fire-and-forget messages from `clients` connections, each to its own running
// session, and counts their rows in the store. With a window, the senders keep at most `window`
// messages sent and not yet committed (they watch the store, as no real client can): the rate the
// whole path sustains without loss. Without one (0) they send as fast as the socket takes them,
// and the run shows how much of a burst that outruns the store arrives.
//
// Each client then asks for its session's validity (the answer comes once the work queue has run
// every message before it) and, once the count is final, stops its session: the stop is timed on
// its own, because it summarises everything the session aggregated.
//
// `stopped`, when given, is called once the service has stopped and before its root is removed,
// with the store file's path and the number of analytics_events rows before the first message.
inline std::optional<ThroughputResult> RunThroughput(
    const BenchMessage& message, int clients, int64_t messages, int64_t window,
    const std::function<void(const std::string& databasePath, int64_t analyticsBefore)>& stopped =
        {}) {
  TavrindProcess service;
  if (!StartService(service)) return std::nullopt;
  const int64_t lastReporter = kFirstReporter + clients - 1;
  std::vector<std::unique_ptr<TestClient>> connections;
  for (int c = 0; c < clients; ++c) {
    connections.push_back(std::make_unique<TestClient>(service.SocketPath()));
    if (!connections.back()->connected() || !OpenSession(*connections.back(), kFirstReporter + c)) {
      return std::nullopt;
    }
  }
  StoreReader store(service.DatabasePath(), kFirstReporter, lastReporter, message.StoredCategory());
  // Each started session writes its sessions row once it has its TelvoroSession.
  if (!WaitForCount([&] { return store.Count("sessions", "reporter_id"); }, clients)) {
    return std::nullopt;
  }
  const int64_t analyticsBefore = store.Count("analytics_events");

  const size_t frameSize = RequestFrame(std::nullopt, MessageFor(message, kFirstReporter)).size();
  std::vector<std::vector<uint8_t>> chunks;
  for (int c = 0; c < clients; ++c) {
    chunks.push_back(MessageFrames(message, kFirstReporter + c, kFramesPerWrite));
  }

  std::atomic<bool> go{false};
  std::atomic<bool> stopNow{false};
  std::atomic<bool> abandon{false};
  std::atomic<int64_t> sent{0};
  std::atomic<int64_t> committed{0};
  std::atomic<int> accepted{0};
  std::atomic<int> failures{0};
  std::vector<SteadyClock::time_point> sentAt(static_cast<size_t>(clients));
  std::vector<SteadyClock::time_point> acceptedAt(static_cast<size_t>(clients));
  std::vector<double> stopSeconds(static_cast<size_t>(clients));
  std::vector<std::thread> senders;
  for (int c = 0; c < clients; ++c) {
    const int64_t share = messages / clients + (c < messages % clients ? 1 : 0);
    senders.emplace_back([&, c, share] {
      const auto index = static_cast<size_t>(c);
      TestClient& client = *connections[index];
      const std::vector<uint8_t>& chunk = chunks[index];
      const int64_t reporterID = kFirstReporter + c;
      while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
      const bool delivered = SendMessages(
          [&](const uint8_t* data, size_t size) {
            const auto frames = static_cast<int64_t>(size / frameSize);
            while (window > 0 && sent.load() + frames - committed.load() > window) {
              if (abandon.load()) return false;
              std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
            // Whole chunks go as they are; only the last, shorter write is copied.
            const bool ok = size == chunk.size()
                                ? client.SendBytes(chunk)
                                : client.SendBytes(std::vector<uint8_t>(data, data + size));
            sent.fetch_add(frames);
            return ok;
          },
          chunk, frameSize, share);
      sentAt[index] = SteadyClock::now();
      if (!delivered || !client.Send(3, protocol::ReporterIDValid{reporterID}) ||
          !ExpectReply(client, 3, "valid")) {
        failures.fetch_add(1);
        abandon.store(true);
        return;
      }
      acceptedAt[index] = SteadyClock::now();
      accepted.fetch_add(1);
      while (!stopNow.load() && !abandon.load()) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
      }
      const auto stopAsked = SteadyClock::now();
      if (!client.Send(4, protocol::StopReportingSessionForID{reporterID}) ||
          !ExpectReply(client, 4, "stop")) {
        failures.fetch_add(1);
      }
      stopSeconds[index] = SecondsBetween(stopAsked, SteadyClock::now());
    });
  }
  const std::map<std::string, double> cpuBefore = ThreadCpuSeconds(service.pid());
  const double processCpuBefore = ProcessCpuSeconds(service.pid());
  const int64_t rssBefore = StatusKiB(service.pid(), "VmRSS");
  const auto start = SteadyClock::now();
  go.store(true, std::memory_order_release);

  int64_t count = 0;
  auto lastMove = start;
  for (;;) {
    const int64_t now = store.Messages();
    const auto at = SteadyClock::now();
    if (now != count) lastMove = at;
    count = now;
    committed.store(count);
    if (count >= messages) break;
    if (window == 0 && accepted.load() == clients && at - lastMove > kUnpacedSettle) break;
    if (at - lastMove > kStallLimit || abandon.load()) {
      abandon.store(true);
      break;
    }
    std::this_thread::sleep_for(kStorePollInterval);
  }
  const std::map<std::string, double> cpu = Difference(ThreadCpuSeconds(service.pid()), cpuBefore);
  const double processCpu = ProcessCpuSeconds(service.pid()) - processCpuBefore;
  const int64_t rssCounted = StatusKiB(service.pid(), "VmRSS");
  stopNow.store(true);
  for (auto& sender : senders) sender.join();
  const int64_t rssStopped = StatusKiB(service.pid(), "VmRSS");
  if (abandon.load() || failures.load() != 0 || count > messages ||
      (window > 0 && count != messages)) {
    std::fprintf(stderr, "%d client(s): %" PRId64 " of %" PRId64 " rows; the service's log:\n%s\n",
                 clients, count, messages, service.Log().c_str());
    return std::nullopt;
  }

  ThroughputResult result;
  result.clients = clients;
  result.window = window;
  result.messages = messages;
  result.committed = count;
  result.sentSeconds = SecondsBetween(start, *std::max_element(sentAt.begin(), sentAt.end()));
  result.acceptedSeconds =
      SecondsBetween(start, *std::max_element(acceptedAt.begin(), acceptedAt.end()));
  result.committedSeconds = SecondsBetween(start, lastMove);
  result.rate = static_cast<double>(count) / result.committedSeconds;
  result.acceptedRate = static_cast<double>(messages) / result.acceptedSeconds;
  result.stopSeconds = *std::max_element(stopSeconds.begin(), stopSeconds.end());
  result.cpuSeconds = cpu;
  result.rssBeforeKiB = rssBefore;
  result.rssCountedKiB = rssCounted;
  result.rssStoppedKiB = rssStopped;
  double total = 0;
  for (const auto& [name, seconds] : cpu) total += seconds;
  result.cpuMicrosPerMessage = 1e6 * total / static_cast<double>(messages);
  result.processCpuMicrosPerCommitted =
      count > 0 ? 1e6 * processCpu / static_cast<double>(count) : 0;
  connections.clear();
  if (!StopService(service)) return std::nullopt;
  result.analyticsRows = store.Count("analytics_events") - analyticsBefore;
  if (stopped) stopped(service.DatabasePath(), analyticsBefore);
  result.lossLines = LossLines(service);
  return result;
}

struct LatencyResult {
  double offeredRate = 0;
  double seconds = 0;
  int64_t sent = 0;
  int64_t answered = 0;
  double p50 = 0, p90 = 0, p99 = 0, p999 = 0, max = 0;  // milliseconds
  double lagP50 = 0, lagP99 = 0;                        // the harness's own send lag, ms
  // With a burst: the requests due in the window that opens as the burst starts.
  int64_t burstMessages = 0;
  double burstSendSeconds = 0;  // until the socket had taken the whole burst
  double afterSeconds = 0;
  int64_t afterCount = 0;
  double afterP50 = 0, afterP99 = 0, afterP999 = 0, afterMax = 0;  // milliseconds
  size_t lossLines = 0;
};

// The steady figures, and those after the burst when there was one.
inline Value ToJson(const LatencyResult& r) {
  Value out = {{"offered_per_s", r.offeredRate},
               {"seconds", r.seconds},
               {"sent", r.sent},
               {"answered", r.answered},
               {"p50_ms", r.p50},
               {"p90_ms", r.p90},
               {"p99_ms", r.p99},
               {"p999_ms", r.p999},
               {"max_ms", r.max},
               {"send_lag_p50_ms", r.lagP50},
               {"send_lag_p99_ms", r.lagP99},
               {"loss_lines", r.lossLines}};
  if (r.burstMessages > 0) {
    out["burst"] = {{"messages", r.burstMessages}, {"send_s", r.burstSendSeconds},
                    {"after_s", r.afterSeconds},   {"requests", r.afterCount},
                    {"p50_ms", r.afterP50},        {"p99_ms", r.afterP99},
                    {"p999_ms", r.afterP999},      {"max_ms", r.afterMax}};
  }
  return out;
}

inline double Percentile(std::vector<double> values, double fraction) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const size_t index = std::min(values.size() - 1,
                                static_cast<size_t>(fraction * static_cast<double>(values.size())));
  return values[index];
}

// Per request of an open-loop run, by index: latency from its due time to its reply, and how
// late the harness sent it. Milliseconds.
struct OpenLoopTimes {
  std::vector<double> latencyMs;
  std::vector<double> lagMs;
};

// Sends `total` sendMessage requests with calls kFirstOpenLoopCall.. over `client`, open loop at
// `rate`: request i is due at start + i / rate and its latency runs from that due time to its
// reply, so time spent queued anywhere (the harness included) counts. Every frame is encoded
// before the clock starts. `event`, when given, runs on a thread of its own from `eventAt`
// seconds after the start; the run ends once every request is answered and `event` returned.
// Nothing unless every request got exactly one good nil reply.
inline constexpr uint64_t kFirstOpenLoopCall = 100;
inline std::optional<OpenLoopTimes> RunOpenLoop(TestClient& client, const BenchMessage& message,
                                                int64_t reporterID, double rate, int64_t total,
                                                double eventAt = 0,
                                                const std::function<void()>& event = {}) {
  std::vector<uint8_t> frames;
  std::vector<size_t> offsets{0};
  for (int64_t i = 0; i < total; ++i) {
    const std::vector<uint8_t> frame = RequestFrame(kFirstOpenLoopCall + static_cast<uint64_t>(i),
                                                    MessageFor(message, reporterID));
    frames.insert(frames.end(), frame.begin(), frame.end());
    offsets.push_back(frames.size());
  }
  const auto period = std::chrono::duration<double>(1.0 / rate);
  const auto start = SteadyClock::now() + std::chrono::milliseconds(20);
  const auto dueAt = [&](int64_t i) {
    return start +
           std::chrono::duration_cast<SteadyClock::duration>(period * static_cast<double>(i));
  };

  OpenLoopTimes times;
  times.lagMs.assign(static_cast<size_t>(total), 0);
  times.latencyMs.assign(static_cast<size_t>(total), 0);
  std::thread sender([&] {
    for (int64_t i = 0; i < total;) {
      std::this_thread::sleep_until(dueAt(i));
      const auto now = SteadyClock::now();
      int64_t end = i;
      while (end < total && dueAt(end) <= now) ++end;
      if (end == i) continue;
      if (!client.SendBytes(
              std::vector<uint8_t>(frames.begin() + static_cast<ptrdiff_t>(offsets[i]),
                                   frames.begin() + static_cast<ptrdiff_t>(offsets[end])))) {
        return;
      }
      for (int64_t j = i; j < end; ++j) {
        times.lagMs[static_cast<size_t>(j)] =
            std::chrono::duration<double, std::milli>(now - dueAt(j)).count();
      }
      i = end;
    }
  });
  std::thread eventThread;
  if (event) {
    eventThread = std::thread([&] {
      std::this_thread::sleep_until(start + std::chrono::duration_cast<SteadyClock::duration>(
                                                std::chrono::duration<double>(eventAt)));
      event();
    });
  }

  int64_t good = 0;
  int64_t bad = 0;
  std::vector<bool> answered(static_cast<size_t>(total), false);
  while (good + bad < total) {
    std::optional<protocol::Reply> reply =
        client.Read(std::chrono::duration_cast<std::chrono::milliseconds>(kStallLimit));
    const auto now = SteadyClock::now();
    if (!reply) break;
    const int64_t i = static_cast<int64_t>(reply->call - kFirstOpenLoopCall);
    // A second answer to one call is as wrong as none.
    if (reply->call < kFirstOpenLoopCall || i >= total || answered[static_cast<size_t>(i)] ||
        reply->status != protocol::Status::kOk || !protocol::IsNilReplyValue(reply->value)) {
      ++bad;
      continue;
    }
    answered[static_cast<size_t>(i)] = true;
    times.latencyMs[static_cast<size_t>(i)] =
        std::chrono::duration<double, std::milli>(now - dueAt(i)).count();
    ++good;
  }
  sender.join();
  if (eventThread.joinable()) eventThread.join();
  if (bad != 0 || good != total) {
    std::fprintf(stderr, "open loop: %" PRId64 " good replies and %" PRId64 " bad of %" PRId64 "\n",
                 good, bad, total);
    return std::nullopt;
  }
  return times;
}

// One client sends sendMessage with a call, open loop at `rate` for `seconds`. With a burst, a
// second connection then writes `burstMessages` nil-call messages to a session of its own as fast
// as the socket takes them, while the first goes on for `afterSeconds` more; the requests due in
// those seconds are summarised apart.
inline std::optional<LatencyResult> RunLatency(const BenchMessage& message, double rate,
                                               double seconds, int64_t burstMessages = 0,
                                               double afterSeconds = 0) {
  TavrindProcess service;
  if (!StartService(service)) return std::nullopt;
  TestClient client(service.SocketPath());
  if (!client.connected() || !OpenSession(client, kFirstReporter)) return std::nullopt;
  const bool burst = burstMessages > 0;
  TestClient burster(service.SocketPath());
  if (burst && (!burster.connected() || !OpenSession(burster, kFirstReporter + 1))) {
    return std::nullopt;
  }

  const auto steady = static_cast<int64_t>(rate * seconds);
  const auto total = steady + (burst ? static_cast<int64_t>(rate * afterSeconds) : 0);
  const std::vector<uint8_t> chunk = MessageFrames(message, kFirstReporter + 1, kFramesPerWrite);
  const size_t frameSize = chunk.size() / kFramesPerWrite;
  bool burstSent = false;
  double burstSendSeconds = 0;
  const auto sendBurst = [&] {
    const auto at = SteadyClock::now();
    burstSent = SendMessages(
        [&](const uint8_t* data, size_t size) {
          return size == chunk.size() ? burster.SendBytes(chunk)
                                      : burster.SendBytes(std::vector<uint8_t>(data, data + size));
        },
        chunk, frameSize, burstMessages);
    burstSendSeconds = SecondsBetween(at, SteadyClock::now());
  };
  const std::optional<OpenLoopTimes> times =
      burst ? RunOpenLoop(client, message, kFirstReporter, rate, total, seconds, sendBurst)
            : RunOpenLoop(client, message, kFirstReporter, rate, total);
  if (!times || (burst && !burstSent)) return std::nullopt;
  if (!client.Send(3, protocol::StopReportingSessionForID{kFirstReporter}) ||
      !ExpectReply(client, 3, "stop")) {
    return std::nullopt;
  }
  if (burst && (!burster.Send(3, protocol::StopReportingSessionForID{kFirstReporter + 1}) ||
                !ExpectReply(burster, 3, "burst stop"))) {
    return std::nullopt;
  }
  client.Close();
  burster.Close();
  if (!StopService(service)) return std::nullopt;

  const std::vector<double> before(times->latencyMs.begin(),
                                   times->latencyMs.begin() + static_cast<ptrdiff_t>(steady));
  const std::vector<double> after(times->latencyMs.begin() + static_cast<ptrdiff_t>(steady),
                                  times->latencyMs.end());
  LatencyResult result;
  result.offeredRate = rate;
  result.seconds = seconds;
  result.sent = total;
  result.answered = total;
  result.p50 = Percentile(before, 0.50);
  result.p90 = Percentile(before, 0.90);
  result.p99 = Percentile(before, 0.99);
  result.p999 = Percentile(before, 0.999);
  result.max = before.empty() ? 0 : *std::max_element(before.begin(), before.end());
  result.lagP50 = Percentile(times->lagMs, 0.50);
  result.lagP99 = Percentile(times->lagMs, 0.99);
  if (burst) {
    result.burstMessages = burstMessages;
    result.burstSendSeconds = burstSendSeconds;
    result.afterSeconds = afterSeconds;
    result.afterCount = static_cast<int64_t>(after.size());
    result.afterP50 = Percentile(after, 0.50);
    result.afterP99 = Percentile(after, 0.99);
    result.afterP999 = Percentile(after, 0.999);
    result.afterMax = after.empty() ? 0 : *std::max_element(after.begin(), after.end());
  }
  result.lossLines = LossLines(service);
  return result;
}

struct MemoryResult {
  int connections = 0;
  int64_t sessions = 0;
  int64_t idleKiB = 0;
  int64_t connectedKiB = 0;
  int64_t sessionsKiB = 0;
  int64_t peakKiB = 0;
  double bytesPerSession = 0;
  double bytesPerConnection = 0;
  size_t lossLines = 0;
};

inline Value ToJson(const MemoryResult& r) {
  return {{"connections", r.connections},
          {"sessions", r.sessions},
          {"idle_kib", r.idleKiB},
          {"connected_kib", r.connectedKiB},
          {"sessions_kib", r.sessionsKiB},
          {"peak_kib", r.peakKiB},
          {"bytes_per_connection", r.bytesPerConnection},
          {"bytes_per_session", r.bytesPerSession},
          {"loss_lines", r.lossLines}};
}

inline std::optional<MemoryResult> RunMemory(int connectionCount, int sessionsPerConnection) {
  TavrindProcess service;
  if (!StartService(service)) return std::nullopt;
  MemoryResult result;
  result.connections = connectionCount;
  result.sessions = int64_t{connectionCount} * sessionsPerConnection;
  std::this_thread::sleep_for(kSettle);
  result.idleKiB = StatusKiB(service.pid(), "VmRSS");

  std::vector<std::unique_ptr<TestClient>> connections;
  for (int c = 0; c < connectionCount; ++c) {
    connections.push_back(std::make_unique<TestClient>(service.SocketPath()));
    TestClient& client = *connections.back();
    if (!client.connected() || !client.Send(1, protocol::GetAllReporters{}) ||
        !ExpectReply(client, 1, "reporters")) {
      return std::nullopt;
    }
  }
  std::this_thread::sleep_for(kSettle);
  result.connectedKiB = StatusKiB(service.pid(), "VmRSS");

  // Every connection's creates and starts go in one write, then a call that answers after them.
  for (int c = 0; c < connectionCount; ++c) {
    std::vector<uint8_t> requests;
    for (int s = 0; s < sessionsPerConnection; ++s) {
      const int64_t id = kFirstReporter + int64_t{c} * sessionsPerConnection + s;
      for (const auto& frame :
           {RequestFrame(std::nullopt, protocol::CreateReportingSession{id}),
            RequestFrame(std::nullopt, protocol::StartReportingSessionForID{id})}) {
        requests.insert(requests.end(), frame.begin(), frame.end());
      }
    }
    if (!connections[static_cast<size_t>(c)]->SendBytes(requests)) return std::nullopt;
    if (!connections[static_cast<size_t>(c)]->Send(2, protocol::GetAllReporters{})) {
      return std::nullopt;
    }
  }
  for (auto& connection : connections) {
    if (!ExpectReply(*connection, 2, "reporters")) return std::nullopt;
  }
  StoreReader store(service.DatabasePath(), kFirstReporter, kFirstReporter + result.sessions - 1,
                    0);
  if (!WaitForCount([&] { return store.Count("sessions", "reporter_id"); }, result.sessions)) {
    return std::nullopt;
  }
  std::this_thread::sleep_for(kSettle);
  result.sessionsKiB = StatusKiB(service.pid(), "VmRSS");
  result.peakKiB = StatusKiB(service.pid(), "VmHWM");
  result.bytesPerConnection = 1024.0 * static_cast<double>(result.connectedKiB - result.idleKiB) /
                              static_cast<double>(connectionCount);
  result.bytesPerSession = 1024.0 * static_cast<double>(result.sessionsKiB - result.connectedKiB) /
                           static_cast<double>(result.sessions);
  connections.clear();
  if (!StopService(service)) return std::nullopt;
  result.lossLines = LossLines(service);
  return result;
}

struct LongSessionResult {
  int64_t messages = 0;
  int64_t rssAtTenThousandKiB = 0;
  int64_t rssAtEndKiB = 0;
  double cpuMicrosPerMessage = 0;
  double stopSeconds = 0;
  double worstOtherRoundTripMs = 0;
  int64_t otherRoundTrips = 0;
  // The same probe for kSettle before the stop, every message committed and nothing else to do.
  double worstIdleRoundTripMs = 0;
  int64_t idleRoundTrips = 0;
};

// (e) One session that is never stopped until the end: `messages` of `message`. The RSS growth
// from the 10,000th stored message to the last shows what the session keeps per message; a second
// connection's round trips while the session stops show whether the stop blocks others.
inline std::optional<LongSessionResult> RunLongSession(const BenchMessage& message,
                                                       int64_t messages) {
  constexpr int64_t kEarlyMark = 10000;
  constexpr int kChunk = 500;
  TavrindProcess service;
  if (!StartService(service)) return std::nullopt;
  TestClient client(service.SocketPath());
  TestClient other(service.SocketPath());
  if (!client.connected() || !other.connected() || !OpenSession(client, kFirstReporter)) {
    return std::nullopt;
  }
  const std::vector<uint8_t> chunk = MessageFrames(message, kFirstReporter, kChunk);
  StoreReader store(service.DatabasePath(), kFirstReporter, kFirstReporter,
                    message.StoredCategory());
  LongSessionResult result;
  result.messages = messages;
  double cpuBefore = 0;
  for (const auto& [name, seconds] : ThreadCpuSeconds(service.pid())) cpuBefore += seconds;
  for (int64_t sent = 0; sent < messages; sent += kChunk) {
    if (!client.SendBytes(chunk)) return std::nullopt;
    // At most a few chunks ahead of the store, like a paced client.
    if (!WaitForCount([&] { return store.Messages(); }, sent + kChunk - 4 * kChunk)) {
      return std::nullopt;
    }
    if (result.rssAtTenThousandKiB == 0 && sent + kChunk >= kEarlyMark) {
      if (!WaitForCount([&] { return store.Messages(); }, sent + kChunk)) return std::nullopt;
      result.rssAtTenThousandKiB = StatusKiB(service.pid(), "VmRSS");
    }
  }
  const int64_t total = (messages + kChunk - 1) / kChunk * kChunk;
  if (!WaitForCount([&] { return store.Messages(); }, total)) return std::nullopt;
  result.rssAtEndKiB = StatusKiB(service.pid(), "VmRSS");
  double cpuAfter = 0;
  for (const auto& [name, seconds] : ThreadCpuSeconds(service.pid())) cpuAfter += seconds;
  result.cpuMicrosPerMessage = 1e6 * (cpuAfter - cpuBefore) / static_cast<double>(total);

  // Round trips of getAllReporters on the other connection, back to back, until `probing` is
  // cleared: the worst and how many.
  uint64_t call = 10;
  std::atomic<bool> probing{true};
  const auto probe = [&](double* worstMs, int64_t* count) {
    while (probing.load()) {
      const auto at = SteadyClock::now();
      if (!other.Send(call, protocol::GetAllReporters{}) || !ExpectReply(other, call, "probe")) {
        return;
      }
      ++call;
      *worstMs = std::max(
          *worstMs, std::chrono::duration<double, std::milli>(SteadyClock::now() - at).count());
      ++*count;
    }
  };
  std::thread idleProber(probe, &result.worstIdleRoundTripMs, &result.idleRoundTrips);
  std::this_thread::sleep_for(kSettle);
  probing = false;
  idleProber.join();
  probing = true;
  std::thread prober(probe, &result.worstOtherRoundTripMs, &result.otherRoundTrips);
  const auto stopAt = SteadyClock::now();
  const bool stopped = client.Send(3, protocol::StopReportingSessionForID{kFirstReporter}) &&
                       ExpectReply(client, 3, "stop");
  result.stopSeconds = SecondsBetween(stopAt, SteadyClock::now());
  // The summary work may go on after the reply; keep probing while it could.
  std::this_thread::sleep_for(kSettle);
  probing = false;
  prober.join();
  client.Close();
  other.Close();
  if (!stopped || !StopService(service)) return std::nullopt;
  return result;
}

}  // namespace tavrin::bench
