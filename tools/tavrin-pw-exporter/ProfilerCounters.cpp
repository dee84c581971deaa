#include "ProfilerCounters.h"

#include <algorithm>

#include "CounterWriter.h"

namespace tavrin::pwexport {
namespace {

// Sums saturate instead of wrapping: a counter that stops growing is readable, a negative one
// would look like a reset to every reader.
int64_t SaturatingAdd(int64_t a, int64_t b) {
  int64_t sum = 0;
  return __builtin_add_overflow(a, b, &sum) ? INT64_MAX : sum;
}

}  // namespace

ProfilerCounters::NodeCounters* ProfilerCounters::NodeFor(const std::string& rawName) {
  const std::string name = CounterWriter::SanitizeName(rawName);
  const auto it = nodes_.find(name);
  if (it != nodes_.end()) return &it->second;
  if (nodes_.size() >= kMaxNodes) {
    ++droppedNodes_;
    return nullptr;
  }
  return &nodes_[name];
}

void ProfilerCounters::AddBlock(NodeCounters& node, const BlockTimes& times) {
  auto& cycles = node["cycles"];
  cycles.Set(SaturatingAdd(cycles.value, 1));
  auto& incomplete = node["incomplete_cycles"];
  auto& wakeupTotal = node["wakeup_ns_total"];
  auto& wakeupMax = node["wakeup_ns_max"];
  auto& busyTotal = node["busy_ns_total"];
  auto& busyMax = node["busy_ns_max"];
  const bool complete =
      times.signal > 0 && times.awake >= times.signal && times.finish >= times.awake;
  if (!complete) {
    incomplete.Set(SaturatingAdd(incomplete.value, 1));
    for (Counter* counter : {&wakeupTotal, &wakeupMax, &busyTotal, &busyMax}) {
      counter->Set(counter->value);  // present from the first cycle on, even if all incomplete
    }
    return;
  }
  incomplete.Set(incomplete.value);
  const int64_t wakeup = times.awake - times.signal;
  const int64_t busy = times.finish - times.awake;
  wakeupTotal.Set(SaturatingAdd(wakeupTotal.value, wakeup));
  wakeupMax.Set(std::max(wakeupMax.value, wakeup));
  busyTotal.Set(SaturatingAdd(busyTotal.value, busy));
  busyMax.Set(std::max(busyMax.value, busy));
}

void ProfilerCounters::Add(const ProfileCycle& cycle) {
  if (cycle.driver) {
    if (NodeCounters* node = NodeFor(cycle.driver->name)) {
      AddBlock(*node, cycle.driver->times);
      if (cycle.xrunCount) (*node)["xruns"].Set(*cycle.xrunCount);
    }
  }
  for (const auto& follower : cycle.followers) {
    if (NodeCounters* node = NodeFor(follower.name)) AddBlock(*node, follower.times);
  }
}

std::vector<CounterUpdate> ProfilerCounters::TakeChanged() {
  std::vector<CounterUpdate> changed;
  for (auto& [node, counters] : nodes_) {
    for (auto& [name, counter] : counters) {
      if (!counter.dirty) continue;
      counter.dirty = false;
      changed.push_back({node, name, counter.value});
    }
  }
  return changed;
}

}  // namespace tavrin::pwexport
