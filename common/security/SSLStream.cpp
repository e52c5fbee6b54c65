#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "LogLine.hpp"
#include "security/PEMText.hpp"
#include "security/SSLCheck.hpp"

#include <algorithm>
#include <cerrno>
#include <limits>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509_vfy.h>
#include <string>
#include <utility>

namespace qel {

namespace {

// The size of the BIO pair's buffers in each direction, and the maximum ciphertext in one transfer.
constexpr std::size_t kTransferBytes = 8192;

// OpenSSL takes lengths as int; callers loop over longer ones.
int cappedLength(std::size_t length) noexcept
{
    constexpr std::size_t longest = std::numeric_limits<int>::max();
    return static_cast<int>(std::min(length, longest));
}

/// The fatal alert of the peer that is the first error in OpenSSL's queue; 0: the error is another one.
int alertInErrorQueue() noexcept
{
    const unsigned long error = ERR_peek_error();
    const int reason = ERR_GET_REASON(error);
    if (ERR_GET_LIB(error) != ERR_LIB_SSL || reason < SSL_AD_REASON_OFFSET) return 0;
    return reason - SSL_AD_REASON_OFFSET;
}

[[noreturn]] void failAtEndOfStream()
{
    logLine(LogLevel::Error, "SSLStream: EOF during handshake");
    throw StreamIOException("EOF");
}

} // namespace

SSLStream::SSLStream(SSLContext& context, std::unique_ptr<Stream> stream)
    : mStream(std::move(stream)), mSSL(context.allocateConnection())
{
    BIO* internal = nullptr;
    BIO* network = nullptr;
    checkSSL(BIO_new_bio_pair(&internal, kTransferBytes, &network, kTransferBytes) == 1);
    SSL_set_bio(mSSL.get(), internal, internal); // mSSL owns it now
    mBuffer.reset(network);
}

SSLStream::~SSLStream() = default;

void SSLStream::close() noexcept
{
    const MutexLock lock(mLock);
    pCloseLocked();
}

void SSLStream::setReadDeadline(std::chrono::milliseconds timeout) { mStream->setReadDeadline(timeout); }

void SSLStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream->setWriteDeadline(timeout); }

std::size_t SSLStream::read(char* buffer, std::size_t length)
{
    UniqueMutexLock lock(mLock);
    pCheckStatusLocked(STATUS_ENCRYPTED);
    try {
        return pRead(lock, buffer, length);
    } catch (...) {
        pCloseAfterException(lock);
        throw;
    }
}

void SSLStream::write(const char* buffer, std::size_t length)
{
    UniqueMutexLock lock(mLock);
    pCheckStatusLocked(STATUS_ENCRYPTED);
    try {
        pWrite(lock, buffer, length);
    } catch (...) {
        pCloseAfterException(lock);
        throw;
    }
}

SSLStream::Status SSLStream::getStatus() const
{
    const MutexLock lock(mLock);
    return mStatus;
}

std::unique_ptr<SSLCertificate> SSLStream::getPeerCertificate() const
{
    X509_PTR certificate;
    {
        const MutexLock lock(mLock);
        // During the handshake the peer may not yet have proven that it holds the key of its certificate.
        if (mStatus != STATUS_ENCRYPTED) return nullptr;
        certificate.reset(SSL_get_peer_certificate(mSSL.get()));
    }
    if (certificate == nullptr) return nullptr;
    const auto write = [&certificate](BIO* bio) { checkSSL(PEM_write_bio_X509(bio, certificate.get()) == 1); };
    return std::make_unique<SSLCertificate>(writePEM(write));
}

std::string SSLStream::getCipher() const
{
    const MutexLock lock(mLock);
    if (mStatus != STATUS_ENCRYPTED) return std::string();
    return SSL_CIPHER_get_name(SSL_get_current_cipher(mSSL.get()));
}

bool SSLStream::hasPending() const
{
    const MutexLock lock(mLock);
    if (mStatus != STATUS_ENCRYPTED) return false;
    // Ciphertext waits in the BIO pair first, then, record by record, in the engine.
    return BIO_ctrl_pending(SSL_get_rbio(mSSL.get())) > 0 || SSL_has_pending(mSSL.get()) == 1;
}

std::size_t SSLStream::getReadableBytes() const
{
    const MutexLock lock(mLock);
    if (mStatus != STATUS_ENCRYPTED) return 0;
    return static_cast<std::size_t>(SSL_pending(mSSL.get()));
}

int SSLStream::getPeerAlert() const
{
    const MutexLock lock(mLock);
    return mPeerAlert;
}

std::string SSLStream::getVerificationFailure() const
{
    const MutexLock lock(mLock);
    const long result = SSL_get_verify_result(mSSL.get());
    return result == X509_V_OK ? std::string() : X509_verify_cert_error_string(result);
}

void SSLStream::handshake()
{
    UniqueMutexLock lock(mLock);
    try {
        pHandshake(lock);
    } catch (...) {
        pCloseAfterException(lock);
        throw; // rethrow the original: the cause may be nested in it
    }
}

void SSLStream::pHandshake(UniqueMutexLock& lock)
{
    pCheckStatusLocked(STATUS_UNENCRYPTED);
    while (!SSL_is_init_finished(mSSL.get())) {
        SSLException::flushErrorQueue();
        const int error = pHandleErrorLocked(SSL_do_handshake(mSSL.get()));
        pFlush(lock);
        if (error != SSL_ERROR_WANT_READ) continue;
        if (!pFulfillInboundRequest(lock)) failAtEndOfStream();
    }
    logLine(LogLevel::Debug, "SSLStream: protocol init SSL handshake portion complete");

    char version = PROTOCOL_VERSION_0;
    pWrite(lock, &version, sizeof(version));
    logLine(LogLevel::Debug, "SSLStream: protocol init write complete");
    if (pRead(lock, &version, sizeof(version)) == 0) failAtEndOfStream();

    // Another thread may have closed the stream while this one waited. It must stay closed.
    pCheckStatusLocked(STATUS_UNENCRYPTED);
    logLine(LogLevel::Info, "SSLStream protocol init complete: ", SSL_get_version(mSSL.get()), " ",
            SSL_CIPHER_get_name(SSL_get_current_cipher(mSSL.get())));
    mStatus = STATUS_ENCRYPTED;
}

/// Closes the stream unless the failing step has done so.
// Exempt from the analysis: only at run time is it known whether the lock is held. It is not at the end of the stream.
void SSLStream::pCloseAfterException(UniqueMutexLock& lock) QEL_NO_THREAD_SAFETY_ANALYSIS
{
    if (!lock.ownsLock()) lock.lock();
    if (mStatus != STATUS_CLOSED) pCloseLocked();
}

void SSLStream::pCheckStatusLocked(Status status) const
{
    if (mStatus != status) throw StreamIOException("Invalid state for SSL stream operation");
}

void SSLStream::pCloseLocked() noexcept
{
    mStatus = STATUS_CLOSED;
    try {
        mStream->close();
    } catch (...) {
        // The stream counts as closed, and a caller that is handling another exception must keep that one.
    }
}

/// Returns success, want-read and want-write; any other result closes the stream and throws.
/// @return the code of SSL_get_error(3)
int SSLStream::pHandleErrorLocked(int result)
{
    const int systemError = errno; // saved first: the calls below may change it
    const int error = SSL_get_error(mSSL.get(), result);
    switch (error) {
    case SSL_ERROR_NONE:
    case SSL_ERROR_WANT_READ:
    case SSL_ERROR_WANT_WRITE:
        return error;
    case SSL_ERROR_SYSCALL:
        logLine(LogLevel::Error, "SSL stream encountered a fatal syscall error: ", PosixErrorCode(systemError));
        break;
    default:
        logLine(LogLevel::Error, "SSL stream encountered unrecoverable error code ", hexFormat(error));
        break;
    }
    if (error == SSL_ERROR_SSL) mPeerAlert = alertInErrorQueue();
    SSLException::flushErrorQueue();
    if (error == SSL_ERROR_SSL) pLogVerificationLocked();
    pCloseLocked();
    throw StreamIOException("SSL error " + std::to_string(error));
}

/// Logs why the peer's certificate was refused, if it was: OpenSSL's error queue does not say.
void SSLStream::pLogVerificationLocked()
{
    const long result = SSL_get_verify_result(mSSL.get());
    if (result == X509_V_OK) return;
    logLine(LogLevel::Error, "SSL peer certificate verification failed: ", X509_verify_cert_error_string(result));
}

void SSLStream::pRefuseRenegotiationLocked()
{
    constexpr const char* text = "SSL stream peer attempted renegotiation";
    logLine(LogLevel::Error, text);
    pCloseLocked();
    throw StreamIOException(text);
}

void SSLStream::pFailTransferLocked(const char* description, int result, const char* text)
{
    SSLException::flushErrorQueue();
    logLine(LogLevel::Error, description, hexFormat(result));
    pCloseLocked();
    throw StreamIOException(text);
}

/// Sends the ciphertext that the engine has produced to the underlying stream.
void SSLStream::pFlush(UniqueMutexLock& lock)
{
    char scratch[kTransferBytes]; // not initialised: written before it is read
    std::size_t pending = BIO_ctrl_pending(mBuffer.get());
    while (pending > 0) {
        const std::size_t chunk = std::min(pending, sizeof(scratch));
        const int result = BIO_read(mBuffer.get(), scratch, static_cast<int>(chunk));
        if (result != static_cast<int>(chunk)) {
            pFailTransferLocked("SSL stream hit BIO_read failure: ", result, "BIO_read failed");
        }
        pSendReleased(lock, scratch, chunk);
        pending -= chunk;
    }
}

/// Writes to the underlying stream and releases the lock meanwhile.
// Exempt from the analysis, which does not follow a lock that is a parameter.
void SSLStream::pSendReleased(UniqueMutexLock& lock, const char* buffer,
                              std::size_t length) QEL_NO_THREAD_SAFETY_ANALYSIS
{
    lock.unlock();
    try {
        mStream->write(buffer, length);
    } catch (...) {
        lock.lock();
        pCloseLocked();
        throw;
    }
    lock.lock();
}

/// Reads ciphertext for the engine from the underlying stream and releases the lock meanwhile.
/// @return true when data arrived; false at the end of the stream, and then the lock stays released
bool SSLStream::pFulfillInboundRequest(UniqueMutexLock& lock)
{
    char scratch[kTransferBytes]; // not initialised: written before it is read
    const std::size_t room = std::min(sizeof(scratch), BIO_ctrl_get_write_guarantee(mBuffer.get()));
    std::size_t count = 0;
    lock.unlock();
    try {
        count = mStream->read(scratch, room);
    } catch (...) {
        lock.lock();
        pCloseLocked();
        throw;
    }
    if (count == 0) return false;

    lock.lock();
    const int result = BIO_write(mBuffer.get(), scratch, static_cast<int>(count));
    if (result != static_cast<int>(count)) {
        pFailTransferLocked("SSLStream hit BIO_write failure: ", result, "BIO_write failed");
    }
    return true;
}

/// @return the number of bytes read, at least 1; or 0 at the end of the stream, and then the lock stays released
std::size_t SSLStream::pRead(UniqueMutexLock& lock, char* buffer, std::size_t length)
{
    std::size_t total = 0;
    while (length > 0) {
        SSLException::flushErrorQueue(); // a stale entry would look like a failure of this call
        const int result = SSL_read(mSSL.get(), buffer, cappedLength(length));
        const int error = pHandleErrorLocked(result);
        if (error == SSL_ERROR_WANT_WRITE) pRefuseRenegotiationLocked();
        if (error == SSL_ERROR_WANT_READ) {
            if (total > 0) return total;
            if (!pFulfillInboundRequest(lock)) return 0;
            continue;
        }
        logLine(LogLevel::Debug, "SSL stream decrypted ", decFormat(result), " byte(s) of data");
        const std::size_t count = static_cast<std::size_t>(result);
        buffer += count;
        total += count;
        length -= count;
    }
    return total;
}

void SSLStream::pWrite(UniqueMutexLock& lock, const char* buffer, std::size_t length)
{
    while (length > 0) {
        SSLException::flushErrorQueue(); // a stale entry would look like a failure of this call
        const int result = SSL_write(mSSL.get(), buffer, cappedLength(length));
        const int error = pHandleErrorLocked(result);
        if (error == SSL_ERROR_WANT_READ) pRefuseRenegotiationLocked();
        pFlush(lock);
        // The engine's buffer was full and it has kept its position: pass the same bytes again.
        if (error == SSL_ERROR_WANT_WRITE) continue;
        logLine(LogLevel::Debug, "SSL stream encrypted ", decFormat(result), " byte(s) of data");
        const std::size_t count = static_cast<std::size_t>(result);
        buffer += count;
        length -= count;
    }
}

} // namespace qel
