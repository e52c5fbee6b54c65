#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel ca": a small certificate authority that lives in a directory, and what to look at certificates with.
/// @param action  set when the command line asks for it
CLI::App& addCaCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
