#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>
#include <string>

namespace qel {

/// A failed OpenSSL call, or a text or certificate that cannot be used.
///
/// The text is the place of the failure, "An SSL error occurred at common/security/SSLContext.cpp:42", or a fixed
/// phrase. OpenSSL's own reasons are in the log: its error queue is drained there before the exception is thrown.
/// Thread safety: that of std::runtime_error.
class QEL_EXPORT SSLException : public std::runtime_error {
public:
    /// @param message  the text of the exception
    explicit SSLException(const std::string& message);

    /// The text is "An SSL error occurred at ", the file, ":" and the line in decimal.
    /// @param file  the source file of the check that failed, as the build records it; not null
    /// @param line  its line
    SSLException(const char* file, int line);

    ~SSLException() override;

    /// Empties OpenSSL's error queue of the calling thread. Never throws.
    ///
    /// Logs every entry at Error, the oldest first: "[libssl] ", OpenSSL's source file, ":", the line in decimal, ": "
    /// and the text of ERR_error_string(3). Removes the entries also when that level is disabled.
    ///
    /// Call it before each TLS operation as well as after a failed one: with a stale entry in the queue,
    /// SSL_get_error(3) reports a failure that did not happen.
    ///
    /// Thread safety: each thread has its own queue; this accesses no other.
    static void flushErrorQueue();
};

} // namespace qel
