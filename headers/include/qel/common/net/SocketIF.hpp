#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/util/Poll.hpp>

#include <cstddef>
#include <sys/types.h>

namespace qel {

/// The operations of a socket that a stream uses. Socket implements them; a substitute may stand in for it.
/// Implementations report errors as read(2) and send(2) do and throw nothing.
/// Thread safety: one reader and one writer at a time; shutdown() may be called from any thread while they wait.
class QEL_EXPORT SocketIF {
public:
    virtual ~SocketIF();

    /// @return the entry for a PollSet; it borrows the descriptor and must not be used after this object is destroyed
    virtual PollFd getPollFd(PollEvents events) const = 0;

    /// Ends both directions of the connection: a blocked read returns 0, and later writes fail. The descriptor stays
    /// open. An error of the system, such as that of a socket without a connection, is ignored.
    virtual void shutdown() = 0;

    /// @param buffer  room for length bytes; borrowed for the call
    /// @return the number of bytes read; 0 at end of stream and for length 0; negative on an error, with errno set
    virtual ssize_t read(char* buffer, std::size_t length) = 0;

    /// Raises no SIGPIPE: writing to a connection that the peer has closed fails with EPIPE.
    /// @param buffer  length bytes; borrowed for the call
    /// @return the number of bytes written, which may be fewer than length; negative on an error, with errno set
    virtual ssize_t write(const char* buffer, std::size_t length) = 0;

protected:
    SocketIF() = default;
    SocketIF(const SocketIF&) = default;
    SocketIF& operator=(const SocketIF&) = default;
};

} // namespace qel
