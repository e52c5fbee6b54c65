#pragma once

#include <qel/protocol/CommandLine.hpp>
#include <qel/protocol/PartitionOptions.hpp>
#include <qel/protocol/SerialLine.hpp>

#include "base/Library.hpp"
#include "lines/TelnetLine.hpp"

#include <memory>
#include <string>

namespace qel::tool {

/// A line, and how a partition with such a line is served by default.
struct MadeLine {
    std::unique_ptr<SerialLine> line;
    PartitionOptions options; ///< keepsSession is set for all lines but commands
};

/// Makes the line that a text names:
///
///     pty:COMMAND                    a shell command on a pseudo-terminal; so is any text without one of these words
///     unix:PATH                      the stream socket at a path
///     tcp:HOST:PORT                  a TCP connection
///     telnet:HOST:PORT[,SETTINGS]    a TCP connection with the telnet protocol
///     tty:DEVICE[,SETTINGS]          a serial port; SETTINGS as SerialSettings::parse() takes them
///
/// Making a line connects to nothing and opens nothing.
/// @param command  for lines that are commands
/// @param telnet   makes telnet lines
/// @throws std::invalid_argument  "line "TEXT": REASON"
MadeLine makeLine(const std::string& text, const CommandLineOptions& command = {}, TelnetFactory telnet = telnetLine);

} // namespace qel::tool
