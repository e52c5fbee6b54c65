#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>

namespace qel {

/// Opens a TCP socket that accepts connections; Socket::accept() takes them.
///
/// The descriptor does not survive an exec. The address can be taken again at once after an earlier listener on it has
/// ended (SO_REUSEADDR). On an IPv6 address only IPv6 connections come in, whatever the system's default
/// (IPV6_V6ONLY): a program that wants both families opens one listener for each.
/// @param endpoint  where to listen; port 0 lets the system choose a free one, Socket::getSocketName() tells which
/// @param backlog   connections that may wait to be accepted (listen(2))
/// @throws PosixError  "Cannot open socket", "Failed to set socket option", "socket bind failed" or
///                     "Failed to listen on socket"; each is written to the log at Error first
QEL_EXPORT Socket listenOn(const IPEndpoint& endpoint, int backlog);

} // namespace qel
