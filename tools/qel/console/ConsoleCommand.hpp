#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>

namespace qel::tool {

/// Adds "qel console": connects standard input and output to the serial console of a partition.
/// @param action  set when the command line asks for it
CLI::App& addConsoleCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
