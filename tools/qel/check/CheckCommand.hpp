#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel check": tries the rules of the protocol on a peer, one by one.
/// @param action  set when the command line asks for it
CLI::App& addCheckCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
