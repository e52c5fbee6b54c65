#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLTypes.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

namespace qel {

class SSLCertificate;
class SSLContext;

/// TLS 1.3 (RFC 8446) over any other stream, normally a SocketStream.
///
/// The client end takes a stream made with a client context, the server end one made with a server context. Each end
/// calls handshake() once; after that read() and write() carry data. Right after the TLS handshake the ends send each
/// other one byte, the version of the protocol inside.
///
/// All waiting happens in the stream underneath, so its deadlines bound every operation here. A deadline that passes is
/// fatal: like every exception from underneath it leaves this stream closed, since nobody could say where in a record
/// the transfer stopped. To interrupt a reader that waits, and go on without it, call close() from another thread.
///
/// It sends no alert, neither when it closes nor when a handshake fails: the peer sees the end of the stream. What
/// reads as the end here is the end of the stream underneath, whether the peer meant it or the connection was cut; a
/// peer that closes TLS itself (close_notify) is an error, "SSL error 6". Who needs to know that nothing is missing
/// must see it from the data. Renegotiation and resumption do not exist. Any certificate that the context's root issued
/// is accepted: who the peer is tells getPeerCertificate().
///
/// A peer may change its keys at any time; new keys that it asks for in return go out with the next write. Asking twice
/// while one long write is under way ends the connection.
///
/// Failures of TLS itself are StreamIOException with fixed texts; OpenSSL's reasons are in the log at Error. Lines of
/// log are written with the lock of the stream held, so a log back-end must not call the stream, or it waits for itself
/// for ever; only the deadline setters take no lock.
///
/// Ownership: owns the stream underneath. close() only ends the transfer; a peer that is blocked in a write is woken
/// for certain only when the descriptor is closed, so destroy streams that are done with.
/// Thread safety: one reader thread and one writer thread at a time, also at the same time; the deadline setters belong
/// to the thread of their direction. close(), getStatus(), getPeerCertificate(), getCipher(), hasPending() and
/// getVerificationFailure() may be called from any thread at any time and do not wait for a thread that waits in the
/// stream underneath.
class QEL_EXPORT SSLStream : public Stream {
public:
    enum Status : unsigned int {
        STATUS_UNENCRYPTED = 0, ///< before and in the handshake
        STATUS_ENCRYPTED = 1,   ///< the handshake is done, data may flow
        STATUS_CLOSED = 2,      ///< closed, or failed; for good
    };

    /// The version of the protocol inside TLS, one byte each way after the handshake.
    enum ProtocolVersion : unsigned int {
        PROTOCOL_VERSION_0 = 0, ///< the only one so far
    };

    /// Makes one end of a TLS connection; nothing is sent yet.
    /// @param context  gives the role, and what this end trusts and presents; may be destroyed afterwards
    /// @param stream   connected, not null, with nothing read from it that belongs to TLS; consumed even if the
    ///                 constructor throws
    /// @throws SSLException  OpenSSL could not make the connection ("An SSL error occurred at ...")
    SSLStream(SSLContext& context, std::unique_ptr<Stream> stream);

    /// Does the TLS handshake with the other end, which must do the same, and exchanges the protocol versions. To be
    /// called once, before any read() or write(), with the deadlines of both directions set. Whatever byte the peer
    /// sends as its version is accepted.
    ///
    /// An end whose certificate is refused learns of it only as an end of the stream; for a client that is after its
    /// own side of the TLS handshake has been completed.
    ///
    /// After any exception the stream is closed, also when the state was the wrong one: a second handshake() ends a
    /// connection that works.
    /// @throws StreamIOException  "Invalid state for SSL stream operation": called before, or the stream was closed,
    ///                            perhaps meanwhile. "EOF": the peer ended the connection. "SSL error " and a number of
    ///                            SSL_get_error(3): TLS failed, 1 for a refused certificate as for anything that is not
    ///                            proper TLS 1.3. "BIO_read failed" or "BIO_write failed": OpenSSL's buffers failed.
    ///                            "SSL stream peer attempted renegotiation", as read() and write().
    ///                            Whatever the stream underneath throws comes through unchanged, and so does what a
    ///                            substitute clock throws for a line of log.
    void handshake();

    /// Closes the stream underneath; whoever waits in it is woken. The peer sees the end of the stream. Never throws:
    /// an exception from underneath is dropped.
    void close() noexcept override;

    /// Sets the deadline of the stream underneath; see there and above.
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    /// Sets the deadline of the stream underneath; see there and above.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// Delivers what has arrived, waiting for at least one byte of data if need be. What one read from the stream
    /// underneath brought in is decrypted as far as it fits the buffer; there is no second such read once there is
    /// data.
    ///
    /// When bad or closing TLS records have arrived behind good data and the buffer has room for more than that data,
    /// the data is lost in the exception. Readers that ask for exactly what they expect do not meet this.
    /// @param buffer  takes up to length bytes; after an exception its content is undefined
    /// @return the bytes read; 0 when the stream underneath has ended, and for length 0. The end does not change the
    ///         status.
    /// @throws StreamIOException  "Invalid state for SSL stream operation": no handshake yet, or closed; the stream is
    ///                            left as it was. "SSL error " and a number: 6 when the peer closed TLS, 1 for anything
    ///                            that does not belong into the stream; "SSL stream peer attempted renegotiation";
    ///                            "BIO_write failed". Whatever the stream underneath throws comes through unchanged,
    ///                            and so does what a substitute clock throws for a line of log. After all but the
    ///                            first the stream is closed.
    std::size_t read(char* buffer, std::size_t length) override;

    /// Encrypts and writes all bytes. For length 0 nothing is sent.
    /// @param buffer  length bytes, borrowed for the call
    /// @throws StreamIOException  "Invalid state for SSL stream operation", as read(). "SSL error " and a number, such
    ///                            as 5 when the reading thread has met a fatal error meanwhile;
    ///                            "SSL stream peer attempted renegotiation"; "BIO_read failed". Whatever the stream
    ///                            underneath throws comes through unchanged, and so does what a substitute clock
    ///                            throws for a line of log. After all but the first the stream is closed.
    void write(const char* buffer, std::size_t length) override;

    ~SSLStream() override;

    /// @return the state at this moment; another thread may change it at any time, and STATUS_CLOSED stays
    Status getStatus() const;

    /// Who the peer is. The certificate is issued by the context's root, valid, and the peer has proven to hold its
    /// key; everything else, such as the name in it, is for the caller to check before it sends or believes anything.
    /// @return the peer's certificate, without key; null unless the status is STATUS_ENCRYPTED
    /// @throws SSLException  "An SSL error occurred at ..."
    std::unique_ptr<SSLCertificate> getPeerCertificate() const;

    /// @return the name of the cipher in use, such as "TLS_AES_256_GCM_SHA384"; empty unless the status is
    ///         STATUS_ENCRYPTED
    std::string getCipher() const;

    /// Whether bytes of the peer have been taken from the stream underneath that no read() has returned yet. To wait
    /// for several things at once with poll(2), ask this first: the descriptor underneath says nothing of such bytes.
    /// They may be the beginning of a record only, so that the next read() waits for the rest of it.
    /// @return false unless the status is STATUS_ENCRYPTED
    bool hasPending() const;

    /// Why the peer's certificate was refused, such as "certificate has expired". Stays after the stream was closed, so
    /// that a failed handshake() can be explained.
    /// @return the text of X509_verify_cert_error_string(3); empty when no certificate was refused
    std::string getVerificationFailure() const;

private:
    void pHandshake(UniqueMutexLock& lock) QEL_REQUIRES(mLock);
    void pEnd(UniqueMutexLock& lock) QEL_ACQUIRE(mLock);
    void pCheckStatusLocked(Status status) const QEL_REQUIRES(mLock);
    void pCloseLocked() noexcept QEL_REQUIRES(mLock);
    int pHandleErrorLocked(int result) QEL_REQUIRES(mLock);
    void pLogVerificationLocked() QEL_REQUIRES(mLock);
    [[noreturn]] void pRefuseRenegotiationLocked() QEL_REQUIRES(mLock);
    [[noreturn]] void pFailTransferLocked(const char* description, int result, const char* text) QEL_REQUIRES(mLock);

    void pFlush(UniqueMutexLock& lock) QEL_REQUIRES(mLock);
    void pSendReleased(UniqueMutexLock& lock, const char* buffer, std::size_t length) QEL_REQUIRES(mLock);
    void pWrite(UniqueMutexLock& lock, const char* buffer, std::size_t length) QEL_REQUIRES(mLock);

    // These two return false and 0 at the end of the stream, and then without the lock: all that is left to do is to
    // return or to throw.
    bool pFulfillInboundRequest(UniqueMutexLock& lock) QEL_RELEASE(mLock) QEL_TRY_ACQUIRE(true, mLock);
    std::size_t pRead(UniqueMutexLock& lock, char* buffer, std::size_t length) QEL_RELEASE(mLock)
        QEL_TRY_ACQUIRE(true, mLock);

    // Guards the TLS engine, both of its buffers and the state. It is not held while a thread waits in mStream.
    mutable Mutex mLock;
    Status mStatus QEL_GUARDED_BY(mLock) = STATUS_UNENCRYPTED;
    const std::unique_ptr<Stream> mStream;
    const SSL_PTR mSSL QEL_PT_GUARDED_BY(mLock);
    BIO_PTR mBuffer QEL_GUARDED_BY(mLock) QEL_PT_GUARDED_BY(mLock); // the network half of the pair; mSSL owns the other
};

} // namespace qel
