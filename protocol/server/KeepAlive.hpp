#pragma once

#include <qel/common/net/Socket.hpp>

#include <chrono>

namespace qel::protocol {

/// Makes TCP find out whether an idle peer is still there, and end the connection when it has not answered for a time.
/// While data waits for the peer there are no such probes: it has the system's retransmission limits to acknowledge it,
/// which is minutes, and any time to read it.
/// @param time  at least a second; TCP counts in seconds, so a second more may pass
/// @throws PosixError  the socket cannot be changed
void setKeepAlive(const Socket& socket, std::chrono::seconds time);

} // namespace qel::protocol
