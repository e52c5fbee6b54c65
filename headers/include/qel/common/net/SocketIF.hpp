#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/util/Poll.hpp>

#include <cstddef>
#include <sys/types.h>

namespace qel {

/// What a stream needs of a socket: readiness, shutting down, and the two transfers with the results of the system.
/// Thread safety: one reader and one writer at a time.
class QEL_EXPORT SocketIF {
public:
    virtual ~SocketIF();

    /// @return the entry for a PollSet; borrows the descriptor of this object
    virtual PollFd getPollFd(PollEvents events) const = 0;

    /// Ends both directions of the connection: a blocked read returns 0, a later write fails. The descriptor stays
    /// open. Never fails.
    virtual void shutdown() = 0;

    /// @param buffer  takes up to length bytes
    /// @return the bytes read, at least 1; 0 at the end of the stream (or for length 0); negative with errno set
    virtual ssize_t read(char* buffer, std::size_t length) = 0;

    /// @param buffer  length bytes; borrowed for the call
    /// @return the bytes written, which may be fewer than length; negative with errno set. Never raises SIGPIPE.
    virtual ssize_t write(const char* buffer, std::size_t length) = 0;

protected:
    SocketIF() = default;
    SocketIF(const SocketIF&) = default;
    SocketIF& operator=(const SocketIF&) = default;
};

} // namespace qel
