#include <gtest/gtest.h>
#include <spa/param/profiler.h>
#include <spa/pod/builder.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <random>
#include <set>

#include "CounterWriter.h"
#include "ProfilerCounters.h"
#include "ProfilerPod.h"
#include "platform/linux/driverstats/CountersTreeDriverStats.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TempCountersTree.h"
#include "tests/support/TestClient.h"

extern char** environ;

namespace tavrin::pwexport {
namespace {

using testing::ChildProcess;
using testing::ReadFile;
using testing::TempCountersTree;
using testing::WaitUntil;

// --- Names and the writer ---

TEST(CounterWriterTest, WritesReplaceAtomicallyRefuseUnsafeNamesAndReportFilesystemFailures) {
  TempCountersTree tree;
  CounterWriter writer(tree.root());
  std::string error;
  ASSERT_TRUE(writer.Write("PipeWire", "Dummy-Driver", "xruns", 3, &error)) << error;
  ASSERT_TRUE(writer.Write("PipeWire", "Dummy-Driver", "xruns", -9, &error)) << error;
  ASSERT_TRUE(writer.Write("PipeWire", "Dummy-Driver", "cycles", INT64_MAX, &error)) << error;
  // Exactly the two counters are there: no temporary file is left behind.
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(tree.path("PipeWire/Dummy-Driver")))
    names.insert(entry.path().filename());
  EXPECT_EQ(names, (std::set<std::string>{"cycles", "xruns"}));
  // The last value, at its edges, as tavrind reads it.
  EXPECT_EQ(ParseCounterText(ReadFile(tree.path("PipeWire/Dummy-Driver/xruns"))), -9);
  EXPECT_EQ(ParseCounterText(ReadFile(tree.path("PipeWire/Dummy-Driver/cycles"))), INT64_MAX);

  for (const auto& [node, counter] : {std::pair{"..", "x"}, {"a/b", "x"}, {"node", ""}}) {
    error.clear();
    EXPECT_FALSE(writer.Write("PipeWire", node, counter, 1, &error)) << node << "/" << counter;
    EXPECT_NE(error.find("unsafe counter name"), std::string::npos) << error;
  }
  tree.write("blocked", 1);  // a file where the group directory should be
  CounterWriter blocked(tree.path("blocked"));
  error.clear();
  EXPECT_FALSE(blocked.Write("PipeWire", "node", "x", 1, &error));
  EXPECT_NE(error.find("cannot create"), std::string::npos) << error;
}

// --- Counting ---

ProfileNode Node(std::string name, int64_t signal, int64_t awake, int64_t finish) {
  return {.name = std::move(name), .times = {.signal = signal, .awake = awake, .finish = finish}};
}

std::map<std::string, int64_t> AsMap(const std::vector<CounterUpdate>& updates) {
  std::map<std::string, int64_t> values;
  for (const auto& update : updates) values[update.node + "/" + update.counter] = update.value;
  return values;
}

TEST(ProfilerCountersTest, SumsMaximaIncompleteCyclesAndXruns) {
  ProfilerCounters counters;
  counters.Add({.xrunCount = 2,
                .driver = Node("Dummy-Driver", 1000, 1100, 1500),
                .followers = {Node("test sink", 1500, 1800, 2000), Node("late", 1500, 0, 0)}});
  counters.Add({.xrunCount = 3,
                .driver = Node("Dummy-Driver", 2000, 2050, 2300),
                .followers = {Node("test sink", 2300, 2400, 3000)}});

  // Every counter of every node, and the cycle's xruns on its driver.
  const char* const names[] = {"cycles",      "incomplete_cycles", "busy_ns_total",
                               "busy_ns_max", "wakeup_ns_total",   "wakeup_ns_max"};
  const std::pair<std::string, std::array<int64_t, 6>> nodes[] = {
      {"Dummy-Driver", {2, 0, 650, 400, 150, 100}},
      {"late", {1, 1, 0, 0, 0, 0}},
      {"test_sink", {2, 0, 800, 600, 400, 300}},
  };
  std::map<std::string, int64_t> expected{{"Dummy-Driver/xruns", 3}};
  for (const auto& [node, values] : nodes) {
    for (size_t i = 0; i < values.size(); ++i) expected[node + "/" + names[i]] = values[i];
  }
  EXPECT_EQ(AsMap(counters.TakeChanged()), expected);
  EXPECT_TRUE(counters.TakeChanged().empty());  // nothing new, nothing to write

  // The xruns unchanged: not written again.
  counters.Add({.xrunCount = 3, .driver = Node("Dummy-Driver", 3000, 3010, 3020), .followers = {}});
  EXPECT_EQ(AsMap(counters.TakeChanged()), (std::map<std::string, int64_t>{
                                               {"Dummy-Driver/busy_ns_total", 660},
                                               {"Dummy-Driver/cycles", 3},
                                               {"Dummy-Driver/wakeup_ns_total", 160},
                                           }));
}

// --- Decoding profiler pods ---

struct PodBuffer {
  alignas(8) uint8_t data[8192];
  spa_pod_builder builder{};
  spa_pod_frame outer{};
  PodBuffer() { spa_pod_builder_init(&builder, data, sizeof data); }
};

void AddBlock(spa_pod_builder* b, uint32_t key, int32_t id, const char* name, int64_t signal,
              int64_t awake, int64_t finish, bool withLatency = true) {
  spa_pod_builder_prop(b, key, 0);
  spa_pod_frame frame;
  spa_pod_builder_push_struct(b, &frame);
  spa_pod_builder_add(b, SPA_POD_Int(id), SPA_POD_String(name), SPA_POD_Long(signal - 100),
                      SPA_POD_Long(signal), SPA_POD_Long(awake), SPA_POD_Long(finish),
                      SPA_POD_Int(3), nullptr);
  if (withLatency) spa_pod_builder_fraction(b, 1024, 48000);
  spa_pod_builder_pop(b, &frame);
}

// A profile stream of every shape the decoder meets: a good cycle whose follower blocks include
// one of the wrong shape, a value that is not an object, a cycle whose driver block stops before
// its status, an object of another type and a good cycle without the info block.
const spa_pod* BuildProfile(PodBuffer& pod) {
  spa_pod_builder* b = &pod.builder;
  spa_pod_frame object;
  spa_pod_builder_push_struct(b, &pod.outer);
  spa_pod_builder_push_object(b, &object, SPA_TYPE_OBJECT_Profiler, 0);
  spa_pod_builder_prop(b, SPA_PROFILER_info, 0);  // 4 xruns
  spa_pod_builder_add_struct(b, SPA_POD_Long(int64_t{7}), SPA_POD_Float(0.1f), SPA_POD_Float(0.2f),
                             SPA_POD_Float(0.3f), SPA_POD_Int(4));
  spa_pod_builder_prop(b, SPA_PROFILER_clock, 0);  // ignored
  spa_pod_builder_int(b, 0);
  AddBlock(b, SPA_PROFILER_driverBlock, 30, "Dummy-Driver", 1000, 1010, 1200);
  AddBlock(b, SPA_PROFILER_followerBlock, 31, "sink", 1010, 1020, 1100, false);
  AddBlock(b, SPA_PROFILER_followerBlock, 32, "source", 1010, 1030, 1090);
  spa_pod_builder_prop(b, SPA_PROFILER_followerBlock, 0);  // its name is a number
  spa_pod_builder_add_struct(b, SPA_POD_Int(3), SPA_POD_Int(4));
  spa_pod_builder_pop(b, &object);
  spa_pod_builder_int(b, 5);
  spa_pod_builder_push_object(b, &object, SPA_TYPE_OBJECT_Profiler, 0);
  spa_pod_builder_prop(b, SPA_PROFILER_driverBlock, 0);
  spa_pod_builder_add_struct(b, SPA_POD_Int(1), SPA_POD_String("short"), SPA_POD_Long(int64_t{1}));
  spa_pod_builder_pop(b, &object);
  spa_pod_builder_push_object(b, &object, SPA_TYPE_OBJECT_Props, 0);
  AddBlock(b, SPA_PROFILER_driverBlock, 5, "props", 10, 20, 30);
  spa_pod_builder_pop(b, &object);
  spa_pod_builder_push_object(b, &object, SPA_TYPE_OBJECT_Profiler, 0);
  AddBlock(b, SPA_PROFILER_driverBlock, 40, "Other", 5, 6, 7);
  spa_pod_builder_pop(b, &object);
  return static_cast<const spa_pod*>(spa_pod_builder_pop(b, &pod.outer));
}

TEST(ProfilerPodTest, DecodesGoodCyclesAndLeavesMalformedBlocksAndObjectsOut) {
  PodBuffer pod;
  const auto cycles = ParseProfile(BuildProfile(pod));
  ASSERT_EQ(cycles.size(), 2u);
  EXPECT_EQ(cycles[0].xrunCount, 4);
  ASSERT_TRUE(cycles[0].driver);
  EXPECT_EQ(cycles[0].driver->name, "Dummy-Driver");
  EXPECT_EQ(cycles[0].driver->id, 30);
  EXPECT_EQ(cycles[0].driver->times.prevSignal, 900);
  EXPECT_EQ(cycles[0].driver->times.status, 3);
  ASSERT_EQ(cycles[0].followers.size(), 2u);
  EXPECT_EQ(cycles[0].followers[0].name, "sink");  // without the optional latency
  EXPECT_EQ(cycles[0].followers[1].times.awake, 1030);
  EXPECT_EQ(cycles[1].xrunCount, std::nullopt);
  EXPECT_EQ(cycles[1].driver->name, "Other");
  EXPECT_TRUE(ParseProfile(nullptr).empty());
}

TEST(ProfilerPodTest, TruncatedAndRandomBytesNeverReadOutOfBounds) {
  PodBuffer pod;
  const spa_pod* root = BuildProfile(pod);
  const size_t size = SPA_POD_SIZE(root);
  ASSERT_EQ(ParseProfileBytes(root, size).size(), 2u);

  // The same bytes cut short are refused as a whole (the outer size no longer fits).
  for (size_t cut = 0; cut < size; cut += 8) {
    EXPECT_TRUE(ParseProfileBytes(root, cut).empty()) << cut;
  }
  // Copies with corrupted words: whatever comes out, nothing is read outside (ASan checks).
  std::mt19937 random(12345);
  for (int round = 0; round < 2000; ++round) {
    alignas(8) uint8_t copy[sizeof pod.data];
    std::memcpy(copy, root, size);
    for (int flips = 0; flips < 4; ++flips) {
      const size_t at = (random() % (size / 4)) * 4;
      const uint32_t word = random();
      std::memcpy(copy + at, &word, sizeof word);
    }
    const auto cycles = ParseProfileBytes(copy, size);
    EXPECT_LE(cycles.size(), 4u);  // the objects that could be cycles
  }
}

// --- Against a real PipeWire daemon with a dummy driver ---

constexpr const char* kPipeWire = "/usr/bin/pipewire";

int64_t Counter(const TempCountersTree& tree, const std::string& rel) {
  return ParseCounterText(ReadFile(tree.path(rel))).value_or(-1);
}

TEST(PwExporterDaemonTest, ExportsDriverAndFollowerCountersFromALiveDaemon) {
  if (::access(kPipeWire, X_OK) != 0) GTEST_SKIP() << "pipewire is not installed";
  TempCountersTree tree;
  const std::string runtime = tree.outside();
  ::chmod(runtime.c_str(), 0700);
  // The daemon and its clients meet in the tree's private runtime directory.
  ::setenv("XDG_RUNTIME_DIR", runtime.c_str(), 1);
  ::setenv("PIPEWIRE_RUNTIME_DIR", runtime.c_str(), 1);
  ::unsetenv("PIPEWIRE_REMOTE");
  const std::string logFile = runtime + "/output.log";

  ChildProcess daemon({kPipeWire, "-c", PIPEWIRE_NULL_GRAPH_CONF}, logFile);
  ASSERT_TRUE(daemon.started());
  ASSERT_TRUE(WaitUntil([&] { return ::access((runtime + "/pipewire-0").c_str(), F_OK) == 0; }))
      << ReadFile(logFile);

  {
    ChildProcess exporter({TAVRIN_PW_EXPORTER_PATH, "--root", tree.root(), "--interval-ms", "50"},
                          logFile);
    ASSERT_TRUE(exporter.started());
    ASSERT_TRUE(WaitUntil([&] {
      return Counter(tree, "Speaker/Dummy-Driver/cycles") > 0 &&
             Counter(tree, "Speaker/test-source/cycles") > 0;
    })) << ReadFile(logFile);
    // The sink's cycles and busy time, and that they keep rising, are PwExporterServiceE2eTest's.
    EXPECT_GE(Counter(tree, "Speaker/Dummy-Driver/xruns"), 0);

    exporter.Signal(SIGTERM);
    EXPECT_EQ(exporter.Wait(), 0) << ReadFile(logFile);
  }

  // The daemon going away ends the exporter with status 1, for its supervisor to restart it.
  ChildProcess exporter({TAVRIN_PW_EXPORTER_PATH, "--root", tree.root(), "--interval-ms", "50"},
                        logFile);
  ASSERT_TRUE(WaitUntil([&] {
    return testing::Occurrences(ReadFile(logFile), "profiling, counters under") == 2;
  })) << ReadFile(logFile);
  daemon.Signal(SIGTERM);
  EXPECT_EQ(daemon.Wait(), 0);
  EXPECT_EQ(exporter.Wait(), 1) << ReadFile(logFile);
}

}  // namespace
}  // namespace tavrin::pwexport
