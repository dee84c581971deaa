#include "ProfilerPod.h"

#include <spa/param/profiler.h>
#include <spa/pod/iter.h>
#include <spa/pod/parser.h>
#include <spa/utils/type.h>

#include <optional>

namespace tavrin::pwexport {
namespace {

// Info: Struct(Long counter, Float fast, Float medium, Float slow, Int xrun count).
std::optional<int64_t> ParseXruns(const spa_pod* value) {
  spa_pod_parser parser;
  spa_pod_parser_pod(&parser, value);
  spa_pod_frame frame;
  if (spa_pod_parser_push_struct(&parser, &frame) < 0) return std::nullopt;
  int64_t counter = 0;
  float load = 0;
  int32_t xruns = 0;
  if (spa_pod_parser_get_long(&parser, &counter) < 0) return std::nullopt;
  for (int i = 0; i < 3; ++i) {
    if (spa_pod_parser_get_float(&parser, &load) < 0) return std::nullopt;
  }
  if (spa_pod_parser_get_int(&parser, &xruns) < 0) return std::nullopt;
  return xruns;
}

// Driver and follower blocks share one shape.
std::optional<ProfileNode> ParseBlock(const spa_pod* value) {
  spa_pod_parser parser;
  spa_pod_parser_pod(&parser, value);
  spa_pod_frame frame;
  if (spa_pod_parser_push_struct(&parser, &frame) < 0) return std::nullopt;
  ProfileNode node;
  const char* name = nullptr;
  BlockTimes& t = node.times;
  if (spa_pod_parser_get_int(&parser, &node.id) < 0 ||
      spa_pod_parser_get_string(&parser, &name) < 0 ||
      spa_pod_parser_get_long(&parser, &t.prevSignal) < 0 ||
      spa_pod_parser_get_long(&parser, &t.signal) < 0 ||
      spa_pod_parser_get_long(&parser, &t.awake) < 0 ||
      spa_pod_parser_get_long(&parser, &t.finish) < 0 ||
      spa_pod_parser_get_int(&parser, &t.status) < 0) {
    return std::nullopt;
  }
  node.name = name != nullptr ? name : "";
  return node;
}

std::optional<ProfileCycle> ParseCycle(const spa_pod* pod) {
  if (!spa_pod_is_object_type(pod, SPA_TYPE_OBJECT_Profiler)) return std::nullopt;
  const auto* object = reinterpret_cast<const spa_pod_object*>(pod);
  ProfileCycle cycle;
  for (const spa_pod_prop* prop = spa_pod_prop_first(&object->body);
       spa_pod_prop_is_inside(&object->body, object->pod.size, prop);
       prop = spa_pod_prop_next(prop)) {
    switch (prop->key) {
      case SPA_PROFILER_info:
        cycle.xrunCount = ParseXruns(&prop->value);
        break;
      case SPA_PROFILER_driverBlock:
        cycle.driver = ParseBlock(&prop->value);
        break;
      case SPA_PROFILER_followerBlock:
        if (auto follower = ParseBlock(&prop->value)) cycle.followers.push_back(*follower);
        break;
      default:
        break;
    }
  }
  if (!cycle.driver) return std::nullopt;
  return cycle;
}

}  // namespace

std::vector<ProfileCycle> ParseProfile(const spa_pod* pod) {
  std::vector<ProfileCycle> cycles;
  if (pod == nullptr) return cycles;
  spa_pod_parser parser;
  spa_pod_parser_pod(&parser, pod);
  spa_pod_frame frame;
  if (spa_pod_parser_push_struct(&parser, &frame) < 0) return cycles;
  // spa_pod_parser_next checks each child's size against the struct's.
  while (const spa_pod* child = spa_pod_parser_next(&parser)) {
    if (auto cycle = ParseCycle(child)) cycles.push_back(std::move(*cycle));
  }
  return cycles;
}

std::vector<ProfileCycle> ParseProfileBytes(const void* data, size_t size) {
  if (data == nullptr || size < sizeof(spa_pod)) return {};
  const auto* pod = static_cast<const spa_pod*>(data);
  if (uint64_t(SPA_POD_SIZE(pod)) > size) return {};
  return ParseProfile(pod);
}

}  // namespace tavrin::pwexport
