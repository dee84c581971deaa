// Measures the built tavrind beside a baseline for each figure, all in one run, and prints the
// ratio of the two beside a goal:
//
//   1. round trips per second of sendMessage (op 6) with a reply, one client, closed loop; beside
//      a plain echo server (its own process) that reads each request frame and writes a reply of
//      the same size as tavrind's, and beside a D-Bus method call carrying the same message
//      through a private dbus-daemon, with sd-bus at both ends and the server in its own process;
//   2. fire-and-forget sendMessage from 4 clients, each to its own session, until every row is
//      committed in the store (messages per second, and the service's CPU per committed message
//      from /proc/<pid>/stat); beside SQLite alone writing the very rows the service wrote (read
//      back from its file) into the same tables, in transactions of the store's batch size, on
//      one thread;
//   3. reply latency at 10,000 requests/s offered, open loop (p50, p99, p99.9); beside the echo
//      server at the same rate. Then a burst from a second connection, and the same figures for
//      the requests due in the 2 s from its start, beside tavrind's own steady figures;
//   4. resident memory of tavrind with 10,000 sessions open over 100 clients; beside the same
//      tavrind idle;
//   5. another connection's worst round trip while a session of 100,000 messages stops; beside
//      its worst round trip over a second with nothing stopping.
//
// Every message is the same: a five-entry dictionary, category 0x80000001, type 1. Not a test:
// nothing is asserted beyond what a run needs to be valid. Method and figures are in
// docs/performance.md.
//
//   build/release/bench/SideBySideHarness            # under a minute with the defaults
//   build/release/bench/SideBySideHarness --quick    # a few seconds per figure
//   build/release/bench/SideBySideHarness --json

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>

#include <cerrno>
#include <cstring>

#include <CLI/CLI.hpp>

#include "bench/ServiceRuns.h"

namespace tavrin::bench {
namespace {

// Call numbers of the closed-loop runs start here: every one then takes the same five bytes on the
// wire, so every reply has the same size.
constexpr uint64_t kFirstRoundTripCall = 0x10000;
// Round trips before a closed-loop run's clock starts.
constexpr int kWarmUpRoundTrips = 500;
constexpr const char* kBusName = "com.quorvex.tavrin.Bench";
constexpr const char* kBusPath = "/com/quorvex/tavrin/Bench";
constexpr const char* kBusInterface = "com.quorvex.tavrin.Bench";
// A D-Bus call's time-out, microseconds.
constexpr uint64_t kBusCallTimeout = 20'000'000;

BenchMessage Message() {
  return BenchMessage{Dictionary{{"ruvoreporting_timestamp", 1794806865123},
                                 {"route", "Speaker"},
                                 {"sample_rate", 48000},
                                 {"device_name", "alsa_output.pci-0000_00_1f.3.analog-stereo"},
                                 {"underruns", 3}},
                      0x80000001, 1};
}

// A temporary directory, removed with everything in it.
class ScratchDirectory {
 public:
  explicit ScratchDirectory(const char* prefix) : path_(testing::MakeTempDirectory(prefix)) {}
  ~ScratchDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  ScratchDirectory(const ScratchDirectory&) = delete;
  ScratchDirectory& operator=(const ScratchDirectory&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

// A child process, ended with SIGTERM (then reaped) when this goes.
class Child {
 public:
  Child() = default;
  explicit Child(pid_t pid) : pid_(pid) {}
  ~Child() { Stop(); }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;
  Child(Child&& other) noexcept : pid_(other.pid_) { other.pid_ = -1; }
  Child& operator=(Child&& other) noexcept {
    Stop();
    pid_ = other.pid_;
    other.pid_ = -1;
    return *this;
  }
  pid_t pid() const { return pid_; }
  void Stop() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }

 private:
  pid_t pid_ = -1;
};

// Waits up to 20 s for `fd` to be readable.
bool WaitReadable(int fd) {
  pollfd poller{fd, POLLIN, 0};
  return ::poll(&poller, 1, 20'000) == 1;
}

// ---- the echo server ----

// The reply tavrind gives a sendMessage with a call: [call, 0, nil], the call copied byte for byte
// from the request `[call, op, ...]`. Nothing for a nil call (no reply) or a body it cannot read.
// No decoding beyond the call's own bytes.
std::optional<size_t> EchoReply(std::span<const uint8_t> body, uint8_t* out) {
  if (body.size() < 2) return std::nullopt;
  const uint8_t first = body[1];
  size_t callBytes = 0;
  if (first < 0x80) {
    callBytes = 1;
  } else if (first >= 0xcc && first <= 0xcf) {
    callBytes = size_t{1} + (size_t{1} << (first - 0xcc));
  } else {
    return std::nullopt;
  }
  if (body.size() < 1 + callBytes) return std::nullopt;
  const uint32_t length = static_cast<uint32_t>(callBytes + 3);
  out[0] = 0;
  out[1] = 0;
  out[2] = 0;
  out[3] = static_cast<uint8_t>(length);
  out[4] = 0x93;
  std::memcpy(out + 5, body.data() + 1, callBytes);
  out[5 + callBytes] = 0x00;
  out[6 + callBytes] = 0xc0;
  return protocol::kFrameHeaderSize + length;
}

// The echo server's replies are tavrind's byte for byte, for calls of every width the runs use.
bool EchoRepliesMatchTheService(const BenchMessage& message) {
  for (const uint64_t call : {uint64_t{100}, uint64_t{200}, uint64_t{40000}, kFirstRoundTripCall}) {
    const std::vector<uint8_t> request =
        protocol::EncodeRequest(protocol::Request{call, MessageFor(message, kFirstReporter)});
    const std::vector<uint8_t> expected = protocol::EncodeFrame(protocol::EncodeNilReply(call));
    uint8_t reply[16];
    const std::optional<size_t> size = EchoReply(request, reply);
    if (!size || std::vector<uint8_t>(reply, reply + *size) != expected) {
      std::fprintf(stderr, "the echo server's reply to call %" PRIu64 " is not tavrind's\n", call);
      return false;
    }
  }
  return true;
}

// The echo server's loop, in the child: one connection at a time; whatever a read brings, every
// complete frame in it gets its reply, and the replies go out in one write.
[[noreturn]] void ServeEcho(int listening) {
  std::vector<uint8_t> pending;
  std::vector<uint8_t> out;
  std::vector<uint8_t> chunk(64 * 1024);
  for (;;) {
    const int fd = ::accept(listening, nullptr, nullptr);
    if (fd < 0) ::_exit(0);
    pending.clear();
    for (;;) {
      const ssize_t n = ::recv(fd, chunk.data(), chunk.size(), 0);
      if (n <= 0) break;
      pending.insert(pending.end(), chunk.begin(), chunk.begin() + n);
      size_t at = 0;
      out.clear();
      while (pending.size() - at >= protocol::kFrameHeaderSize) {
        const uint32_t length = (uint32_t{pending[at]} << 24) | (uint32_t{pending[at + 1]} << 16) |
                                (uint32_t{pending[at + 2]} << 8) | uint32_t{pending[at + 3]};
        if (pending.size() - at - protocol::kFrameHeaderSize < length) break;
        uint8_t reply[16];
        const std::optional<size_t> size = EchoReply(
            std::span<const uint8_t>(pending.data() + at + protocol::kFrameHeaderSize, length),
            reply);
        if (size) out.insert(out.end(), reply, reply + *size);
        at += protocol::kFrameHeaderSize + length;
      }
      pending.erase(pending.begin(), pending.begin() + static_cast<ptrdiff_t>(at));
      if (!out.empty() && !SendAll(fd, out.data(), out.size())) break;
    }
    ::close(fd);
  }
}

// The echo server in a process of its own, listening at `socketPath`.
std::optional<Child> StartEchoServer(const std::string& socketPath) {
  const int listening = testing::BindUnixSocket(socketPath, true);
  if (listening < 0) return std::nullopt;
  const pid_t pid = ::fork();
  if (pid == 0) ServeEcho(listening);
  ::close(listening);
  if (pid < 0) return std::nullopt;
  return std::optional<Child>(std::in_place, pid);
}

// ---- D-Bus ----

// A private bus: dbus-daemon with a session configuration of its own, listening in `directory`.
// The bus's address, or nothing.
std::optional<std::string> StartBus(const std::string& directory, Child& daemon) {
  const std::string config = directory + "/bus.conf";
  {
    std::ofstream out(config);
    out << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
           " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig>\n"
           "  <type>session</type>\n"
           "  <listen>unix:path="
        << directory
        << "/bus</listen>\n"
           "  <auth>EXTERNAL</auth>\n"
           "  <policy context=\"default\">\n"
           "    <allow send_destination=\"*\" eavesdrop=\"true\"/>\n"
           "    <allow eavesdrop=\"true\"/>\n"
           "    <allow own=\"*\"/>\n"
           "  </policy>\n"
           "</busconfig>\n";
  }
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return std::nullopt;
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(fds[1], STDOUT_FILENO);
    const int null = ::open("/dev/null", O_WRONLY);
    ::dup2(null, STDERR_FILENO);
    const std::string configArgument = "--config-file=" + config;
    ::execlp("dbus-daemon", "dbus-daemon", "--print-address", "--nofork", configArgument.c_str(),
             static_cast<char*>(nullptr));
    ::_exit(127);
  }
  ::close(fds[1]);
  if (pid < 0) {
    ::close(fds[0]);
    return std::nullopt;
  }
  daemon = Child(pid);
  // The address is the first line it prints, once it listens.
  std::string address;
  char c = 0;
  while (WaitReadable(fds[0]) && ::read(fds[0], &c, 1) == 1 && c != '\n') address += c;
  ::close(fds[0]);
  if (address.empty()) {
    std::fprintf(stderr, "dbus-daemon printed no address (is it installed?)\n");
    return std::nullopt;
  }
  return address;
}

sd_bus* ConnectBus(const std::string& address) {
  sd_bus* bus = nullptr;
  if (sd_bus_new(&bus) < 0) return nullptr;
  if (sd_bus_set_address(bus, address.c_str()) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0) {
    sd_bus_unref(bus);
    return nullptr;
  }
  return bus;
}

// The method's arguments: the dictionary as a{sv}, category u, type q, reporter IDs ax, as the
// wire's op 6 carries them.
constexpr const char* kSendSignature = "a{sv}uqax";

// The server's method: reads every argument, each entry of the dictionary by its type, and
// answers with an empty return, as tavrind's nil reply.
int OnSendMessage(sd_bus_message* m, void* /*userdata*/, sd_bus_error* /*error*/) {
  int r = sd_bus_message_enter_container(m, 'a', "{sv}");
  if (r < 0) return r;
  int64_t integers = 0;
  size_t textBytes = 0;
  while ((r = sd_bus_message_enter_container(m, 'e', "sv")) > 0) {
    const char* key = nullptr;
    char type = 0;
    const char* contents = nullptr;
    if ((r = sd_bus_message_read(m, "s", &key)) < 0 ||
        (r = sd_bus_message_peek_type(m, &type, &contents)) < 0 ||
        (r = sd_bus_message_enter_container(m, 'v', contents)) < 0) {
      return r;
    }
    textBytes += std::strlen(key);
    switch (contents[0]) {
      case 'x': {
        int64_t value = 0;
        r = sd_bus_message_read(m, "x", &value);
        integers += value;
        break;
      }
      case 'd': {
        double value = 0;
        r = sd_bus_message_read(m, "d", &value);
        break;
      }
      case 'b': {
        int value = 0;
        r = sd_bus_message_read(m, "b", &value);
        break;
      }
      case 's': {
        const char* value = nullptr;
        r = sd_bus_message_read(m, "s", &value);
        if (r >= 0) textBytes += std::strlen(value);
        break;
      }
      default:
        r = sd_bus_message_skip(m, contents);
    }
    if (r < 0 || (r = sd_bus_message_exit_container(m)) < 0 ||
        (r = sd_bus_message_exit_container(m)) < 0) {
      return r;
    }
  }
  if (r < 0 || (r = sd_bus_message_exit_container(m)) < 0) return r;
  uint32_t category = 0;
  uint16_t type = 0;
  const void* reporters = nullptr;
  size_t reporterBytes = 0;
  if ((r = sd_bus_message_read(m, "uq", &category, &type)) < 0 ||
      (r = sd_bus_message_read_array(m, 'x', &reporters, &reporterBytes)) < 0) {
    return r;
  }
  // What was read is used, so none of it can be left out.
  if (integers == 0 && textBytes == 0 && category == 0 && reporterBytes == 0) return -EINVAL;
  return sd_bus_reply_method_return(m, "");
}

// The D-Bus server's loop, in the child: owns kBusName, tells `ready` (one byte), then serves.
[[noreturn]] void ServeBus(const std::string& address, int ready) {
  static const sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD("SendMessage", kSendSignature, "", OnSendMessage, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_VTABLE_END};
  sd_bus* bus = ConnectBus(address);
  if (bus == nullptr ||
      sd_bus_add_object_vtable(bus, nullptr, kBusPath, kBusInterface, kVtable, nullptr) < 0 ||
      sd_bus_request_name(bus, kBusName, 0) < 0) {
    ::_exit(1);
  }
  if (::write(ready, "1", 1) != 1) ::_exit(1);
  ::close(ready);
  for (;;) {
    const int r = sd_bus_process(bus, nullptr);
    if (r < 0) ::_exit(1);
    if (r > 0) continue;
    if (sd_bus_wait(bus, UINT64_MAX) < 0) ::_exit(1);
  }
}

std::optional<Child> StartBusServer(const std::string& address) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return std::nullopt;
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::close(fds[0]);
    ServeBus(address, fds[1]);
  }
  ::close(fds[1]);
  if (pid < 0) {
    ::close(fds[0]);
    return std::nullopt;
  }
  std::optional<Child> child(std::in_place, pid);
  char c = 0;
  const bool ready = WaitReadable(fds[0]) && ::read(fds[0], &c, 1) == 1;
  ::close(fds[0]);
  if (!ready) {
    std::fprintf(stderr, "the D-Bus server did not start\n");
    return std::nullopt;
  }
  return child;
}

int AppendVariant(sd_bus_message* m, const Value& value) {
  if (value.is_string()) {
    return sd_bus_message_append(m, "v", "s", value.get_ref<const std::string&>().c_str());
  }
  if (value.is_boolean()) return sd_bus_message_append(m, "v", "b", value.get<bool>() ? 1 : 0);
  if (value.is_number_float()) return sd_bus_message_append(m, "v", "d", value.get<double>());
  if (value.is_number_integer()) return sd_bus_message_append(m, "v", "x", value.get<int64_t>());
  return -EINVAL;  // the benchmark's message has nothing else
}

// One method call carrying `message` for `reporterID`, built as a client builds it, and its
// empty return.
bool CallBus(sd_bus* bus, const BenchMessage& message, int64_t reporterID) {
  sd_bus_message* call = nullptr;
  sd_bus_message* reply = nullptr;
  sd_bus_error error = SD_BUS_ERROR_NULL;
  int r =
      sd_bus_message_new_method_call(bus, &call, kBusName, kBusPath, kBusInterface, "SendMessage");
  if (r >= 0) r = sd_bus_message_open_container(call, 'a', "{sv}");
  for (auto entry = message.payload.begin(); r >= 0 && entry != message.payload.end(); ++entry) {
    r = sd_bus_message_open_container(call, 'e', "sv");
    if (r >= 0) r = sd_bus_message_append(call, "s", entry.key().c_str());
    if (r >= 0) r = AppendVariant(call, entry.value());
    if (r >= 0) r = sd_bus_message_close_container(call);
  }
  if (r >= 0) r = sd_bus_message_close_container(call);
  if (r >= 0) r = sd_bus_message_append(call, "uq", message.category, message.type);
  if (r >= 0) r = sd_bus_message_append_array(call, 'x', &reporterID, sizeof reporterID);
  if (r >= 0) r = sd_bus_call(bus, call, kBusCallTimeout, &error, &reply);
  if (r < 0) {
    std::fprintf(stderr, "D-Bus call failed: %s\n",
                 error.message != nullptr ? error.message : std::strerror(-r));
  }
  sd_bus_error_free(&error);
  sd_bus_message_unref(reply);
  sd_bus_message_unref(call);
  return r >= 0;
}

// ---- 1. round trips ----

struct RoundTripResult {
  int64_t roundTrips = 0;
  double seconds = 0;
  double rate = 0;
  double p50Us = 0, p99Us = 0;
  double serverCpuUs = 0;  // the server's processes, per round trip
  double clientCpuUs = 0;  // the calling thread, per round trip
};

// Calls `call` back to back for `seconds` after a warm-up: each call one request and its reply.
template <typename Call>
std::optional<RoundTripResult> MeasureRoundTrips(double seconds, const std::vector<pid_t>& servers,
                                                 Call call) {
  uint64_t next = kFirstRoundTripCall;
  for (int i = 0; i < kWarmUpRoundTrips; ++i) {
    if (!call(next++)) return std::nullopt;
  }
  const auto serverCpu = [&] {
    double total = 0;
    for (const pid_t pid : servers) total += ProcessCpuSeconds(pid);
    return total;
  };
  std::vector<double> micros;
  micros.reserve(static_cast<size_t>(seconds * 100'000));
  const double serverBefore = serverCpu();
  const double clientBefore = CallingThreadCpuSeconds();
  const auto start = SteadyClock::now();
  const auto end = start + std::chrono::duration_cast<SteadyClock::duration>(
                               std::chrono::duration<double>(seconds));
  auto at = start;
  while (at < end) {
    if (!call(next++)) return std::nullopt;
    const auto now = SteadyClock::now();
    micros.push_back(std::chrono::duration<double, std::micro>(now - at).count());
    at = now;
  }
  RoundTripResult result;
  result.roundTrips = static_cast<int64_t>(micros.size());
  result.seconds = SecondsBetween(start, at);
  result.rate = static_cast<double>(result.roundTrips) / result.seconds;
  result.p50Us = Percentile(micros, 0.50);
  result.p99Us = Percentile(micros, 0.99);
  result.serverCpuUs = 1e6 * (serverCpu() - serverBefore) / static_cast<double>(result.roundTrips);
  result.clientCpuUs =
      1e6 * (CallingThreadCpuSeconds() - clientBefore) / static_cast<double>(result.roundTrips);
  return result;
}

// One sendMessage with `call` over `client`, encoded as a client encodes it, and its nil reply.
bool CallOverSocket(TestClient& client, protocol::Request& request, uint64_t call) {
  request.call = call;
  if (!client.SendBytes(protocol::EncodeFrame(protocol::EncodeRequest(request)))) return false;
  const std::optional<protocol::Reply> reply = client.Read();
  if (!reply || reply->call != call || reply->status != protocol::Status::kOk ||
      !protocol::IsNilReplyValue(reply->value)) {
    std::fprintf(stderr, "no good reply to call %" PRIu64 "\n", call);
    return false;
  }
  return true;
}

std::optional<RoundTripResult> RoundTripsOfService(const BenchMessage& message, double seconds) {
  TavrindProcess service;
  if (!StartService(service)) return std::nullopt;
  TestClient client(service.SocketPath());
  if (!client.connected() || !OpenSession(client, kFirstReporter)) return std::nullopt;
  protocol::Request request{std::nullopt, MessageFor(message, kFirstReporter)};
  std::optional<RoundTripResult> result =
      MeasureRoundTrips(seconds, {service.pid()},
                        [&](uint64_t call) { return CallOverSocket(client, request, call); });
  if (!result || !client.Send(3, protocol::StopReportingSessionForID{kFirstReporter}) ||
      !ExpectReply(client, 3, "stop")) {
    return std::nullopt;
  }
  client.Close();
  if (!StopService(service)) return std::nullopt;
  return result;
}

std::optional<RoundTripResult> RoundTripsOfEcho(const BenchMessage& message, double seconds) {
  ScratchDirectory directory("tavrin-echo-");
  std::optional<Child> server = StartEchoServer(directory.path() + "/echo.sock");
  if (!server) return std::nullopt;
  TestClient client(directory.path() + "/echo.sock");
  if (!client.connected()) return std::nullopt;
  protocol::Request request{std::nullopt, MessageFor(message, kFirstReporter)};
  return MeasureRoundTrips(seconds, {server->pid()},
                           [&](uint64_t call) { return CallOverSocket(client, request, call); });
}

std::optional<RoundTripResult> RoundTripsOfBus(const BenchMessage& message, double seconds) {
  ScratchDirectory directory("tavrin-bus-");
  Child daemon;
  const std::optional<std::string> address = StartBus(directory.path(), daemon);
  if (!address) return std::nullopt;
  std::optional<Child> server = StartBusServer(*address);
  if (!server) return std::nullopt;
  sd_bus* bus = ConnectBus(*address);
  if (bus == nullptr) {
    std::fprintf(stderr, "cannot connect to the private bus at %s\n", address->c_str());
    return std::nullopt;
  }
  std::optional<RoundTripResult> result =
      MeasureRoundTrips(seconds, {daemon.pid(), server->pid()},
                        [&](uint64_t) { return CallBus(bus, message, kFirstReporter); });
  sd_bus_flush_close_unref(bus);
  return result;
}

// ---- 2. SQLite alone ----

// The rows a throughput run left in the store: its messages' rows and the analytics event the
// service wrote for each, in the store's columns.
struct StoredRows {
  struct Message {
    int64_t sessionRow;
    int64_t reporterID;
    int64_t category;
    int64_t type;
    std::string payload;
    double receivedAt;
  };
  struct Event {
    std::string name;
    std::string payload;
    double receivedAt;
  };
  std::vector<Message> messages;
  std::vector<Event> events;
  std::vector<std::string> schema;  // CREATE TABLE of both tables, as the service made them
};

std::string ColumnText(sqlite3_stmt* statement, int column) {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
  return text != nullptr
             ? std::string(text, static_cast<size_t>(sqlite3_column_bytes(statement, column)))
             : std::string();
}

bool ReadStoredRows(const std::string& path, int64_t storedCategory, int64_t firstReporter,
                    int64_t lastReporter, int64_t eventsBefore, StoredRows& rows) {
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    sqlite3_close(db);
    return false;
  }
  const auto query = [&](const char* sql, auto bind, auto row) {
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db, sql, -1, &statement, nullptr) != SQLITE_OK) return false;
    bind(statement);
    int rc = SQLITE_ROW;
    while ((rc = sqlite3_step(statement)) == SQLITE_ROW) row(statement);
    sqlite3_finalize(statement);
    return rc == SQLITE_DONE;
  };
  bool ok =
      query(
          "SELECT sql FROM sqlite_master WHERE type = 'table' AND "
          "name IN ('session_messages', 'analytics_events') ORDER BY name",
          [](sqlite3_stmt*) {},
          [&](sqlite3_stmt* s) { rows.schema.push_back(ColumnText(s, 0)); }) &&
      query(
          "SELECT session_row, reporter_id, category, type, payload, received_at "
          "FROM session_messages WHERE reporter_id BETWEEN ?1 AND ?2 AND category = ?3 "
          "ORDER BY row",
          [&](sqlite3_stmt* s) {
            sqlite3_bind_int64(s, 1, firstReporter);
            sqlite3_bind_int64(s, 2, lastReporter);
            sqlite3_bind_int64(s, 3, storedCategory);
          },
          [&](sqlite3_stmt* s) {
            rows.messages.push_back(StoredRows::Message{
                sqlite3_column_int64(s, 0), sqlite3_column_int64(s, 1), sqlite3_column_int64(s, 2),
                sqlite3_column_int64(s, 3), ColumnText(s, 4), sqlite3_column_double(s, 5)});
          });
  if (ok) {
    // Every session started before the first message and stopped once all of them were
    // committed, so the events after the first `eventsBefore` begin with the messages' own; at
    // most one each is taken, which leaves out the stops' events.
    ok = query(
        "SELECT name, payload, received_at FROM analytics_events WHERE row > ?1 "
        "ORDER BY row LIMIT ?2",
        [&](sqlite3_stmt* s) {
          sqlite3_bind_int64(s, 1, eventsBefore);
          sqlite3_bind_int64(s, 2, static_cast<int64_t>(rows.messages.size()));
        },
        [&](sqlite3_stmt* s) {
          rows.events.push_back(
              StoredRows::Event{ColumnText(s, 0), ColumnText(s, 1), sqlite3_column_double(s, 2)});
        });
  }
  sqlite3_close(db);
  return ok && rows.schema.size() == 2 && !rows.messages.empty();
}

struct SqliteAloneResult {
  int64_t messages = 0;
  int64_t events = 0;
  int64_t transactions = 0;
  double seconds = 0;
  double messagesPerSecond = 0;
  double cpuUsPerMessage = 0;  // the writing thread
};

// Writes `rows` into a fresh database on the calling thread as the store writes: WAL,
// synchronous=NORMAL, the service's own tables, prepared inserts of the store's columns, one
// message row then one event row while both last, kMaxBatchRecords (512) records a transaction.
std::optional<SqliteAloneResult> RunSqliteAlone(const StoredRows& rows) {
  constexpr size_t kBatchRecords = 512;
  ScratchDirectory directory("tavrin-sqlite-");
  const std::string path = directory.path() + "/alone.db";
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr) !=
      SQLITE_OK) {
    sqlite3_close(db);
    return std::nullopt;
  }
  std::string setup = "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;";
  for (const std::string& table : rows.schema) setup += table + ";";
  sqlite3_stmt* insertMessage = nullptr;
  sqlite3_stmt* insertEvent = nullptr;
  bool ok =
      sqlite3_exec(db, setup.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK &&
      sqlite3_prepare_v3(db,
                         "INSERT INTO session_messages(session_row, reporter_id, category, type, "
                         "payload, received_at) VALUES(?1, ?2, ?3, ?4, ?5, ?6)",
                         -1, SQLITE_PREPARE_PERSISTENT, &insertMessage, nullptr) == SQLITE_OK &&
      sqlite3_prepare_v3(db,
                         "INSERT INTO analytics_events(name, payload, received_at) "
                         "VALUES(?1, ?2, ?3)",
                         -1, SQLITE_PREPARE_PERSISTENT, &insertEvent, nullptr) == SQLITE_OK;
  const auto step = [](sqlite3_stmt* statement) {
    const int rc = sqlite3_step(statement);
    sqlite3_reset(statement);
    sqlite3_clear_bindings(statement);
    return rc == SQLITE_DONE;
  };
  const auto text = [](sqlite3_stmt* statement, int index, const std::string& value) {
    sqlite3_bind_text(statement, index, value.data(), static_cast<int>(value.size()),
                      SQLITE_STATIC);
  };
  SqliteAloneResult result;
  const double cpuBefore = CallingThreadCpuSeconds();
  const auto start = SteadyClock::now();
  size_t message = 0, event = 0, inBatch = 0;
  while (ok && (message < rows.messages.size() || event < rows.events.size())) {
    if (inBatch == 0) {
      ok = sqlite3_exec(db, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr) == SQLITE_OK;
      ++result.transactions;
    }
    const bool takeMessage =
        message < rows.messages.size() && (event >= rows.events.size() || message <= event);
    if (takeMessage) {
      const StoredRows::Message& row = rows.messages[message++];
      sqlite3_bind_int64(insertMessage, 1, row.sessionRow);
      sqlite3_bind_int64(insertMessage, 2, row.reporterID);
      sqlite3_bind_int64(insertMessage, 3, row.category);
      sqlite3_bind_int64(insertMessage, 4, row.type);
      text(insertMessage, 5, row.payload);
      sqlite3_bind_double(insertMessage, 6, row.receivedAt);
      ok = ok && step(insertMessage);
    } else {
      const StoredRows::Event& row = rows.events[event++];
      text(insertEvent, 1, row.name);
      text(insertEvent, 2, row.payload);
      sqlite3_bind_double(insertEvent, 3, row.receivedAt);
      ok = ok && step(insertEvent);
    }
    const bool last = message == rows.messages.size() && event == rows.events.size();
    if (++inBatch == kBatchRecords || last) {
      ok = ok && sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr) == SQLITE_OK;
      inBatch = 0;
    }
  }
  result.seconds = SecondsBetween(start, SteadyClock::now());
  const double cpu = CallingThreadCpuSeconds() - cpuBefore;
  if (!ok) std::fprintf(stderr, "SQLite alone: %s\n", sqlite3_errmsg(db));
  sqlite3_finalize(insertMessage);
  sqlite3_finalize(insertEvent);
  sqlite3_close(db);
  if (!ok) return std::nullopt;
  result.messages = static_cast<int64_t>(rows.messages.size());
  result.events = static_cast<int64_t>(rows.events.size());
  result.messagesPerSecond = static_cast<double>(result.messages) / result.seconds;
  result.cpuUsPerMessage = 1e6 * cpu / static_cast<double>(result.messages);
  return result;
}

// ---- 3. latency of the echo server ----

std::optional<LatencyResult> RunEchoLatency(const BenchMessage& message, double rate,
                                            double seconds) {
  ScratchDirectory directory("tavrin-echo-");
  std::optional<Child> server = StartEchoServer(directory.path() + "/echo.sock");
  if (!server) return std::nullopt;
  TestClient client(directory.path() + "/echo.sock");
  if (!client.connected()) return std::nullopt;
  const auto total = static_cast<int64_t>(rate * seconds);
  const std::optional<OpenLoopTimes> times =
      RunOpenLoop(client, message, kFirstReporter, rate, total);
  if (!times) return std::nullopt;
  LatencyResult result;
  result.offeredRate = rate;
  result.seconds = seconds;
  result.sent = total;
  result.answered = total;
  result.p50 = Percentile(times->latencyMs, 0.50);
  result.p90 = Percentile(times->latencyMs, 0.90);
  result.p99 = Percentile(times->latencyMs, 0.99);
  result.p999 = Percentile(times->latencyMs, 0.999);
  result.max = *std::max_element(times->latencyMs.begin(), times->latencyMs.end());
  result.lagP50 = Percentile(times->lagMs, 0.50);
  result.lagP99 = Percentile(times->lagMs, 0.99);
  return result;
}

// ---- the table ----

// One line of the table: a figure of tavrind, its baseline's, their ratio and the goal.
struct Figure {
  std::string name;
  std::string unit;
  double tavrin = 0;
  std::string baselineName;
  double baseline = 0;
  // The goal: `goalOnRatio` bounds tavrin / baseline, else tavrin itself; `atLeast` says which
  // way.
  bool goalOnRatio = false;
  bool atLeast = false;
  double goal = 0;

  double Ratio() const { return baseline != 0 ? tavrin / baseline : 0; }
  bool Met() const {
    const double value = goalOnRatio ? Ratio() : tavrin;
    return atLeast ? value >= goal : value <= goal;
  }
  std::string GoalText() const {
    char text[64];
    std::snprintf(text, sizeof(text), "%s %s %g%s", goalOnRatio ? "ratio" : "tavrin",
                  atLeast ? ">=" : "<=", goal, goalOnRatio ? "" : (" " + unit).c_str());
    return text;
  }
};

std::string Number(double value) {
  char text[32];
  if (value >= 1000) {
    std::snprintf(text, sizeof(text), "%.0f", value);
  } else if (value >= 10) {
    std::snprintf(text, sizeof(text), "%.1f", value);
  } else {
    std::snprintf(text, sizeof(text), "%.3g", value);
  }
  return text;
}

void PrintTable(const std::vector<Figure>& figures) {
  size_t nameWidth = 6;
  size_t baselineWidth = 8;
  for (const Figure& f : figures) {
    nameWidth = std::max(nameWidth, f.name.size() + f.unit.size() + 3);
    baselineWidth = std::max(baselineWidth, f.baselineName.size() + 12);
  }
  std::printf("%-*s %10s  %-*s %8s  %-22s %s\n", static_cast<int>(nameWidth), "figure", "tavrin",
              static_cast<int>(baselineWidth), "baseline", "ratio", "goal", "met");
  for (const Figure& f : figures) {
    const std::string name = f.name + " (" + f.unit + ")";
    const std::string baseline = Number(f.baseline) + " " + f.baselineName;
    std::printf("%-*s %10s  %-*s %8.3f  %-22s %s\n", static_cast<int>(nameWidth), name.c_str(),
                Number(f.tavrin).c_str(), static_cast<int>(baselineWidth), baseline.c_str(),
                f.Ratio(), f.GoalText().c_str(), f.Met() ? "yes" : "NO");
  }
}

}  // namespace
}  // namespace tavrin::bench

int main(int argc, char** argv) {
  using namespace tavrin::bench;
  CLI::App app{"tavrind beside a baseline for each figure (see docs/performance.md)"};
  double roundTripSeconds = 5;
  int64_t messages = 150000;
  int clients = 4;
  int64_t window = 0;
  double rate = 10000;
  double latencySeconds = 5;
  int64_t burst = 50000;
  double afterSeconds = 2;
  int connections = 100;
  int sessionsPerConnection = 100;
  int64_t stopMessages = 100000;
  std::string parts = "12345";
  bool quick = false;
  bool json = false;
  app.add_option("--tavrind", gTavrindPath, "the tavrind binary")->capture_default_str();
  app.add_option("--round-trip-seconds", roundTripSeconds, "1: timed seconds per system")
      ->capture_default_str();
  app.add_option("--messages", messages, "2: messages, shared among the clients")
      ->capture_default_str();
  app.add_option("--clients", clients, "2: clients")->capture_default_str();
  app.add_option("--window", window,
                 "2: messages sent and not yet committed (0: as fast as the socket takes them)")
      ->capture_default_str();
  app.add_option("--rate", rate, "3: offered requests per second")->capture_default_str();
  app.add_option("--latency-seconds", latencySeconds, "3: steady seconds")->capture_default_str();
  app.add_option("--burst", burst, "3: messages of the burst")->capture_default_str();
  app.add_option("--after-seconds", afterSeconds, "3: seconds measured from the burst's start")
      ->capture_default_str();
  app.add_option("--connections", connections, "4: client connections")->capture_default_str();
  app.add_option("--sessions-per-connection", sessionsPerConnection, "4")->capture_default_str();
  app.add_option("--stop-messages", stopMessages, "5: messages of the session that stops")
      ->capture_default_str();
  app.add_option("--parts", parts, "which figures to measure, e.g. '13'")->capture_default_str();
  app.add_flag("--quick", quick, "shorter runs throughout (about a fifth of the defaults' time)");
  app.add_flag("--json", json, "print one JSON object instead of the table");
  CLI11_PARSE(app, argc, argv);
  if (quick) {
    roundTripSeconds = std::min(roundTripSeconds, 1.0);
    messages = std::min<int64_t>(messages, 30000);
    latencySeconds = std::min(latencySeconds, 2.0);
    burst = std::min<int64_t>(burst, 20000);
    stopMessages = std::min<int64_t>(stopMessages, 20000);
  }
  if (roundTripSeconds <= 0 || messages <= 0 || clients <= 0 || window < 0 || rate <= 0 ||
      latencySeconds <= 0 || burst <= 0 || afterSeconds <= 0 || connections <= 0 ||
      sessionsPerConnection <= 0 || stopMessages <= 0) {
    std::fprintf(stderr, "counts, rates and durations must be positive\n");
    return 64;
  }
  const auto wanted = [&](char part) { return parts.find(part) != std::string::npos; };
  const BenchMessage message = Message();
  if (!EchoRepliesMatchTheService(message)) return 1;

  tavrin::Value out = tavrin::MakeDictionary();
  out["tavrind"] = gTavrindPath;
  out["cores"] = std::thread::hardware_concurrency();
  out["message_frame_bytes"] = RequestFrame(std::nullopt, MessageFor(message, 1000)).size();
  out["load_before"] = LoadAverage();
  std::vector<Figure> figures;
  bool ok = true;
  const auto failed = [&](const char* what) {
    std::fprintf(stderr, "%s: failed\n", what);
    ok = false;
  };

  if (wanted('1')) {
    const auto service = RoundTripsOfService(message, roundTripSeconds);
    const auto echo = RoundTripsOfEcho(message, roundTripSeconds);
    const auto bus = RoundTripsOfBus(message, roundTripSeconds);
    const auto asJson = [](const RoundTripResult& r) {
      return tavrin::Value{{"round_trips", r.roundTrips},
                           {"seconds", r.seconds},
                           {"per_s", r.rate},
                           {"p50_us", r.p50Us},
                           {"p99_us", r.p99Us},
                           {"server_cpu_us", r.serverCpuUs},
                           {"client_cpu_us", r.clientCpuUs}};
    };
    if (service && echo) {
      figures.push_back({"1. round trips, op 6 with reply, 1 client", "1/s", service->rate,
                         "raw socket echo", echo->rate, true, true, 0.33});
    }
    if (service && bus) {
      figures.push_back({"1. round trips, op 6 with reply, 1 client", "1/s", service->rate,
                         "D-Bus, sd-bus", bus->rate, true, true, 1.0});
    }
    if (service) out["round_trips"]["tavrind"] = asJson(*service);
    if (echo) out["round_trips"]["echo"] = asJson(*echo);
    if (bus) out["round_trips"]["dbus"] = asJson(*bus);
    if (!service || !echo || !bus) failed("1. round trips");
  }

  if (wanted('2')) {
    StoredRows rows;
    bool read = false;
    const auto run = RunThroughput(
        message, clients, messages, window, [&](const std::string& db, int64_t eventsBefore) {
          read = ReadStoredRows(db, message.StoredCategory(), kFirstReporter,
                                kFirstReporter + clients - 1, eventsBefore, rows);
        });
    const auto alone = read ? RunSqliteAlone(rows) : std::nullopt;
    if (run && alone) {
      const std::string name = "2. committed, " + std::to_string(clients) + " clients";
      figures.push_back(
          {name, "msg/s", run->rate, "SQLite alone", alone->messagesPerSecond, true, true, 0.5});
      figures.push_back({"2. CPU per committed message", "us", run->processCpuMicrosPerCommitted,
                         "SQLite alone", alone->cpuUsPerMessage, true, false, 4.0});
      out["throughput"] = ToJson(*run);
      out["sqlite_alone"] = {{"messages", alone->messages},
                             {"analytics_events", alone->events},
                             {"transactions", alone->transactions},
                             {"seconds", alone->seconds},
                             {"messages_per_s", alone->messagesPerSecond},
                             {"cpu_us_per_message", alone->cpuUsPerMessage}};
      if (run->committed != run->messages || run->lossLines != 0) {
        std::fprintf(stderr, "2.: %" PRId64 " of %" PRId64 " committed; loss lines %zu\n",
                     run->committed, run->messages, run->lossLines);
        ok = false;
      }
    } else {
      failed("2. throughput");
    }
  }

  if (wanted('3')) {
    const auto service = RunLatency(message, rate, latencySeconds, burst, afterSeconds);
    const auto echo = RunEchoLatency(message, rate, latencySeconds);
    if (service && echo) {
      const std::string at = Number(rate / 1000) + "k/s";
      const double goals[] = {0.5, 2, 5};
      const double steady[] = {service->p50, service->p99, service->p999};
      const double baseline[] = {echo->p50, echo->p99, echo->p999};
      const char* names[] = {"p50", "p99", "p99.9"};
      for (int i = 0; i < 3; ++i) {
        figures.push_back({"3. reply latency " + std::string(names[i]) + " at " + at, "ms",
                           steady[i], "echo", baseline[i], false, false, goals[i]});
      }
      const double afterGoals[] = {2, 20, 50};
      const double after[] = {service->afterP50, service->afterP99, service->afterP999};
      for (int i = 0; i < 3; ++i) {
        figures.push_back({"3. " + std::string(names[i]) + " in the " + Number(afterSeconds) +
                               " s from a " + Number(static_cast<double>(burst)) + "-message burst",
                           "ms", after[i], "steady", steady[i], false, false, afterGoals[i]});
      }
      out["latency"]["tavrind"] = ToJson(*service);
      out["latency"]["echo"] = ToJson(*echo);
    } else {
      failed("3. latency");
    }
  }

  if (wanted('4')) {
    const auto memory = RunMemory(connections, sessionsPerConnection);
    if (memory) {
      figures.push_back({"4. RSS, " + Number(static_cast<double>(memory->sessions)) +
                             " sessions over " + std::to_string(connections) + " clients",
                         "MiB", static_cast<double>(memory->sessionsKiB) / 1024, "idle tavrind",
                         static_cast<double>(memory->idleKiB) / 1024, false, false, 64});
      out["memory"] = ToJson(*memory);
    } else {
      failed("4. memory");
    }
  }

  if (wanted('5')) {
    const auto run = RunLongSession(message, stopMessages);
    if (run) {
      figures.push_back({"5. other connection's worst round trip, " +
                             Number(static_cast<double>(stopMessages)) + "-message session stops",
                         "ms", run->worstOtherRoundTripMs, "nothing stops",
                         run->worstIdleRoundTripMs, false, false, 20});
      out["stop"] = {{"messages", run->messages},
                     {"stop_s", run->stopSeconds},
                     {"other_round_trips", run->otherRoundTrips},
                     {"other_worst_round_trip_ms", run->worstOtherRoundTripMs},
                     {"idle_round_trips", run->idleRoundTrips},
                     {"idle_worst_round_trip_ms", run->worstIdleRoundTripMs},
                     {"service_cpu_us_per_message", run->cpuMicrosPerMessage}};
    } else {
      failed("5. stop");
    }
  }
  out["load_after"] = LoadAverage();

  out["figures"] = tavrin::Value::array();
  for (const Figure& f : figures) {
    out["figures"].push_back({{"figure", f.name},
                              {"unit", f.unit},
                              {"tavrin", f.tavrin},
                              {"baseline", f.baselineName},
                              {"baseline_value", f.baseline},
                              {"ratio", f.Ratio()},
                              {"goal", f.GoalText()},
                              {"met", f.Met()}});
  }
  if (json) {
    std::printf("%s\n", out.dump(2).c_str());
    return ok ? 0 : 1;
  }
  std::printf(
      "tavrind: %s; a message frame is %zu bytes; %u cores; load average %s before, %s "
      "after\n\n",
      gTavrindPath.c_str(), out["message_frame_bytes"].get<size_t>(),
      std::thread::hardware_concurrency(), out["load_before"].get<std::string>().c_str(),
      out["load_after"].get<std::string>().c_str());
  PrintTable(figures);
  // What the ratios rest on: where the harness itself was late, and the parts of each figure.
  std::printf("\n");
  if (out.contains("round_trips")) {
    for (const char* system : {"tavrind", "echo", "dbus"}) {
      if (!out["round_trips"].contains(system)) continue;
      const tavrin::Value& r = out["round_trips"][system];
      std::printf(
          "1. %-8s round trip p50 %.1f us, p99 %.1f us; CPU per round trip: server %.1f us, "
          "client %.1f us\n",
          system, r["p50_us"].get<double>(), r["p99_us"].get<double>(),
          r["server_cpu_us"].get<double>(), r["client_cpu_us"].get<double>());
    }
  }
  if (out.contains("sqlite_alone")) {
    const tavrin::Value& a = out["sqlite_alone"];
    std::printf("2. SQLite alone wrote %" PRId64 " message rows and %" PRId64
                " analytics events in %" PRId64 " transactions\n",
                a["messages"].get<int64_t>(), a["analytics_events"].get<int64_t>(),
                a["transactions"].get<int64_t>());
  }
  if (out.contains("latency")) {
    const tavrin::Value& t = out["latency"]["tavrind"];
    std::printf(
        "3. harness send lag p99: %.2f ms beside tavrind, %.2f ms beside the echo server; "
        "the burst took %.2f s to write\n",
        t["send_lag_p99_ms"].get<double>(), out["latency"]["echo"]["send_lag_p99_ms"].get<double>(),
        t["burst"]["send_s"].get<double>());
  }
  if (!ok) std::printf("\nsome measurements failed; see the lines above\n");
  return ok ? 0 : 1;
}
