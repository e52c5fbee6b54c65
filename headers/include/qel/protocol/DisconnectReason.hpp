#pragma once

namespace qel::protocol {

/// Why the connection of a console has ended.
enum class DisconnectReason {
    Closed,   ///< the console has closed it, between two messages
    Lost,     ///< it broke: within a message, by a reset, or while something was sent
    Protocol, ///< the console broke the protocol: a malformed frame, or a request for TLS where none is done
    Timeout,  ///< the console did not finish a message in time
    Idle,     ///< the console has said nothing for ServerOptions::idleTimeout
    Shutdown, ///< the server has finished
    Failure   ///< the server could not go on with it, for want of memory or because of an error of its own
};

} // namespace qel::protocol
