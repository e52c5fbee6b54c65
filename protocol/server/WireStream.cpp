#include "server/WireStream.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Logging.hpp>

#include <cerrno>
#include <exception>
#include <sys/socket.h>
#include <utility>

namespace qel::protocol {

namespace {

/// Fails as a SocketStream does. It could not find out any more what is wrong: a socket reports a failure once, and
/// then only that it has ended.
[[noreturn]] void failSocket(PosixErrorCode code, const char* context, const char* text)
{
    try {
        const PosixError error(code, context);
        logLine(LogLevel::Error, error.what());
        throw error;
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException(text));
    }
}

} // namespace

WireStream::WireStream(std::unique_ptr<Stream> stream, int descriptor)
    : mStream(std::move(stream)), mDescriptor(descriptor)
{}

WireStream::~WireStream() = default;

void WireStream::sendRest()
{
    if (mRest.empty()) return;
    const std::string rest = std::exchange(mRest, std::string()); // its memory goes, too
    mStream->write(rest.data(), rest.size());
}

std::size_t WireStream::read(char* buffer, std::size_t length)
{
    if (mOnRead) mOnRead();
    if (mHasNewDeadline) {
        // Its time has begun even if nothing has to be waited for: a peer that floods must not stop it.
        const std::chrono::milliseconds timeLeft = mNewDeadline.getEffectiveTimeout();
        const std::size_t count = timeLeft >= std::chrono::milliseconds::zero() ? pReceiveAtOnce(buffer, length) : 0;
        if (count > 0) return count;
        mHasNewDeadline = false;
        mStream->setReadDeadline(timeLeft);
    }
    return mStream->read(buffer, length);
}

void WireStream::write(const char* buffer, std::size_t length)
{
    if (mMayWait) return mStream->write(buffer, length);
    if (mRest.empty()) pSendAtOnce(buffer, length);
    mRest.append(buffer, length);
}

void WireStream::close() { mStream->close(); }

void WireStream::setReadDeadline(std::chrono::milliseconds timeout)
{
    mHasNewDeadline = true;
    mNewDeadline = timeout;
}

void WireStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream->setWriteDeadline(timeout); }

/// Only with a deadline, which would otherwise have to be set and taken back. @return 0: there is nothing to read, or
/// the peer has ended
std::size_t WireStream::pReceiveAtOnce(char* buffer, std::size_t length) const
{
    if (mDescriptor < 0) return 0;
    const ssize_t count = ::recv(mDescriptor, buffer, length, MSG_DONTWAIT);
    if (count >= 0) return static_cast<std::size_t>(count);
    const int code = errno;
    if (code == EAGAIN || code == EWOULDBLOCK || code == EINTR) return 0;
    failSocket(code, "socket stream failed to receive", "socket stream receive failure");
}

/// Sends what there is room for, and steps over it.
void WireStream::pSendAtOnce(const char*& buffer, std::size_t& length) const
{
    ssize_t count = 0;
    do {
        count = ::send(mDescriptor, buffer, length, MSG_DONTWAIT | MSG_NOSIGNAL);
    } while (count < 0 && errno == EINTR);
    if (count >= 0) {
        buffer += count;
        length -= static_cast<std::size_t>(count);
        return;
    }
    const int code = errno;
    if (code == EAGAIN || code == EWOULDBLOCK || code == ENOBUFS || code == ENOMEM) return;
    failSocket(code, "socket stream send failure", "socket stream send failure");
}

} // namespace qel::protocol
