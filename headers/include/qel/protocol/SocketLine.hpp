#pragma once

#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/SerialLine.hpp>

#include <memory>
#include <string>

/// @file
/// Serial lines that are stream sockets: the serial port of a virtual machine, a port of a terminal server. They carry
/// all 256 byte values unchanged in both directions.
///
/// start() returns at once, whether or not the peer is there, and advance() connects. It throws std::runtime_error when
/// that fails, and endReason() is the same text:
/// - "cannot connect to PEER: REASON", such as "Connection refused"; after 10 s "timed out". A name with several
///   addresses gives each an equal share of that time, and the reason is that of the last one;
/// - "cannot resolve the name HOST: REASON", such as "Name or service not known"; after 10 s "timed out".
///
/// When the peer ends the connection or it breaks, all that the peer has sent is read, and then read() reports Ended;
/// endReason() is "the peer has closed the connection" or the reason of the system, such as "Connection reset by peer".
/// write() on a connection that has broken throws nothing: it drops the bytes, and reading ends. After the end, start()
/// connects anew; what the line has taken and the peer has not is lost.
///
/// The lines need no thread but for the look-up of a name (getaddrinfo(3)): at most one for each line. It ends by
/// itself when the resolver has answered, and neither stop() nor the destructor waits for it.

namespace qel::protocol {

/// The serial line that is the stream socket at a path of this machine, such as that of a virtual machine.
/// @param path  1 to 107 bytes, without a null character; a relative one counts from the working directory of start()
/// @throws std::invalid_argument  "path: it is empty", "path: it is longer than 107 bytes", "path: it contains a null
///         character"
QEL_PROTOCOL_EXPORT std::unique_ptr<SerialLine> unixLine(const std::string& path);

/// The serial line that is a TCP connection to a host, by name or by IP address: its bytes are those of the line, as a
/// terminal server sends them on a raw port. A peer that is gone without a word is noticed within about a minute.
/// @param address  as ServerAddress::parse() takes it: "terminals.example:4001", "192.0.2.7:4001" or "[::1]:4001". All
///         addresses of a name are tried in turn, and looked up again for each connection; an answer that comes after
///         its 10 s serves the next one
/// @throws std::invalid_argument  as ServerAddress::parse()
QEL_PROTOCOL_EXPORT std::unique_ptr<SerialLine> tcpLine(const std::string& address);

} // namespace qel::protocol
