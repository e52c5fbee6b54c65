#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>

namespace qel {

/// Opens a TCP socket that accepts connections; Socket::accept() takes them.
///
/// The descriptor is close-on-exec. SO_REUSEADDR is set, so an address can be bound again right after an earlier
/// listener on it has ended. On an IPv6 address IPV6_V6ONLY is set, whatever the system's default: a program that
/// serves both families opens one listener for each.
/// Thread safety: any thread.
/// @param endpoint  port 0 lets the system choose a free port; Socket::getSocketName() returns it
/// @param backlog   connections that may wait to be accepted (listen(2))
/// @return the listening socket, owned by the caller
/// @throws PosixError  "Cannot open socket", "Failed to set socket option", "socket bind failed" or
///                     "Failed to listen on socket"; each is written to the log at Error first
QEL_EXPORT Socket listenOn(const IPEndpoint& endpoint, int backlog);

} // namespace qel
