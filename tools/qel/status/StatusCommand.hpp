#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel status", which asks a server on this machine what it does, and closes sessions and sends breaks for an
/// operator.
/// @param action  set when the command line asks for it
CLI::App& addStatusCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
