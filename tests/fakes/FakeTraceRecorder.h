#pragma once

#include <algorithm>
#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/TracePoints.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Sees every trace point fired while it lives.
class RecordingTraceRecorder final : public TraceRecorder, private GuardedState {
 public:
  RecordingTraceRecorder() : previous_(InstallTraceRecorder(this)) {}
  ~RecordingTraceRecorder() override { InstallTraceRecorder(previous_); }

  void Record(uint32_t code) override {
    WithLock([&] { codes_.push_back(code); });
  }
  size_t Count(uint32_t code) const {
    return WithLock([&] { return static_cast<size_t>(std::ranges::count(codes_, code)); });
  }

 private:
  std::vector<uint32_t> codes_;
  TraceRecorder* previous_;
};

}  // namespace tavrin::testing
