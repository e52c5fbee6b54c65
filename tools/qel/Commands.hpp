#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds all subcommands of the program, in the order in which --help lists them.
/// @param action  set by the subcommands during parsing
void addCommands(CLI::App& app, Action& action);

} // namespace qel::tool
