#pragma once

#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/SerialLine.hpp>

#include <memory>
#include <string>
#include <vector>

namespace qel::protocol {

/// Options of commandLine().
struct CommandLineOptions {
    std::string term = "vt220"; ///< terminal type of the command: its TERM
    /// More variables for the command, one "NAME=value" each. They replace those of the same name.
    std::vector<std::string> environment;
};

/// The serial line of a partition whose command runs on this machine, on a pseudo-terminal of 24 rows by 80 columns.
///
/// The line runs "/bin/sh -c COMMAND" when a console opens the partition's session, in a session (see setsid(2)) of its
/// own, with default signals. The command's environment does not depend on that of this process: HOME, USER and SHELL
/// are those of the account, PATH and LANG are fixed, QEL_PARTITION is the partition's id in decimal.
///
/// stop() hangs up: the command gets SIGHUP, and SIGKILL if it has not ended a second later. While commands are ending,
/// one thread for all lines of the process waits for them. The destructor of the last line waits until they have ended.
/// SIGCHLD must not be ignored, or it is unknown how commands end.
///
/// @param command  a shell command
/// @throws std::invalid_argument  "command": it is empty; "environment": an entry has no name or no "="; either:
///         it contains a null character. Or "term": it is empty or contains a null character
QEL_PROTOCOL_EXPORT std::unique_ptr<SerialLine> commandLine(std::string command,
                                                            const CommandLineOptions& options = {});

} // namespace qel::protocol
