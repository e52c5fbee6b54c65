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
#include <openssl/pem.h>
#include <openssl/x509_vfy.h>
#include <string>
#include <utility>

namespace qel {

namespace {

// The buffers of the pair, each way, and the most ciphertext that moves in one transfer.
constexpr std::size_t kTransferBytes = 8192;

// OpenSSL counts in int; the loops take care of the rest.
int cappedLength(std::size_t length) noexcept
{
    constexpr std::size_t longest = std::numeric_limits<int>::max();
    return static_cast<int>(std::min(length, longest));
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
    SSL_set_bio(mSSL.get(), internal, internal); // mSSL owns it from here on
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
        pEnd(lock);
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
        pEnd(lock);
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
        // In the middle of a handshake there may be a certificate whose key the peer has not yet proven to hold.
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
    // Ciphertext first waits in the pair of buffers, then, record by record, in the engine.
    return BIO_ctrl_pending(SSL_get_rbio(mSSL.get())) > 0 || SSL_has_pending(mSSL.get()) == 1;
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
        pEnd(lock);
        throw; // not a copy: the cause may be nested inside
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

    // Another thread may have closed the stream while this one waited; it must not come back to life.
    pCheckStatusLocked(STATUS_UNENCRYPTED);
    logLine(LogLevel::Info, "SSLStream protocol init complete: ", SSL_get_version(mSSL.get()), " ",
            SSL_CIPHER_get_name(SSL_get_current_cipher(mSSL.get())));
    mStatus = STATUS_ENCRYPTED;
}

/// Leaves the stream closed when an exception is on its way out. Most exceptions come from where it has been closed
/// already, but not all: a line of log may fail, since a substitute clock may throw, in front of anything.
// Exempt from the analysis: whether the lock is held is known only at run time, when an exception has come from either
// side of the end of the stream.
void SSLStream::pEnd(UniqueMutexLock& lock) QEL_NO_THREAD_SAFETY_ANALYSIS
{
    if (!lock.ownsLock()) lock.lock();
    if (mStatus != STATUS_CLOSED) pCloseLocked();
    try {
        SSLException::flushErrorQueue();
    } catch (...) {
        // The queue is empty all the same, and the first exception is the one to know of.
    }
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
        // Closed is closed; and whoever handles another exception just now must be left with that one.
    }
}

/// Passes success and the wish to read or to write on; everything else ends the stream.
/// @return the code of SSL_get_error(3)
int SSLStream::pHandleErrorLocked(int result)
{
    const int systemError = errno; // first: everything below may change it
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
    SSLException::flushErrorQueue();
    if (error == SSL_ERROR_SSL) pLogVerificationLocked();
    pCloseLocked();
    throw StreamIOException("SSL error " + std::to_string(error));
}

/// Says why the peer's certificate was refused, if that is what happened: OpenSSL's queue does not.
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

/// Sends the ciphertext that the engine has produced.
void SSLStream::pFlush(UniqueMutexLock& lock)
{
    char scratch[kTransferBytes]; // written before it is read, so never initialised
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

/// Writes to the stream underneath, without the lock meanwhile.
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

/// Brings ciphertext in for the engine, without the lock while it waits for it.
/// @return true; or false at the end of the stream, and then the lock stays released
bool SSLStream::pFulfillInboundRequest(UniqueMutexLock& lock)
{
    char scratch[kTransferBytes]; // written before it is read, so never initialised
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

/// @return the bytes read, at least one; or 0 at the end of the stream, and then the lock stays released
std::size_t SSLStream::pRead(UniqueMutexLock& lock, char* buffer, std::size_t length)
{
    std::size_t total = 0;
    while (length > 0) {
        SSLException::flushErrorQueue(); // a stale entry would pass for a failure of this call
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
        SSLException::flushErrorQueue(); // a stale entry would pass for a failure of this call
        const int result = SSL_write(mSSL.get(), buffer, cappedLength(length));
        const int error = pHandleErrorLocked(result);
        if (error == SSL_ERROR_WANT_READ) pRefuseRenegotiationLocked();
        pFlush(lock);
        // With its buffer full the engine has kept its place: the next call passes the same bytes again.
        if (error == SSL_ERROR_WANT_WRITE) continue;
        logLine(LogLevel::Debug, "SSL stream encrypted ", decFormat(result), " byte(s) of data");
        const std::size_t count = static_cast<std::size_t>(result);
        buffer += count;
        length -= count;
    }
}

} // namespace qel
