#pragma once

#include <optional>
#include <string_view>

#include "platform/Clock.h"

namespace tavrin {

// Messages to the service manager over $NOTIFY_SOCKET (Type=notify units). Each call does
// nothing when the service was not started by one.
namespace systemd_notify {

// READY=1 with a first STATUS= line.
void Ready(std::string_view status);
// STATUS=: one line a person reads in `systemctl status`.
void Status(std::string_view status);
// WATCHDOG=1.
void WatchdogPing();
// EXTEND_TIMEOUT_USEC=: the stop takes up to `more` longer than the unit's timeout allows.
void ExtendTimeout(Duration more);
// The unit's WatchdogSec for this process, or nothing when it has none.
std::optional<Duration> WatchdogInterval();

}  // namespace systemd_notify
}  // namespace tavrin
