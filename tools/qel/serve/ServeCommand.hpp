#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel serve", which runs the hypervisor end until a signal stops it.
/// @param action  set when the command line asks for it
CLI::App& addServeCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
