#include "platform/TracePoints.h"

#include <sys/sdt.h>

#include <atomic>

namespace tavrin {
namespace {
std::atomic<TraceRecorder*> recorder{nullptr};
}  // namespace

void EmitTracePoint(uint32_t code) {
  // USDT probe tavrin:trace with the code and four zero arguments, as the kernel trace points of
  // other platforms carry them. `perf probe` / bpftrace attach to it by name.
  DTRACE_PROBE5(tavrin, trace, code, 0, 0, 0, 0);
  if (TraceRecorder* current = recorder.load(std::memory_order_acquire)) {
    current->Record(code);
  }
}

TraceRecorder* InstallTraceRecorder(TraceRecorder* next) {
  return recorder.exchange(next, std::memory_order_acq_rel);
}

}  // namespace tavrin
