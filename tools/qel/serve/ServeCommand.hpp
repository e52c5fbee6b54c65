#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel serve": the hypervisor end, which serves consoles until it is told to stop.
/// @param action  set when the command line asks for it
CLI::App& addServeCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
