// Starts the real tavrind in a temporary --root and measures it over its socket, one fresh service
// per measurement:
//
//   (a) fire-and-forget sendMessage (nil call) to running sessions from 1 and from 4 clients,
//       each client on its own connection with its own session; timed from the first byte sent
//       until the store file holds every message's row, committed;
//   (b) round-trip latency of sendMessage with a reply, open loop at a fixed offered rate: request
//       i is due at start + i / rate and its latency runs from that due time to its reply, so
//       time spent queued anywhere (the harness included) counts;
//   (c) resident memory of the service idle, with the client connections open, and with the
//       sessions created and started;
//   (d) the limit for (a): the same request frames through a plain socketpair into a reader that
//       only splits and decodes them.
//
// Not a test: nothing is asserted beyond what a run needs to be valid (every reply and every row
// arrives). Figures, machine and commands are in docs/performance.md.
//
//   build/hb/bench/ServiceHarness            # about 35 s with the defaults
//   build/hb/bench/ServiceHarness --help

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
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <sstream>
#include <string>
#include <thread>
#include <variant>
#include <vector>

#include <CLI/CLI.hpp>

#include "base/Dictionary.h"
#include "protocol/Codec.h"
#include "protocol/Frame.h"

namespace {
// The binary the e2e support starts: the build's own tavrind unless --tavrind names another.
std::string gTavrindPath = TAVRIN_BUILT_TAVRIND;
}  // namespace
#define TAVRIND_PATH gTavrindPath
#include "tests/support/TavrindProcess.h"

namespace tavrin::bench {
namespace {

using testing::TavrindProcess;
using testing::TestClient;
using SteadyClock = std::chrono::steady_clock;

// Stored as category & 0xFFFF ("Toolbox_Playback"); the stop's summary (0xFFFF) and driver
// statistics (9) land elsewhere, so counting this category counts exactly the messages sent.
constexpr uint32_t kCategory = 0x80000003;
constexpr int64_t kStoredCategory = kCategory & 0xFFFF;
constexpr uint16_t kType = 1;
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

double SecondsBetween(SteadyClock::time_point from, SteadyClock::time_point to) {
  return std::chrono::duration<double>(to - from).count();
}

std::string LoadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string one, five, fifteen;
  in >> one >> five >> fifteen;
  return one + " " + five + " " + fifteen;
}

// A message as audio clients send them: about 160 bytes a frame. No "EngineOnTime", so no power
// event rides along.
Dictionary Payload() {
  return Dictionary{{"ruvoreporting_timestamp", 1794806865123},
                    {"route", "Speaker"},
                    {"sample_rate", 48000},
                    {"latency_ms", 12},
                    {"device_name", "alsa_output.pci-0000_00_1f.3.analog-stereo"},
                    {"underruns", 3}};
}

std::vector<uint8_t> RequestFrame(std::optional<uint64_t> call, protocol::Arguments arguments) {
  return protocol::EncodeFrame(
      protocol::EncodeRequest(protocol::Request{call, std::move(arguments)}));
}

protocol::SendMessage MessageFor(int64_t reporterID) {
  return protocol::SendMessage{Payload(), kCategory, kType, std::vector<int64_t>{reporterID}};
}

// `count` copies of the nil-call sendMessage frame for `reporterID`, back to back.
std::vector<uint8_t> MessageFrames(int64_t reporterID, int count) {
  const std::vector<uint8_t> frame = RequestFrame(std::nullopt, MessageFor(reporterID));
  std::vector<uint8_t> frames;
  frames.reserve(frame.size() * static_cast<size_t>(count));
  for (int i = 0; i < count; ++i) frames.insert(frames.end(), frame.begin(), frame.end());
  return frames;
}

bool SendAll(int fd, const uint8_t* data, size_t size) {
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
bool SendMessages(SendBytes send, const std::vector<uint8_t>& chunk, size_t frameSize,
                  int64_t messages) {
  while (messages > 0) {
    const int64_t now = std::min<int64_t>(messages, kFramesPerWrite);
    if (!send(chunk.data(), frameSize * static_cast<size_t>(now))) return false;
    messages -= now;
  }
  return true;
}

// A status 0 reply to `call`, or a line on stderr.
bool ExpectReply(TestClient& client, uint64_t call, const char* what) {
  std::optional<protocol::Reply> reply = client.Read();
  if (!reply || reply->call != call || reply->status != protocol::Status::kOk) {
    std::fprintf(stderr, "%s: no good reply to call %" PRIu64 "\n", what, call);
    return false;
  }
  return true;
}

// VmRSS or VmHWM of `pid` in KiB; -1 when it cannot be read.
int64_t StatusKiB(pid_t pid, const std::string& field) {
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
  StoreReader(std::string path, int64_t firstReporter, int64_t lastReporter)
      : path_(std::move(path)), firstReporter_(firstReporter), lastReporter_(lastReporter) {}
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
    sqlite3_bind_int64(count_, 4, kStoredCategory);
    return true;
  }

  std::string path_;
  int64_t firstReporter_;
  int64_t lastReporter_;
  sqlite3* db_ = nullptr;
  sqlite3_stmt* count_ = nullptr;
  int64_t lastRow_ = 0;
  int64_t messages_ = 0;
};

// Polls `value` until it reaches `target`; the time it was first seen there, or nothing when it
// stopped moving for kStallLimit.
template <typename Value>
std::optional<SteadyClock::time_point> WaitForCount(Value value, int64_t target) {
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
bool OpenSession(TestClient& client, int64_t reporterID) {
  if (!client.Send(1, protocol::CreateReportingSession{reporterID}) ||
      !ExpectReply(client, 1, "create")) {
    return false;
  }
  if (!client.SendNoReply(protocol::StartReportingSessionForID{reporterID})) return false;
  // Requests of one connection run in order: this answer comes after the start has run.
  return client.Send(2, protocol::ReporterIDValid{reporterID}) && ExpectReply(client, 2, "valid");
}

// Stops the service with SIGTERM; false (with its log) when it did not exit cleanly.
bool StopService(TavrindProcess& service) {
  const std::optional<int> status = service.Stop(SIGTERM);
  if (status == 0) return true;
  std::fprintf(stderr, "tavrind did not stop cleanly (status %d); its log:\n%s\n",
               status ? *status : -1, service.Log().c_str());
  return false;
}

// Lines of the service's log that report lost work.
size_t LossLines(const TavrindProcess& service) {
  return service.LogCount(": dropped ") + service.LogCount("failed to find backend");
}

// CPU seconds of the threads of `pid` by thread name (the pool's threads together), from /proc.
// Clock ticks of 10 ms: fine over runs of seconds.
std::map<std::string, double> ThreadCpuSeconds(pid_t pid) {
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

std::map<std::string, double> Difference(const std::map<std::string, double>& after,
                                         const std::map<std::string, double>& before) {
  std::map<std::string, double> difference;
  for (const auto& [name, value] : after) {
    const auto found = before.find(name);
    difference[name] = value - (found == before.end() ? 0.0 : found->second);
  }
  return difference;
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
  int64_t rssBeforeKiB = 0;   // the service's resident memory before the first message
  int64_t rssCountedKiB = 0;  // and when the count was final, the sessions still running
  int64_t rssStoppedKiB = 0;  // and once every session was stopped
  int64_t analyticsRows = 0;  // analytics_events rows the run added
  size_t lossLines = 0;
};

// Sends `messages` fire-and-forget messages from `clients` connections, each to its own running
// session, and counts their rows in the store. With a window, the senders keep at most `window`
// messages sent and not yet committed (they watch the store, as no real client can): the rate the
// whole path sustains without loss. Without one (0) they send as fast as the socket takes them,
// and the run shows how much of a burst that outruns the store arrives.
//
// Each client then asks for its session's validity (the answer comes once the work queue has run
// every message before it) and, once the count is final, stops its session: the stop is timed on
// its own, because it summarises everything the session aggregated.
std::optional<ThroughputResult> RunThroughput(int clients, int64_t messages, int64_t window) {
  TavrindProcess service;
  if (!service.Start()) {
    std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
    return std::nullopt;
  }
  const int64_t lastReporter = kFirstReporter + clients - 1;
  std::vector<std::unique_ptr<TestClient>> connections;
  for (int c = 0; c < clients; ++c) {
    connections.push_back(std::make_unique<TestClient>(service.SocketPath()));
    if (!connections.back()->connected() || !OpenSession(*connections.back(), kFirstReporter + c)) {
      return std::nullopt;
    }
  }
  StoreReader store(service.DatabasePath(), kFirstReporter, lastReporter);
  // Each started session writes its sessions row once it has its TelvoroSession.
  if (!WaitForCount([&] { return store.Count("sessions", "reporter_id"); }, clients)) {
    return std::nullopt;
  }
  const int64_t analyticsBefore = store.Count("analytics_events");

  const size_t frameSize = RequestFrame(std::nullopt, MessageFor(kFirstReporter)).size();
  std::vector<std::vector<uint8_t>> chunks;
  for (int c = 0; c < clients; ++c) {
    chunks.push_back(MessageFrames(kFirstReporter + c, kFramesPerWrite));
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
  connections.clear();
  if (!StopService(service)) return std::nullopt;
  result.analyticsRows = store.Count("analytics_events") - analyticsBefore;
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
  size_t lossLines = 0;
};

double Percentile(std::vector<double> values, double fraction) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const size_t index = std::min(values.size() - 1,
                                static_cast<size_t>(fraction * static_cast<double>(values.size())));
  return values[index];
}

std::optional<LatencyResult> RunLatency(double rate, double seconds) {
  TavrindProcess service;
  if (!service.Start()) {
    std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
    return std::nullopt;
  }
  TestClient client(service.SocketPath());
  if (!client.connected() || !OpenSession(client, kFirstReporter)) return std::nullopt;

  // Calls kFirstCall.. are the messages; every frame is encoded before the clock starts.
  constexpr uint64_t kFirstCall = 100;
  const auto total = static_cast<int64_t>(rate * seconds);
  std::vector<uint8_t> frames;
  std::vector<size_t> offsets{0};
  for (int64_t i = 0; i < total; ++i) {
    const std::vector<uint8_t> frame =
        RequestFrame(kFirstCall + static_cast<uint64_t>(i), MessageFor(kFirstReporter));
    frames.insert(frames.end(), frame.begin(), frame.end());
    offsets.push_back(frames.size());
  }
  const auto period = std::chrono::duration<double>(1.0 / rate);
  const auto start = SteadyClock::now() + std::chrono::milliseconds(20);
  const auto dueAt = [&](int64_t i) {
    return start +
           std::chrono::duration_cast<SteadyClock::duration>(period * static_cast<double>(i));
  };

  std::vector<double> lagMs(static_cast<size_t>(total), 0);
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
        lagMs[static_cast<size_t>(j)] =
            std::chrono::duration<double, std::milli>(now - dueAt(j)).count();
      }
      i = end;
    }
  });

  std::vector<double> latencyMs;
  latencyMs.reserve(static_cast<size_t>(total));
  std::vector<bool> answered(static_cast<size_t>(total), false);
  int64_t bad = 0;
  while (static_cast<int64_t>(latencyMs.size()) + bad < total) {
    std::optional<protocol::Reply> reply =
        client.Read(std::chrono::duration_cast<std::chrono::milliseconds>(kStallLimit));
    const auto now = SteadyClock::now();
    if (!reply) break;
    const int64_t i = static_cast<int64_t>(reply->call - kFirstCall);
    // A second answer to one call is as wrong as none.
    if (reply->call < kFirstCall || i >= total || answered[static_cast<size_t>(i)] ||
        reply->status != protocol::Status::kOk || !protocol::IsNilReplyValue(reply->value)) {
      ++bad;
      continue;
    }
    answered[static_cast<size_t>(i)] = true;
    latencyMs.push_back(std::chrono::duration<double, std::milli>(now - dueAt(i)).count());
  }
  sender.join();
  if (bad != 0 || static_cast<int64_t>(latencyMs.size()) != total) {
    std::fprintf(stderr, "latency: %zu good replies and %" PRId64 " bad of %" PRId64 "\n",
                 latencyMs.size(), bad, total);
    return std::nullopt;
  }
  if (!client.Send(3, protocol::StopReportingSessionForID{kFirstReporter}) ||
      !ExpectReply(client, 3, "stop")) {
    return std::nullopt;
  }
  client.Close();
  if (!StopService(service)) return std::nullopt;

  LatencyResult result;
  result.offeredRate = rate;
  result.seconds = seconds;
  result.sent = total;
  result.answered = static_cast<int64_t>(latencyMs.size());
  result.p50 = Percentile(latencyMs, 0.50);
  result.p90 = Percentile(latencyMs, 0.90);
  result.p99 = Percentile(latencyMs, 0.99);
  result.p999 = Percentile(latencyMs, 0.999);
  result.max = *std::max_element(latencyMs.begin(), latencyMs.end());
  result.lagP50 = Percentile(lagMs, 0.50);
  result.lagP99 = Percentile(lagMs, 0.99);
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

std::optional<MemoryResult> RunMemory(int connectionCount, int sessionsPerConnection) {
  TavrindProcess service;
  if (!service.Start()) {
    std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
    return std::nullopt;
  }
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
  StoreReader store(service.DatabasePath(), kFirstReporter, kFirstReporter + result.sessions - 1);
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

struct PipeResult {
  int64_t messages = 0;
  double seconds = 0;
  double rate = 0;
  double readerCpuMicrosPerMessage = 0;  // read, split, decode
  double senderCpuMicrosPerMessage = 0;  // the writes
};

double ThreadCpuSeconds() {
  timespec now{};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

std::optional<PipeResult> RunSocketpair(int64_t messages) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) return std::nullopt;
  const size_t frameSize = RequestFrame(std::nullopt, MessageFor(kFirstReporter)).size();
  const std::vector<uint8_t> chunk = MessageFrames(kFirstReporter, kFramesPerWrite);

  std::atomic<bool> go{false};
  int64_t decoded = 0;
  int64_t undecodable = 0;
  SteadyClock::time_point done;
  double readerCpu = 0;
  double senderCpu = 0;
  std::thread reader([&] {
    const double cpuAtStart = ThreadCpuSeconds();
    protocol::FrameReader frames;
    std::vector<uint8_t> buffer(kReadChunk);
    while (decoded + undecodable < messages) {
      const ssize_t n = ::recv(fds[1], buffer.data(), buffer.size(), 0);
      if (n <= 0) break;
      frames.Append(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(n)));
      while (frames.Next() == protocol::FrameReader::Status::kFrame) {
        auto request = protocol::DecodeRequest(frames.Body());
        const auto* ok = std::get_if<protocol::Request>(&request);
        if (ok != nullptr && std::holds_alternative<protocol::SendMessage>(ok->arguments)) {
          ++decoded;
        } else {
          ++undecodable;
        }
      }
    }
    done = SteadyClock::now();
    readerCpu = ThreadCpuSeconds() - cpuAtStart;
  });
  std::thread sender([&] {
    while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
    const double cpuAtStart = ThreadCpuSeconds();
    const bool ok =
        SendMessages([&](const uint8_t* data, size_t size) { return SendAll(fds[0], data, size); },
                     chunk, frameSize, messages);
    senderCpu = ThreadCpuSeconds() - cpuAtStart;
    // The reader sees the end instead of waiting for frames that will not come.
    if (!ok) ::shutdown(fds[0], SHUT_WR);
  });
  const auto start = SteadyClock::now();
  go.store(true, std::memory_order_release);
  sender.join();
  reader.join();
  ::close(fds[0]);
  ::close(fds[1]);
  if (decoded != messages) {
    std::fprintf(stderr, "socketpair: %" PRId64 " of %" PRId64 " decoded\n", decoded, messages);
    return std::nullopt;
  }
  PipeResult result;
  result.messages = messages;
  result.seconds = SecondsBetween(start, done);
  result.rate = static_cast<double>(messages) / result.seconds;
  result.readerCpuMicrosPerMessage = 1e6 * readerCpu / static_cast<double>(messages);
  result.senderCpuMicrosPerMessage = 1e6 * senderCpu / static_cast<double>(messages);
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
};

// (e) One session that is never stopped until the end: `messages` of five numeric keys. The RSS
// growth from the 10,000th stored message to the last shows what the session keeps per message;
// a second connection's round trips while the session stops show whether the stop blocks others.
std::optional<LongSessionResult> RunLongSession(int64_t messages) {
  constexpr int64_t kEarlyMark = 10000;
  constexpr int kChunk = 500;
  TavrindProcess service;
  if (!service.Start()) {
    std::fprintf(stderr, "tavrind did not start: %s\n", service.Log().c_str());
    return std::nullopt;
  }
  TestClient client(service.SocketPath());
  TestClient other(service.SocketPath());
  if (!client.connected() || !other.connected() || !OpenSession(client, kFirstReporter)) {
    return std::nullopt;
  }
  const Dictionary numbers{{"a", 1}, {"b", 22}, {"c", 333}, {"d", 4.5}, {"e", -5}};
  const std::vector<uint8_t> frame = RequestFrame(
      std::nullopt,
      protocol::SendMessage{numbers, kCategory, kType, std::vector<int64_t>{kFirstReporter}});
  std::vector<uint8_t> chunk;
  for (int i = 0; i < kChunk; ++i) chunk.insert(chunk.end(), frame.begin(), frame.end());
  StoreReader store(service.DatabasePath(), kFirstReporter, kFirstReporter);
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

  std::atomic<bool> stopping{true};
  std::thread prober([&] {
    for (uint64_t call = 10; stopping.load(); ++call) {
      const auto at = SteadyClock::now();
      if (!other.Send(call, protocol::GetAllReporters{}) || !ExpectReply(other, call, "probe")) {
        return;
      }
      result.worstOtherRoundTripMs =
          std::max(result.worstOtherRoundTripMs,
                   std::chrono::duration<double, std::milli>(SteadyClock::now() - at).count());
      ++result.otherRoundTrips;
    }
  });
  const auto stopAt = SteadyClock::now();
  const bool stopped = client.Send(3, protocol::StopReportingSessionForID{kFirstReporter}) &&
                       ExpectReply(client, 3, "stop");
  result.stopSeconds = SecondsBetween(stopAt, SteadyClock::now());
  // The summary work may go on after the reply; keep probing while it could.
  std::this_thread::sleep_for(kSettle);
  stopping = false;
  prober.join();
  client.Close();
  other.Close();
  if (!stopped || !StopService(service)) return std::nullopt;
  return result;
}

std::string Thousands(double perSecond) {
  char text[32];
  std::snprintf(text, sizeof(text), "%.1f k/s", perSecond / 1000.0);
  return text;
}

}  // namespace
}  // namespace tavrin::bench

int main(int argc, char** argv) {
  using namespace tavrin::bench;
  CLI::App app{"Measures the built tavrind over its socket (see docs/performance.md)"};
  int64_t messages = 150000;
  int clients = 4;
  int64_t window = kDefaultWindow;
  double rate = 10000;
  double latencySeconds = 5;
  int memoryConnections = 100;
  int sessionsPerConnection = 100;
  int64_t pipeMessages = 500000;
  int64_t longSessionMessages = 300000;
  bool json = false;
  std::string parts = "abcd";
  app.add_option("--tavrind", gTavrindPath, "the tavrind binary")->capture_default_str();
  app.add_option("--messages", messages, "(a): messages per run, shared among the clients")
      ->capture_default_str();
  app.add_option("--clients", clients, "(a): clients of the runs with more than one")
      ->capture_default_str();
  app.add_option("--window", window, "(a): messages sent and not yet committed, paced runs")
      ->capture_default_str();
  app.add_option("--rate", rate, "(b): offered requests per second")->capture_default_str();
  app.add_option("--latency-seconds", latencySeconds, "(b): how long")->capture_default_str();
  app.add_option("--connections", memoryConnections, "(c): client connections")
      ->capture_default_str();
  app.add_option("--sessions-per-connection", sessionsPerConnection, "(c)")->capture_default_str();
  app.add_option("--pipe-messages", pipeMessages, "(d): messages through the socketpair")
      ->capture_default_str();
  app.add_option("--long-session-messages", longSessionMessages, "(e): messages of the one session")
      ->capture_default_str();
  app.add_option("--parts", parts, "which parts to run, e.g. 'ad'")->capture_default_str();
  app.add_flag("--json", json, "print the results as one JSON object instead of a table");
  CLI11_PARSE(app, argc, argv);
  if (messages <= 0 || clients <= 0 || window < kFramesPerWrite || rate <= 0 ||
      latencySeconds <= 0 || memoryConnections <= 0 || sessionsPerConnection <= 0 ||
      pipeMessages <= 0) {
    std::fprintf(stderr, "counts, rates and durations must be positive; --window at least %d\n",
                 kFramesPerWrite);
    return 64;
  }
  const auto wanted = [&](char part) { return parts.find(part) != std::string::npos; };

  tavrin::Value out = tavrin::MakeDictionary();
  out["tavrind"] = gTavrindPath;
  out["cores"] = std::thread::hardware_concurrency();
  const size_t frameBytes = RequestFrame(std::nullopt, MessageFor(kFirstReporter)).size();
  out["message_frame_bytes"] = frameBytes;
  out["load_before"] = LoadAverage();
  bool ok = true;
  std::vector<ThroughputResult> throughput;
  if (wanted('a')) {
    for (const auto& [count, paced] : {std::pair{1, true}, {clients, true}, {clients, false}}) {
      std::optional<ThroughputResult> run = RunThroughput(count, messages, paced ? window : 0);
      if (run) throughput.push_back(*run);
      ok = ok && run;
    }
  }
  std::optional<LatencyResult> latency;
  if (wanted('b')) {
    latency = RunLatency(rate, latencySeconds);
    ok = ok && latency;
  }
  std::optional<MemoryResult> memory;
  if (wanted('c')) {
    memory = RunMemory(memoryConnections, sessionsPerConnection);
    ok = ok && memory;
  }
  std::optional<PipeResult> pipe;
  if (wanted('d')) {
    pipe = RunSocketpair(pipeMessages);
    ok = ok && pipe;
  }
  if (wanted('e')) {
    const std::optional<LongSessionResult> run = RunLongSession(longSessionMessages);
    ok = ok && run;
    if (run) {
      out["long_session"] = {
          {"messages", run->messages},
          {"rss_at_10000_kib", run->rssAtTenThousandKiB},
          {"rss_at_end_kib", run->rssAtEndKiB},
          {"rss_growth_mib",
           static_cast<double>(run->rssAtEndKiB - run->rssAtTenThousandKiB) / 1024},
          {"service_cpu_us_per_message", run->cpuMicrosPerMessage},
          {"stop_s", run->stopSeconds},
          {"other_round_trips", run->otherRoundTrips},
          {"other_worst_round_trip_ms", run->worstOtherRoundTripMs}};
      std::fprintf(stderr, "long session: %s\n", out["long_session"].dump().c_str());
    }
  }
  out["load_after"] = LoadAverage();

  out["throughput"] = tavrin::Value::array();
  for (const ThroughputResult& r : throughput) {
    tavrin::Value cpu = tavrin::MakeDictionary();
    for (const auto& [name, seconds] : r.cpuSeconds) cpu[name] = seconds;
    tavrin::Value item = {{"clients", r.clients},
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
                          {"rss_before_kib", r.rssBeforeKiB},
                          {"rss_counted_kib", r.rssCountedKiB},
                          {"rss_stopped_kib", r.rssStoppedKiB},
                          {"analytics_rows", r.analyticsRows},
                          {"loss_lines", r.lossLines}};
    if (pipe) item["ratio_to_socketpair"] = r.rate / pipe->rate;
    out["throughput"].push_back(item);
  }
  if (latency) {
    out["latency"] = {{"offered_per_s", latency->offeredRate},
                      {"seconds", latency->seconds},
                      {"sent", latency->sent},
                      {"answered", latency->answered},
                      {"p50_ms", latency->p50},
                      {"p90_ms", latency->p90},
                      {"p99_ms", latency->p99},
                      {"p999_ms", latency->p999},
                      {"max_ms", latency->max},
                      {"send_lag_p50_ms", latency->lagP50},
                      {"send_lag_p99_ms", latency->lagP99},
                      {"loss_lines", latency->lossLines}};
  }
  if (memory) {
    out["memory"] = {{"connections", memory->connections},
                     {"sessions", memory->sessions},
                     {"idle_kib", memory->idleKiB},
                     {"connected_kib", memory->connectedKiB},
                     {"sessions_kib", memory->sessionsKiB},
                     {"peak_kib", memory->peakKiB},
                     {"bytes_per_connection", memory->bytesPerConnection},
                     {"bytes_per_session", memory->bytesPerSession},
                     {"loss_lines", memory->lossLines}};
  }
  if (pipe) {
    out["socketpair"] = {{"messages", pipe->messages},
                         {"seconds", pipe->seconds},
                         {"messages_per_s", pipe->rate},
                         {"reader_cpu_us_per_message", pipe->readerCpuMicrosPerMessage},
                         {"sender_cpu_us_per_message", pipe->senderCpuMicrosPerMessage}};
  }

  if (json) {
    std::printf("%s\n", out.dump(2).c_str());
    return ok ? 0 : 1;
  }
  std::printf("tavrind over its socket: %s; a message frame is %zu bytes\n", gTavrindPath.c_str(),
              frameBytes);
  std::printf("cores %u, load average before %s, after %s\n", std::thread::hardware_concurrency(),
              out["load_before"].get<std::string>().c_str(),
              out["load_after"].get<std::string>().c_str());
  std::printf("\n%-40s %s\n", "measurement", "result");
  for (const ThroughputResult& r : throughput) {
    char label[64];
    std::snprintf(label, sizeof(label), "(a) %d client%s, %s", r.clients, r.clients == 1 ? "" : "s",
                  r.window > 0 ? "paced" : "unpaced");
    std::printf("%-40s %s committed  (%" PRId64 " of %" PRId64
                " rows, the last at %.2f s; sent by %.2f s; work queue through at %.2f s = %s; "
                "stop %.2f s; %" PRId64 " analytics rows%s)\n",
                label, Thousands(r.rate).c_str(), r.committed, r.messages, r.committedSeconds,
                r.sentSeconds, r.acceptedSeconds, Thousands(r.acceptedRate).c_str(), r.stopSeconds,
                r.analyticsRows, r.lossLines != 0 ? "; LOSS IN THE LOG" : "");
    std::string cpu;
    for (const auto& [name, seconds] : r.cpuSeconds) {
      char part[96];
      std::snprintf(part, sizeof(part), "%s%s %.2f s", cpu.empty() ? "" : ", ", name.c_str(),
                    seconds);
      cpu += part;
    }
    std::printf("%-40s service CPU %.1f us per message (%s)\n", "", r.cpuMicrosPerMessage,
                cpu.c_str());
    std::printf(
        "%-40s resident memory %.1f MiB before, %.1f MiB with the sessions still open, "
        "%.1f MiB once stopped\n",
        "", static_cast<double>(r.rssBeforeKiB) / 1024, static_cast<double>(r.rssCountedKiB) / 1024,
        static_cast<double>(r.rssStoppedKiB) / 1024);
  }
  if (latency) {
    const std::string label = "(b) latency, " + Thousands(latency->offeredRate) + " for " +
                              std::to_string(static_cast<int>(latency->seconds)) + " s";
    std::printf("%-40s p50 %.2f ms, p90 %.2f, p99 %.2f, p99.9 %.2f, max %.2f  (%" PRId64
                " of %" PRId64 " answered; harness send lag p50 %.3f, p99 %.3f ms%s)\n",
                label.c_str(), latency->p50, latency->p90, latency->p99, latency->p999,
                latency->max, latency->answered, latency->sent, latency->lagP50, latency->lagP99,
                latency->lossLines != 0 ? "; LOSS IN THE LOG" : "");
  }
  if (memory) {
    std::printf("%-40s idle %.1f MiB, %d connections %.1f MiB, %" PRId64
                " sessions %.1f MiB (peak %.1f MiB)%s\n",
                "(c) resident memory", static_cast<double>(memory->idleKiB) / 1024,
                memory->connections, static_cast<double>(memory->connectedKiB) / 1024,
                memory->sessions, static_cast<double>(memory->sessionsKiB) / 1024,
                static_cast<double>(memory->peakKiB) / 1024,
                memory->lossLines != 0 ? "; LOSS IN THE LOG" : "");
    std::printf("%-40s %.0f bytes per session, %.0f bytes per connection\n", "",
                memory->bytesPerSession, memory->bytesPerConnection);
  }
  if (pipe) {
    std::printf("%-40s %s  (%" PRId64
                " messages in %.2f s; CPU per message: reader %.2f us, sender %.2f us)\n",
                "(d) socketpair + decode", Thousands(pipe->rate).c_str(), pipe->messages,
                pipe->seconds, pipe->readerCpuMicrosPerMessage, pipe->senderCpuMicrosPerMessage);
    for (const ThroughputResult& r : throughput) {
      if (r.window == 0) continue;
      std::printf("%-40s %.3f\n",
                  ("(a) / (d), " + std::to_string(r.clients) + " client(s), paced").c_str(),
                  r.rate / pipe->rate);
    }
  }
  if (!ok) std::printf("\nsome measurements failed; see the lines above\n");
  return ok ? 0 : 1;
}
