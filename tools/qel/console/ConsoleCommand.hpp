#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>

namespace qel::tool {

/// "qel console": joins the serial console of a partition to the terminal, or to whatever standard input and output
/// are.
CLI::App& addConsoleCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
