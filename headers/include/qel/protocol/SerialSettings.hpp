#pragma once

#include <qel/protocol/ProtocolExport.hpp>

#include <cstdint>
#include <string>

namespace qel::protocol {

/// Speed, format and flow control of a serial port. A plain value.
struct QEL_PROTOCOL_EXPORT SerialSettings {
    enum class Parity { None, Odd, Even };

    /// Reads a text such as "115200n8": speed, parity (n, e or o), data bits (5 to 8) and, optionally, stop bits (1 or
    /// 2; 1 by default), as in "9600e72". The parts after the speed may be left out together: "9600" is "9600n8".
    /// ",rtscts" at the end adds hardware flow control. Letters may be upper case.
    /// @throws std::invalid_argument  "settings: ..." says what is wrong: not of this form, or a speed that serial
    /// ports
    ///         do not have, which are those of termios(3) from 50 to 4000000
    static SerialSettings parse(const std::string& text);

    /// The text that parse() takes; stop bits only when they are 2.
    std::string str() const;

    std::uint32_t speed = 115200; ///< bits per second
    Parity parity = Parity::None;
    std::uint8_t dataBits = 8;
    std::uint8_t stopBits = 1;
    bool hardwareFlowControl = false; ///< by RTS and CTS
};

} // namespace qel::protocol
