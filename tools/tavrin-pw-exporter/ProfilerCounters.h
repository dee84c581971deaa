#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace tavrin::pwexport {

// One node's timestamps in one graph cycle, as PipeWire's profiler reports them (nanoseconds,
// CLOCK_MONOTONIC): the node was signalled, woke up, and finished its processing.
struct BlockTimes {
  int64_t prevSignal = 0;
  int64_t signal = 0;
  int64_t awake = 0;
  int64_t finish = 0;
  int32_t status = 0;
};

struct ProfileNode {
  int32_t id = 0;
  std::string name;
  BlockTimes times;
};

// One cycle of one driver: the driver's own block, its followers' blocks, and the driver's
// running xrun count when the profiler sent its info.
struct ProfileCycle {
  std::optional<int64_t> xrunCount;
  std::optional<ProfileNode> driver;
  std::vector<ProfileNode> followers;
};

// A counter that changed since it was last taken: <node>/<counter> = value.
struct CounterUpdate {
  std::string node;  // sanitised node name
  std::string counter;
  int64_t value = 0;
  bool operator==(const CounterUpdate&) const = default;
};

// Turns profiler cycles into per-node counters. Every node (driver or follower) gets:
//   cycles             cycles it took part in
//   incomplete_cycles  cycles whose timestamps were not in order signal <= awake <= finish
//                      (it had not woken up or not finished when the cycle was profiled)
//   wakeup_ns_total    sum of awake - signal over complete cycles   (scheduling latency)
//   wakeup_ns_max      largest awake - signal seen
//   busy_ns_total      sum of finish - awake over complete cycles   (processing time)
//   busy_ns_max        largest finish - awake seen
// Drivers also get:
//   xruns              PipeWire's own running xrun count of the driver, as last reported
// Counters count from the exporter's start (xruns from the daemon's). Not thread-safe: one
// owner (the PipeWire loop thread).
class ProfilerCounters {
 public:
  void Add(const ProfileCycle& cycle);
  // The counters changed since the previous call, by node then counter name.
  std::vector<CounterUpdate> TakeChanged();

  // Nodes beyond kMaxNodes are not counted; their number is reported here.
  uint64_t droppedNodes() const { return droppedNodes_; }
  size_t nodeCount() const { return nodes_.size(); }

  // Each node costs a directory of seven files in the tree; short-lived streams add nodes for the
  // exporter's whole life, so the count is capped well above any real graph.
  static constexpr size_t kMaxNodes = 512;

 private:
  struct Counter {
    int64_t value = 0;
    bool dirty = false;
    bool seen = false;  // written at least once: a new counter is written even when it is 0
    void Set(int64_t next) {
      if (next != value || !seen) dirty = true;
      value = next;
      seen = true;
    }
  };
  using NodeCounters = std::map<std::string, Counter>;
  NodeCounters* NodeFor(const std::string& rawName);
  void AddBlock(NodeCounters& node, const BlockTimes& times);

  std::map<std::string, NodeCounters> nodes_;
  uint64_t droppedNodes_ = 0;
};

}  // namespace tavrin::pwexport
