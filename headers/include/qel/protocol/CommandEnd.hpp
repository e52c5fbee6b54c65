#pragma once

#include <qel/protocol/ProtocolExport.hpp>

#include <cstdint>
#include <string>

namespace qel::protocol {

/// How the command of a partition ended. The session-closed notice carries it in the status detail of its header.
struct CommandEnd {
    /// The values go over the wire, in the high byte of the status detail.
    enum class Kind : std::uint8_t {
        Unknown = 0,        ///< not reported, or a kind that this version does not know
        Exited = 1,         ///< by itself; `number` is its exit status
        Killed = 2,         ///< by a signal; `number` is the signal
        ClosedTerminal = 3, ///< it closed its terminal and went on running; `number` is 0
    };

    Kind kind = Kind::Unknown;
    std::uint8_t number = 0;
};

/// @return the kind in the high byte, the number in the low byte; 0 when the kind is Unknown
QEL_PROTOCOL_EXPORT std::uint16_t toStatusDetail(const CommandEnd& end) noexcept;

/// The inverse of toStatusDetail(); Unknown for a value that it never returns.
QEL_PROTOCOL_EXPORT CommandEnd commandEndFrom(std::uint16_t statusDetail) noexcept;

/// "the command exited with status 3", "the command was killed by signal 9 (Killed)", "the command closed its
/// terminal", or, when that is all there is to say, "the command ended".
QEL_PROTOCOL_EXPORT std::string describe(const CommandEnd& end);

} // namespace qel::protocol
