#pragma once

#include <memory>
#include <string>

#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"

namespace tavrin {

// Makes the registry named by the `--orientation` value:
//   "none"       NoOrientationRegistry
//   "iio"        IioOrientationRegistry (iio-sensor-proxy on the system bus)
//   "feed:PATH"  FeedOrientationRegistry reading the FIFO at PATH
// Anything else (including an empty PATH) gives nullptr and a one-line reason in `*error`. A feed
// whose FIFO cannot be set up and an absent system bus are not errors here: those registries log
// and carry on, so the service runs without orientation rather than not at all.
std::unique_ptr<OrientationRegistry> MakeOrientationRegistry(const std::string& source,
                                                             LogHandle log, std::string* error);

}  // namespace tavrin
