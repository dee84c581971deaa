#pragma once

#include <cstdint>

namespace tavrin {

// Kernel trace point codes fired by the service.
namespace trace {
inline constexpr uint32_t kClientCreate = 0x21042814;
inline constexpr uint32_t kClientStart = 0x21042818;
inline constexpr uint32_t kClientStop = 0x2104281C;
inline constexpr uint32_t kClientDestroy = 0x21042820;
inline constexpr uint32_t kClientSend = 0x21042824;
inline constexpr uint32_t kSessionCreated = 0x21042828;
inline constexpr uint32_t kSessionStarted = 0x2104282C;
inline constexpr uint32_t kSessionStopped = 0x21042830;
inline constexpr uint32_t kSessionReleased = 0x21042834;
inline constexpr uint32_t kMessageSent = 0x21042838;
}  // namespace trace

// Fires trace point `code` with four zero arguments. Always cheap: a disabled probe costs a no-op
// instruction, and the recorder hook is one atomic load.
void EmitTracePoint(uint32_t code);

// Sees every code fired while installed; tests install one to check which trace points fired.
class TraceRecorder {
 public:
  virtual ~TraceRecorder() = default;
  // Called on the thread that fired the trace point; must be thread-safe.
  virtual void Record(uint32_t code) = 0;
};

// Installs `recorder` (nullptr removes it) and returns the previous one.
TraceRecorder* InstallTraceRecorder(TraceRecorder* recorder);

}  // namespace tavrin
