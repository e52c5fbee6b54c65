#pragma once

#include "base/ExitStatus.hpp"

#include <CLI/CLI.hpp>
#include <functional>

namespace qel::tool {

/// What the command line asks for. Parsing only selects it; it runs after the whole command line has been parsed.
using Action = std::function<ExitStatus()>;

/// Adds the options of every level: --help (-h) and --version.
void addStandardFlags(CLI::App& app);

/// Adds --json.
void addJsonOption(CLI::App& app, bool& json);

/// Adds a subcommand with the standard flags.
/// @return the subcommand, owned by `parent`
CLI::App& addCommand(CLI::App& parent, const char* name, const char* description);

/// Adds the subcommands to the command line.
/// @param action  set by the subcommands during parsing
using AddCommands = void (*)(CLI::App& app, Action& action);

/// Builds and parses the command line, runs the chosen action, and reports failures on standard error as "qel: reason".
/// A want of memory is reported too, at whatever step it occurs.
/// @return the exit status of the process
int runProgram(AddCommands addCommands, int argc, const char* const* argv) noexcept;

/// Opens /dev/null for each standard descriptor that was closed when this process started. Otherwise a socket could get
/// its number, and be read as standard input or receive messages for the user. runProgram() calls it first.
void reserveStandardDescriptors() noexcept;

/// Flushes standard output.
/// @throws CommandFailure  Failed: writing failed
void flushOutput();

} // namespace qel::tool
