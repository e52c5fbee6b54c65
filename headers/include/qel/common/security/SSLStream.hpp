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
/// The client uses a client context, the server a server context. Each end calls handshake() once; after that, read()
/// and write() carry data. Right after the TLS handshake, each end sends one byte: the version of the protocol inside
/// TLS.
///
/// All waiting happens in the underlying stream, so its deadlines bound every operation here. A deadline that passes is
/// fatal: like every exception of the underlying stream it closes this stream, because the transfer may have stopped
/// within a record. To interrupt a waiting reader, call close() from another thread.
///
/// This stream sends no alert, neither on close() nor when a handshake fails: the peer sees the end of the stream.
/// Likewise, the end of the stream here is the end of the underlying stream, whether the peer intended it or the
/// connection was cut. An application that must know that nothing is missing has to see it from the data. A peer that
/// closes TLS itself (close_notify) causes an error, "SSL error 6". Renegotiation and resumption are not supported. Any
/// certificate that the context's root issued is accepted; getPeerCertificate() says who the peer is.
///
/// A peer may update its keys at any time. If it requests new keys in return, they are sent with the next write. Two
/// requests during one long write close the connection.
///
/// TLS failures throw StreamIOException with fixed texts; OpenSSL's reasons are logged at Error. Log lines are written
/// with the stream's lock held: a log back-end that calls the stream deadlocks, except for the deadline setters, which
/// take no lock.
///
/// Ownership: owns the underlying stream. close() ends the transfer only; a peer that is blocked in a write is certain
/// to wake only when the descriptor is closed, so destroy streams promptly.
///
/// Thread safety: one reader thread and one writer thread, also at the same time; each deadline setter belongs to the
/// thread of its direction. Any thread may call close(), getStatus(), getPeerCertificate(), getCipher(), hasPending(),
/// getReadableBytes(), getPeerAlert() and getVerificationFailure() at any time; they do not wait for a thread that
/// waits in the underlying stream.
class QEL_EXPORT SSLStream : public Stream {
public:
    enum Status : unsigned int {
        STATUS_UNENCRYPTED = 0, ///< before and during the handshake
        STATUS_ENCRYPTED = 1,   ///< the handshake is complete, data may flow
        STATUS_CLOSED = 2,      ///< closed or failed; terminal
    };

    /// The version of the protocol inside TLS, one byte each way after the handshake.
    enum ProtocolVersion : unsigned int {
        PROTOCOL_VERSION_0 = 0, ///< the only version
    };

    /// Makes one end of a TLS connection. Sends nothing yet.
    /// @param context  provides the role, the trusted root and the certificate; may be destroyed afterwards
    /// @param stream   the underlying stream: connected, not null, with no byte of TLS read from it; destroyed if the
    ///                 constructor throws
    /// @throws SSLException  OpenSSL cannot make the connection ("An SSL error occurred at ...")
    SSLStream(SSLContext& context, std::unique_ptr<Stream> stream);

    /// Performs the TLS handshake with the peer, which must do the same, and exchanges the protocol versions. Call it
    /// once, before any read() or write(), with both deadlines set. Any version byte of the peer is accepted.
    ///
    /// An end whose certificate is refused sees only the end of the stream; a client sees it after its own side of the
    /// TLS handshake is complete.
    ///
    /// Every exception closes the stream, also the one for a wrong state: a second handshake() ends a working
    /// connection.
    /// @throws StreamIOException  "Invalid state for SSL stream operation": called before, or the stream was closed,
    ///                            possibly meanwhile. "EOF": the peer ended the connection. "SSL error " and a number
    ///                            of SSL_get_error(3): TLS failed; 1 for a refused certificate and for anything that is
    ///                            not valid TLS 1.3. "BIO_read failed" or "BIO_write failed": OpenSSL's buffers failed.
    ///                            "SSL stream peer attempted renegotiation", as read() and write().
    ///                            Exceptions of the underlying stream propagate unchanged.
    void handshake();

    /// Closes the underlying stream and wakes threads that wait in it. The peer sees the end of the stream. Never
    /// throws: an exception of the underlying stream is dropped.
    void close() noexcept override;

    /// Sets the deadline of the underlying stream.
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    /// Sets the deadline of the underlying stream.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// Waits until at least one byte of data has arrived, then delivers what is available. Once there is data, it does
    /// not read from the underlying stream again.
    ///
    /// If invalid or closing TLS records follow good data and the buffer has room for more than that data, the
    /// exception discards the data. A reader that requests exactly the bytes it expects is not affected.
    /// @param buffer  receives up to length bytes; undefined after an exception
    /// @return the number of bytes read; 0 at the end of the underlying stream, and for length 0. The end keeps the
    ///         status as it is.
    /// @throws StreamIOException  "Invalid state for SSL stream operation": no handshake yet, or closed; the stream is
    ///                            unchanged. "SSL error " and a number: 6 when the peer closed TLS, 1 for invalid
    ///                            records. "SSL stream peer attempted renegotiation". "BIO_write failed". Exceptions of
    ///                            the underlying stream propagate unchanged. All but the first close the stream.
    std::size_t read(char* buffer, std::size_t length) override;

    /// Encrypts and writes all bytes. For length 0, sends nothing.
    /// @param buffer  length bytes, borrowed for the call
    /// @throws StreamIOException  "Invalid state for SSL stream operation", as read(). "SSL error " and a
    ///                            number, such as 5 when the reader has met a fatal error meanwhile.
    ///                            "SSL stream peer attempted renegotiation". "BIO_read failed". Exceptions of the
    ///                            underlying stream propagate unchanged. All but the first close the stream.
    void write(const char* buffer, std::size_t length) override;

    ~SSLStream() override;

    /// @return the current state; another thread may change it at any time. STATUS_CLOSED is final.
    Status getStatus() const;

    /// Who the peer is. The context's root issued the certificate, it is valid, and the peer has proven that it holds
    /// the key. The caller must check everything else, such as the name in it, before it sends data or trusts any.
    /// @return the peer's certificate, without a key; null unless the status is STATUS_ENCRYPTED
    /// @throws SSLException  "An SSL error occurred at ..."
    std::unique_ptr<SSLCertificate> getPeerCertificate() const;

    /// @return the name of the cipher in use, such as "TLS_AES_256_GCM_SHA384"; empty unless the status is
    ///         STATUS_ENCRYPTED
    std::string getCipher() const;

    /// Whether bytes of the peer have been read from the underlying stream that no read() has returned yet. Check this
    /// before poll(2): the descriptor does not report such bytes. They may be only the beginning of a record, so that
    /// the next read() waits for the rest.
    /// @return false unless the status is STATUS_ENCRYPTED
    bool hasPending() const;

    /// How many bytes of data the next reads return without a wait: they are decrypted and not read yet. Data that is
    /// still encrypted does not count, so hasPending() may be true while this is 0.
    /// @return bytes; 0 unless the status is STATUS_ENCRYPTED
    std::size_t getReadableBytes() const;

    /// The number of the fatal alert with which the peer ended TLS (RFC 8446, 6.2), such as 48, unknown_ca. Remains
    /// available after the stream was closed, to explain a failed handshake(), read() or write().
    /// @return 0: the peer has sent none
    int getPeerAlert() const;

    /// Why the peer's certificate was refused, such as "certificate has expired". Remains available after the stream
    /// was closed, to explain a failed handshake().
    /// @return the text of X509_verify_cert_error_string(3); empty when no certificate was refused
    std::string getVerificationFailure() const;

private:
    void pHandshake(UniqueMutexLock& lock) QEL_REQUIRES(mLock);
    void pCloseAfterException(UniqueMutexLock& lock) QEL_ACQUIRE(mLock);
    void pCheckStatusLocked(Status status) const QEL_REQUIRES(mLock);
    void pCloseLocked() noexcept QEL_REQUIRES(mLock);
    int pHandleErrorLocked(int result) QEL_REQUIRES(mLock);
    void pLogVerificationLocked() QEL_REQUIRES(mLock);
    [[noreturn]] void pRefuseRenegotiationLocked() QEL_REQUIRES(mLock);
    [[noreturn]] void pFailTransferLocked(const char* description, int result, const char* text) QEL_REQUIRES(mLock);

    void pFlush(UniqueMutexLock& lock) QEL_REQUIRES(mLock);
    void pSendReleased(UniqueMutexLock& lock, const char* buffer, std::size_t length) QEL_REQUIRES(mLock);
    void pWrite(UniqueMutexLock& lock, const char* buffer, std::size_t length) QEL_REQUIRES(mLock);

    // At the end of the stream these two return false and 0, and without the lock. The caller can then only return or
    // throw.
    bool pFulfillInboundRequest(UniqueMutexLock& lock) QEL_RELEASE(mLock) QEL_TRY_ACQUIRE(true, mLock);
    std::size_t pRead(UniqueMutexLock& lock, char* buffer, std::size_t length) QEL_RELEASE(mLock)
        QEL_TRY_ACQUIRE(true, mLock);

    // Guards the TLS engine, both BIOs and the state. Not held while a thread waits in mStream.
    mutable Mutex mLock;
    Status mStatus QEL_GUARDED_BY(mLock) = STATUS_UNENCRYPTED;
    int mPeerAlert QEL_GUARDED_BY(mLock) = 0;
    const std::unique_ptr<Stream> mStream;
    const SSL_PTR mSSL QEL_PT_GUARDED_BY(mLock);
    BIO_PTR mBuffer QEL_GUARDED_BY(mLock)
        QEL_PT_GUARDED_BY(mLock); // the network half of the BIO pair; mSSL owns the other
};

} // namespace qel
