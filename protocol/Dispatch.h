#pragma once

#include <cstdint>
#include <functional>
#include <vector>

#include "protocol/Codec.h"
#include "protocol/RuvoReportingServiceProtocol.h"

namespace tavrin::protocol {

// Hands one reply frame body (not yet framed) to the connection. Called from whatever thread
// runs the reply callback, possibly more than once for one request or never.
using ReplySender = std::function<void(std::vector<uint8_t> body)>;

// Calls the operation of `request` on `service`, giving it reply callbacks that encode each answer
// under the request's call and pass it to `send`: a boolean, service type, dictionary or reporter
// list as status 0; sendMessage's error as status 1 {"domain", "code"}, its success as nil. When
// the call is nil the callbacks send nothing (the operation runs all the same).
void Dispatch(Request request, RuvoReportingServiceProtocol& service, ReplySender send);

}  // namespace tavrin::protocol
