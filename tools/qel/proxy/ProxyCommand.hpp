#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>

namespace qel::tool {

/// Adds "qel proxy": shows what two peers say to each other, and disturbs it by rules.
CLI::App& addProxyCommand(CLI::App& parent, Action& action);

} // namespace qel::tool
