#pragma once

#include "status/StatusReport.hpp"

#include <ostream>

namespace qel::tool {

/// Prints a report as metrics in the text exposition format, version 0.0.4, which Prometheus reads. docs/serve.md lists
/// them.
void printMetrics(std::ostream& os, const StatusReport& report);

} // namespace qel::tool
