#pragma once

#include <cstddef>
#include <string>

#include "base/Dictionary.h"

namespace tavrin {

// The status map (op 12) in the OpenMetrics text format, for node_exporter's textfile collector
// and anything else that scrapes Prometheus metrics. Names start with "tavrin_". Per-client
// series are kept for the `maxClients` clients with the most messages received; the others are
// summed under name="(other)", so the number of series stays bounded whoever connects.
std::string MetricsText(const Dictionary& status, size_t maxClients = 32);

}  // namespace tavrin
