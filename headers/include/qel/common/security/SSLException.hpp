#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>
#include <string>

namespace qel {

/// OpenSSL could not do what it was asked to.
///
/// The text says where the library noticed, "An SSL error occurred at common/security/SSLContext.cpp:42", or, for
/// texts and certificates that cannot be used, what is wrong with them in a fixed phrase. OpenSSL's own reasons are in
/// the log: its error queue is drained there before the exception is thrown.
class QEL_EXPORT SSLException : public std::runtime_error {
public:
    /// @param message  the text of the exception
    explicit SSLException(const std::string& message);

    /// The text is "An SSL error occurred at ", the file, ":" and the line in decimal.
    /// @param file  the source file of the check that failed, as the build records it; not null
    /// @param line  its line
    SSLException(const char* file, int line);

    ~SSLException() override;

    /// Empties the error queue that OpenSSL keeps for the calling thread.
    ///
    /// Every entry becomes a line of log at Error, the oldest first: "[libssl] ", OpenSSL's source file, ":", the line
    /// in decimal, ": " and the text of ERR_error_string(3). Entries are also removed when that level is disabled. An
    /// empty queue costs one look.
    ///
    /// Call it before each TLS operation as well as after a failed one: with a stale entry in the queue,
    /// SSL_get_error(3) reports a failure that did not happen.
    /// Thread safety: every thread has a queue of its own, and this touches no other.
    /// @throws what a substitute clock throws for a line of log; the queue is empty all the same
    static void flushErrorQueue();
};

} // namespace qel
