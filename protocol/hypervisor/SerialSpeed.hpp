#pragma once

#include <cstdint>
#include <optional>
#include <termios.h>

namespace qel::protocol {

/// The code of a speed in a termios(3), for cfsetspeed().
/// @param speed  bits per second @return nothing: serial ports do not have this speed
std::optional<speed_t> toSpeedCode(std::uint32_t speed);

} // namespace qel::protocol
