#pragma once

#include <cstddef>
#include <vector>

#include "ProfilerCounters.h"

struct spa_pod;

namespace tavrin::pwexport {

// Decodes one "profile" event of PipeWire's profiler interface (module-profiler, version 3):
// a Struct of Objects of type Profiler, one per driver cycle, each with the properties
//   info          Struct(Long counter, Float load fast, Float load medium, Float load slow,
//                        Int xrun count)
//   driverBlock   Struct(Int id, String name, Long prev_signal, Long signal, Long awake,
//                        Long finish, Int status, Fraction latency)
//   followerBlock the same shape, once per follower
// (clock and unknown properties are ignored). Fields past those listed are ignored and trailing
// fields may be missing (latency arrived late in PipeWire's history); a block whose listed
// fields up to status are missing or of the wrong type is left out, as is an object without a
// valid driver block. Never reads outside the pod: every size is checked.
std::vector<ProfileCycle> ParseProfile(const spa_pod* pod);

// The same over raw bytes that should hold one pod (for tests and fuzzing): nothing when the
// bytes are too short or the pod's size does not fit them. `data` must be 8-byte aligned.
std::vector<ProfileCycle> ParseProfileBytes(const void* data, size_t size);

}  // namespace tavrin::pwexport
