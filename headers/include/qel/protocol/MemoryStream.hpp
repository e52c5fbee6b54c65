#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <cstddef>
#include <memory>
#include <utility>

namespace qel::protocol {

/// Makes a connection inside this process: two streams, each of which reads what the other writes. With it a console
/// and a server meet without sockets, for example in a test; TLS works over it as over any stream.
///
/// A write waits while the peer has `capacity` unread bytes. Both streams have deadlines; one that passes throws
/// StreamIOException("I/O deadline"), and the stream can be used further. close() works like the shutdown of a socket:
/// this side reads what has already arrived and then 0, and its writes throw StreamIOException("EOF"); the peer reads
/// what has been sent and then 0, and its writes throw as well. Destroying a stream closes it.
///
/// A console sends over such a stream when it has room for a whole message with its TLS, 17408 bytes, or is empty; with
/// a smaller capacity both sides can block each other.
///
/// Ownership: each stream is owned by the caller and may outlive the other.
/// Thread safety: for each stream one reader and one writer thread, as for every Stream; close() from any thread.
/// @param capacity  bytes that may be on their way in each direction; more than 0
/// @throws std::invalid_argument  "capacity"
QEL_PROTOCOL_EXPORT std::pair<std::unique_ptr<Stream>, std::unique_ptr<Stream>>
makeMemoryStreams(std::size_t capacity = 65536);

} // namespace qel::protocol
