#include "platform/linux/process/SystemdNotify.h"

#include <systemd/sd-daemon.h>

#include <chrono>
#include <string>

namespace tavrin::systemd_notify {

void Ready(std::string_view status) {
  sd_notify(0, ("READY=1\nSTATUS=" + std::string(status)).c_str());
}

void Status(std::string_view status) { sd_notify(0, ("STATUS=" + std::string(status)).c_str()); }

void WatchdogPing() { sd_notify(0, "WATCHDOG=1"); }

void ExtendTimeout(Duration more) {
  const auto usec = std::chrono::duration_cast<std::chrono::microseconds>(more).count();
  sd_notify(0, ("EXTEND_TIMEOUT_USEC=" + std::to_string(usec)).c_str());
}

std::optional<Duration> WatchdogInterval() {
  uint64_t usec = 0;
  if (sd_watchdog_enabled(0, &usec) <= 0 || usec == 0) return std::nullopt;
  return std::chrono::duration_cast<Duration>(std::chrono::microseconds(usec));
}

}  // namespace tavrin::systemd_notify
