#pragma once

#include <cstddef>
#include <string>

#include "base/Dictionary.h"

namespace tavrin {

// The status map (op 12) as metrics text for node_exporter's textfile collector and anything else
// that scrapes Prometheus metrics: the Prometheus text format, whose parsers (promtool's among
// them) want a counter's HELP and TYPE under its full "_total" name, ended by the "# EOF" that
// OpenMetrics parsers want and the others read as a comment. Names start with "tavrin_". Per-client
// series are kept for the `maxClients` clients with the most messages received; the others are
// summed under name="(other)", so the number of series stays bounded whoever connects.
std::string MetricsText(const Dictionary& status, size_t maxClients = 32);

}  // namespace tavrin
