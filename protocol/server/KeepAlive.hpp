#pragma once

#include <qel/common/net/Socket.hpp>

#include <chrono>

namespace qel::protocol {

/// Makes TCP find out whether an idle peer is still there, and end the connection when it has not answered for a time.
/// Sent data that is not acknowledged for that time ends it too.
/// @param time  at least a second; TCP counts in seconds, so a second more may pass
/// @throws PosixError  the socket cannot be changed
void setKeepAlive(const Socket& socket, std::chrono::seconds time);

} // namespace qel::protocol
