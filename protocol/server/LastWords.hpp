#pragma once

namespace qel::protocol {

/// Ends the sending direction of a connection that is refused, and drops what its peer has sent, as far as it is there.
/// A socket that is closed with unread data resets the connection, and the peer may lose the last message to it. Does
/// not wait: what arrives later resets the connection nevertheless.
/// @param descriptor  of a connected socket; -1: does nothing
void endSending(int descriptor) noexcept;

} // namespace qel::protocol
