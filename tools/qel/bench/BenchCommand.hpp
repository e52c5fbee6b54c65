#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel bench": puts load on a server and reports throughput and latency.
/// @param action  set when the command line asks for it
CLI::App& addBenchCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
