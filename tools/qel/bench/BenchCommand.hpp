#pragma once

#include "base/Program.hpp"

namespace qel::tool {

/// Adds "qel bench".
CLI::App& addBenchCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
