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
#include <sys/socket.h>
#include <time.h>

#include <CLI/CLI.hpp>

#include "bench/ServiceRuns.h"

namespace tavrin::bench {
namespace {

// Stored as category & 0xFFFF ("Toolbox_Playback").
constexpr uint32_t kCategory = 0x80000003;
constexpr uint16_t kType = 1;
// The reader's chunk in (d), as the service reads its sockets.
constexpr size_t kReadChunk = 64 * 1024;

// A message as audio clients send them: about 160 bytes a frame. No "EngineOnTime", so no power
// event rides along.
BenchMessage Message() {
  return BenchMessage{Dictionary{{"ruvoreporting_timestamp", 1794806865123},
                                 {"route", "Speaker"},
                                 {"sample_rate", 48000},
                                 {"latency_ms", 12},
                                 {"device_name", "alsa_output.pci-0000_00_1f.3.analog-stereo"},
                                 {"underruns", 3}},
                      kCategory, kType};
}

// (e)'s message: five numeric keys.
BenchMessage NumbersMessage() {
  return BenchMessage{Dictionary{{"a", 1}, {"b", 22}, {"c", 333}, {"d", 4.5}, {"e", -5}}, kCategory,
                      kType};
}

struct PipeResult {
  int64_t messages = 0;
  double seconds = 0;
  double rate = 0;
  double readerCpuMicrosPerMessage = 0;  // read, split, decode
  double senderCpuMicrosPerMessage = 0;  // the writes
};

std::optional<PipeResult> RunSocketpair(int64_t messages) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) return std::nullopt;
  const size_t frameSize = RequestFrame(std::nullopt, MessageFor(Message(), kFirstReporter)).size();
  const std::vector<uint8_t> chunk = MessageFrames(Message(), kFirstReporter, kFramesPerWrite);

  std::atomic<bool> go{false};
  int64_t decoded = 0;
  int64_t undecodable = 0;
  SteadyClock::time_point done;
  double readerCpu = 0;
  double senderCpu = 0;
  std::thread reader([&] {
    const double cpuAtStart = CallingThreadCpuSeconds();
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
    readerCpu = CallingThreadCpuSeconds() - cpuAtStart;
  });
  std::thread sender([&] {
    while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
    const double cpuAtStart = CallingThreadCpuSeconds();
    const bool ok =
        SendMessages([&](const uint8_t* data, size_t size) { return SendAll(fds[0], data, size); },
                     chunk, frameSize, messages);
    senderCpu = CallingThreadCpuSeconds() - cpuAtStart;
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
  const size_t frameBytes =
      RequestFrame(std::nullopt, MessageFor(Message(), kFirstReporter)).size();
  out["message_frame_bytes"] = frameBytes;
  out["load_before"] = LoadAverage();
  bool ok = true;
  std::vector<ThroughputResult> throughput;
  if (wanted('a')) {
    for (const auto& [count, paced] : {std::pair{1, true}, {clients, true}, {clients, false}}) {
      std::optional<ThroughputResult> run =
          RunThroughput(Message(), count, messages, paced ? window : 0);
      if (run) throughput.push_back(*run);
      ok = ok && run;
    }
  }
  std::optional<LatencyResult> latency;
  if (wanted('b')) {
    latency = RunLatency(Message(), rate, latencySeconds);
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
    const std::optional<LongSessionResult> run =
        RunLongSession(NumbersMessage(), longSessionMessages);
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
          {"other_worst_round_trip_ms", run->worstOtherRoundTripMs},
          {"other_idle_round_trips", run->idleRoundTrips},
          {"other_idle_worst_round_trip_ms", run->worstIdleRoundTripMs}};
      std::fprintf(stderr, "long session: %s\n", out["long_session"].dump().c_str());
    }
  }
  out["load_after"] = LoadAverage();

  out["throughput"] = tavrin::Value::array();
  for (const ThroughputResult& r : throughput) {
    tavrin::Value item = ToJson(r);
    if (pipe) item["ratio_to_socketpair"] = r.rate / pipe->rate;
    out["throughput"].push_back(item);
  }
  if (latency) out["latency"] = ToJson(*latency);
  if (memory) out["memory"] = ToJson(*memory);
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
