#pragma once

#include <qel/protocol/SerialLine.hpp>
#include <qel/protocol/SerialSettings.hpp>

#include "base/Library.hpp"

#include <memory>
#include <optional>

namespace qel::tool {

/// Makes the serial line behind a telnet connection, such as a port of a terminal server.
///
/// All 256 byte values pass in both directions, if the peer agrees to binary transmission (RFC 856), which is asked
/// for, as is no go-ahead (RFC 858). The peer may echo; this side never does. Speed, format and flow control are set if
/// the peer takes them (RFC 2217); a line at Warn says when it does not. A break is that of RFC 2217, a quarter of a
/// second long, or else telnet's own.
///
/// The line ends when the peer breaks the protocol: when it compresses its data without agreement, sends a
/// malformed subnegotiation or one of more than 16 KiB, or makes this side answer without reading the answers.
///
/// @param connection  carries the bytes of the protocol; not null
/// @param settings    of the peer's serial port; none: it keeps its own
/// @return null: this build has no telnet lines
std::unique_ptr<SerialLine> telnetLine(std::unique_ptr<SerialLine> connection, std::optional<SerialSettings> settings);

using TelnetFactory = std::unique_ptr<SerialLine> (*)(std::unique_ptr<SerialLine>, std::optional<SerialSettings>);

} // namespace qel::tool
