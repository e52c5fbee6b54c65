#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>

namespace qel::tool {

/// Adds "qel list": prints the partitions of the user's profiles, and who is on where that is known.
/// @param action  set when the command line asks for it
CLI::App& addListCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
