// tavrin-pw-exporter: fills a counters tree from PipeWire's profiler (module-profiler), so that
// tavrind's driver statistics see per-node xruns and block timings. Only the PipeWire plumbing
// lives here; decoding is in ProfilerPod, counting in ProfilerCounters, writing in CounterWriter.

#include <pipewire/extensions/profiler.h>
#include <pipewire/impl.h>
#include <pipewire/pipewire.h>
#include <spa/utils/result.h>

#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>

#include <CLI/CLI.hpp>

#include "CounterWriter.h"
#include "ProfilerCounters.h"
#include "ProfilerPod.h"

namespace tavrin::pwexport {
namespace {

// Write failures are reported once, then every this many, so a full disk does not flood the log.
constexpr uint64_t kWriteFailureReportEvery = 1000;

struct Exporter {
  Exporter(std::string root, std::string groupName)
      : writer(std::move(root)), group(std::move(groupName)) {}

  pw_main_loop* loop = nullptr;
  pw_context* context = nullptr;
  pw_core* core = nullptr;
  pw_registry* registry = nullptr;
  pw_proxy* profiler = nullptr;
  uint32_t profilerGlobal = SPA_ID_INVALID;
  spa_hook coreListener{};
  spa_hook registryListener{};
  spa_hook profilerListener{};
  spa_source* timer = nullptr;

  CounterWriter writer;
  std::string group;
  ProfilerCounters counters;
  uint64_t cyclesSeen = 0;
  uint64_t writeFailures = 0;
  uint64_t droppedNodesReported = 0;
  int exitCode = 0;

  void Flush() {
    for (const auto& update : counters.TakeChanged()) {
      std::string error;
      if (!writer.Write(group, update.node, update.counter, update.value, &error)) {
        if (writeFailures++ % kWriteFailureReportEvery == 0) {
          std::fprintf(stderr, "tavrin-pw-exporter: %s (%llu write failures so far)\n",
                       error.c_str(), static_cast<unsigned long long>(writeFailures));
        }
      }
    }
    if (counters.droppedNodes() != droppedNodesReported) {
      droppedNodesReported = counters.droppedNodes();
      std::fprintf(
          stderr, "tavrin-pw-exporter: %llu cycles of nodes beyond the first %zu not counted\n",
          static_cast<unsigned long long>(droppedNodesReported), ProfilerCounters::kMaxNodes);
    }
  }
};

void OnProfile(void* data, const spa_pod* pod) {
  auto* exporter = static_cast<Exporter*>(data);
  for (const auto& cycle : ParseProfile(pod)) {
    exporter->counters.Add(cycle);
    ++exporter->cyclesSeen;
  }
}

const pw_profiler_events kProfilerEvents = {
    .version = PW_VERSION_PROFILER_EVENTS,
    .profile = OnProfile,
};

void OnGlobal(void* data, uint32_t id, uint32_t permissions, const char* type, uint32_t version,
              const spa_dict* props) {
  auto* exporter = static_cast<Exporter*>(data);
  if (exporter->profiler != nullptr || std::strcmp(type, PW_TYPE_INTERFACE_Profiler) != 0) return;
  exporter->profiler = static_cast<pw_proxy*>(
      pw_registry_bind(exporter->registry, id, PW_TYPE_INTERFACE_Profiler, PW_VERSION_PROFILER, 0));
  if (exporter->profiler == nullptr) {
    std::fprintf(stderr, "tavrin-pw-exporter: cannot bind the profiler: %s\n",
                 std::strerror(errno));
    return;
  }
  exporter->profilerGlobal = id;
  pw_profiler_add_listener(reinterpret_cast<pw_profiler*>(exporter->profiler),
                           &exporter->profilerListener, &kProfilerEvents, exporter);
  std::fprintf(stderr, "tavrin-pw-exporter: profiling, counters under %s/%s\n",
               exporter->writer.root().c_str(), exporter->group.c_str());
}

void OnGlobalRemove(void* data, uint32_t id) {
  auto* exporter = static_cast<Exporter*>(data);
  if (exporter->profiler == nullptr || id != exporter->profilerGlobal) return;
  spa_hook_remove(&exporter->profilerListener);
  pw_proxy_destroy(exporter->profiler);
  exporter->profiler = nullptr;
  exporter->profilerGlobal = SPA_ID_INVALID;
  std::fprintf(stderr, "tavrin-pw-exporter: the profiler went away; waiting for it\n");
}

const pw_registry_events kRegistryEvents = {
    .version = PW_VERSION_REGISTRY_EVENTS,
    .global = OnGlobal,
    .global_remove = OnGlobalRemove,
};

void OnCoreError(void* data, uint32_t id, int seq, int res, const char* message) {
  auto* exporter = static_cast<Exporter*>(data);
  std::fprintf(stderr, "tavrin-pw-exporter: PipeWire error on object %u: %s (%s)\n", id,
               message ? message : "", spa_strerror(res));
  if (id == PW_ID_CORE && res == -EPIPE) {  // the daemon went away: let the supervisor restart us
    exporter->exitCode = 1;
    pw_main_loop_quit(exporter->loop);
  }
}

pw_core_events MakeCoreEvents() {
  pw_core_events events{};
  events.version = PW_VERSION_CORE_EVENTS;
  events.error = OnCoreError;
  return events;
}
const pw_core_events kCoreEvents = MakeCoreEvents();

void OnTimer(void* data, uint64_t expirations) { static_cast<Exporter*>(data)->Flush(); }

void OnSignal(void* data, int signalNumber) {
  auto* exporter = static_cast<Exporter*>(data);
  pw_main_loop_quit(exporter->loop);
}

int Run(Exporter& exporter, const std::string& remote, int intervalMs) {
  exporter.loop = pw_main_loop_new(nullptr);
  if (exporter.loop == nullptr) {
    std::fprintf(stderr, "tavrin-pw-exporter: cannot create a main loop\n");
    return 1;
  }
  pw_loop* loop = pw_main_loop_get_loop(exporter.loop);
  pw_loop_add_signal(loop, SIGINT, OnSignal, &exporter);
  pw_loop_add_signal(loop, SIGTERM, OnSignal, &exporter);
  exporter.context = pw_context_new(loop, nullptr, 0);
  // The module also carries the client side of the profiler protocol; without it binding fails.
  if (exporter.context != nullptr &&
      pw_context_load_module(exporter.context, PW_EXTENSION_MODULE_PROFILER, nullptr, nullptr) ==
          nullptr) {
    std::fprintf(stderr, "tavrin-pw-exporter: cannot load %s: %s\n", PW_EXTENSION_MODULE_PROFILER,
                 std::strerror(errno));
    pw_context_destroy(exporter.context);
    exporter.context = nullptr;
  }
  if (exporter.context != nullptr) {
    pw_properties* props =
        remote.empty() ? nullptr : pw_properties_new(PW_KEY_REMOTE_NAME, remote.c_str(), nullptr);
    exporter.core = pw_context_connect(exporter.context, props, 0);
  }
  if (exporter.core == nullptr) {
    std::fprintf(stderr, "tavrin-pw-exporter: cannot connect to PipeWire: %s\n",
                 std::strerror(errno));
    if (exporter.context != nullptr) pw_context_destroy(exporter.context);
    pw_main_loop_destroy(exporter.loop);
    return 1;
  }
  pw_core_add_listener(exporter.core, &exporter.coreListener, &kCoreEvents, &exporter);
  exporter.registry = pw_core_get_registry(exporter.core, PW_VERSION_REGISTRY, 0);
  pw_registry_add_listener(exporter.registry, &exporter.registryListener, &kRegistryEvents,
                           &exporter);

  exporter.timer = pw_loop_add_timer(loop, OnTimer, &exporter);
  timespec interval{intervalMs / 1000, long(intervalMs % 1000) * 1000000L};
  pw_loop_update_timer(loop, exporter.timer, &interval, &interval, false);

  pw_main_loop_run(exporter.loop);
  exporter.Flush();  // what arrived since the last tick

  if (exporter.profiler != nullptr) {
    spa_hook_remove(&exporter.profilerListener);
    pw_proxy_destroy(exporter.profiler);
  }
  spa_hook_remove(&exporter.registryListener);
  pw_proxy_destroy(reinterpret_cast<pw_proxy*>(exporter.registry));
  spa_hook_remove(&exporter.coreListener);
  pw_core_disconnect(exporter.core);
  pw_context_destroy(exporter.context);
  pw_main_loop_destroy(exporter.loop);
  std::fprintf(stderr, "tavrin-pw-exporter: stopped after %llu cycles\n",
               static_cast<unsigned long long>(exporter.cyclesSeen));
  return exporter.exitCode;
}

}  // namespace
}  // namespace tavrin::pwexport

int main(int argc, char** argv) {
  using tavrin::pwexport::CounterWriter;
  CLI::App app{"tavrin-pw-exporter: PipeWire profiler counters for tavrind's driver statistics"};
  std::string root = "/run/tavrin/driverstats";
  // A group tavrind subscribes to (its driver table: QuorvexAE2MCA, Speaker, */MCA,
  // Haptics/Stats): nodes are subgroups, and (Speaker, any subgroup) takes them all, so the
  // counters reach a session's stop message without any set-up.
  std::string group = "Speaker";
  std::string remote;
  int intervalMs = 1000;
  app.add_option("--root", root, "the counters tree to write")->envname("TAVRIN_DRIVER_STATS_ROOT");
  app.add_option("--group", group, "group directory of the counters")
      ->check([](const std::string& name) {
        return CounterWriter::SanitizeName(name) == name ? std::string()
                                                         : "not a safe file name: " + name;
      });
  app.add_option("--interval-ms", intervalMs, "how often changed counters are written")
      ->check(CLI::Range(10, 3600000));
  app.add_option("--remote", remote, "PipeWire remote to connect to (default: PIPEWIRE_REMOTE)");
  CLI11_PARSE(app, argc, argv);

  pw_init(nullptr, nullptr);
  tavrin::pwexport::Exporter exporter(root, group);
  const int status = tavrin::pwexport::Run(exporter, remote, intervalMs);
  pw_deinit();
  return status;
}
