#pragma once

#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/SerialLine.hpp>
#include <qel/protocol/SerialSettings.hpp>

#include <memory>
#include <string>

namespace qel::protocol {

/// The serial line that is a serial port of this machine, such as /dev/ttyS0 or /dev/ttyUSB0.
///
/// start() opens it, which does not wait for a modem, and sets it to raw mode: all 256 byte values pass unchanged in
/// both directions, and no character has a meaning, XON and XOFF included. Modem control lines do not matter (CLOCAL),
/// so the line does not end when the cable is pulled or the peer is switched off; it ends when the device is gone, as
/// an adapter that is unplugged. While it is open, no other program may open it (TIOCEXCL; root may) or lock it
/// (flock(2)). stop() drops what has not been sent, restores the settings of the port and closes it.
///
/// start() throws std::runtime_error when the port cannot be used: "cannot open DEVICE: REASON", "DEVICE is in use by
/// another program", "DEVICE is not a serial port", "DEVICE does not take SETTINGS". endReason() is "the device is
/// gone", or the reason of the system.
///
/// sendBreak() returns at once. The break begins when what was written before has left the system's buffer, within a
/// second, and lasts a quarter of a second (TIOCSBRK); advance() ends it. Input that is written meanwhile waits. A port
/// whose driver has no break returns false.
///
/// @param device  its path, not empty
/// @throws std::invalid_argument  "device: it is empty", "device: it contains a null character";
///         as SerialSettings::parse(), when the settings are none that it returns
QEL_PROTOCOL_EXPORT std::unique_ptr<SerialLine> deviceLine(const std::string& device,
                                                           const SerialSettings& settings = {});

} // namespace qel::protocol
