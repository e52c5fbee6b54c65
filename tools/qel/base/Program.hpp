#pragma once

#include "base/ExitStatus.hpp"

#include <CLI/CLI.hpp>
#include <functional>

namespace qel::tool {

/// What the command line asked for. Parsing only chooses it; it runs once the whole line has been understood.
using Action = std::function<ExitStatus()>;

/// Gives an app the options that stand at every level: --help (-h) and --version.
void addStandardFlags(CLI::App& app);

/// Adds --json.
void addJsonOption(CLI::App& app, bool& json);

/// Adds a subcommand with the standard flags.
/// @return the subcommand, owned by `parent`
CLI::App& addCommand(CLI::App& parent, const char* name, const char* description);

/// Parses the command line, runs the chosen action, and reports failures on standard error as "qel: reason".
/// @param action  where the subcommands of `app` leave what is to run
/// @return the exit status of the process
int runProgram(CLI::App& app, Action& action, int argc, const char* const* argv) noexcept;

/// Sees to it that a standard descriptor which was closed when this process was started does not become the number of
/// something else: a connection would otherwise be read as standard input, or take what was meant for a person.
/// runProgram() begins with it.
void reserveStandardDescriptors() noexcept;

/// Makes sure that what went to standard output has left the process.
/// @throws CommandFailure  Failed: it could not be written
void flushOutput();

} // namespace qel::tool
