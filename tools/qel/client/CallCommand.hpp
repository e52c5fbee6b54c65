#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel call": sends one request to a server and prints the response.
/// @param action  set when the command line asks for it
CLI::App& addCallCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
