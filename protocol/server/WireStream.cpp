#include "server/WireStream.hpp"

#include <cerrno>
#include <sys/socket.h>
#include <utility>

namespace qel::protocol {

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
        const std::size_t count = pReceiveAtOnce(buffer, length);
        if (count > 0) return count; // nothing to wait for
        mHasNewDeadline = false;
        mStream->setReadDeadline(mNewDeadline);
    }
    return mStream->read(buffer, length);
}

void WireStream::write(const char* buffer, std::size_t length)
{
    if (mMayWait) return mStream->write(buffer, length);
    if (mRest.empty() && !pSendAtOnce(buffer, length)) return mStream->write(buffer, length);
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
/// the stream below has to find out what is wrong
std::size_t WireStream::pReceiveAtOnce(char* buffer, std::size_t length) const noexcept
{
    if (mDescriptor < 0 || mNewDeadline < std::chrono::milliseconds::zero()) return 0;
    const ssize_t count = ::recv(mDescriptor, buffer, length, MSG_DONTWAIT);
    return count > 0 ? static_cast<std::size_t>(count) : 0;
}

/// Sends what there is room for, and steps over it.
/// @return false: the socket fails; the stream below finds out why
bool WireStream::pSendAtOnce(const char*& buffer, std::size_t& length) const noexcept
{
    ssize_t count = 0;
    do {
        count = ::send(mDescriptor, buffer, length, MSG_DONTWAIT | MSG_NOSIGNAL);
    } while (count < 0 && errno == EINTR);
    if (count < 0) return errno == EAGAIN || errno == EWOULDBLOCK || errno == ENOBUFS || errno == ENOMEM;
    buffer += count;
    length -= static_cast<std::size_t>(count);
    return true;
}

} // namespace qel::protocol
