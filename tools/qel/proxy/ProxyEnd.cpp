#include "proxy/ProxyEnd.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

// Large enough for any frame and any segment of loopback, small enough that a side that does not read is felt soon.
constexpr int kSocketBytes = 256 * 1024;
constexpr std::size_t kRecordBytes = 16 * 1024; // of a write over TLS: what is kept without room stays short

bool isForLater(int error) { return error == EAGAIN || error == EWOULDBLOCK || error == EINTR; }

/// @return bytes sent; 0: no room; -1: the connection is broken
ssize_t sendSome(int descriptor, const char* buffer, std::size_t length)
{
    const ssize_t count = ::send(descriptor, buffer, length, MSG_DONTWAIT | MSG_NOSIGNAL);
    const int error = errno;
    if (count >= 0) return count;
    return isForLater(error) ? 0 : -1;
}

void tune(Socket& socket)
{
    socket.setSocketOption(SOL_SOCKET, SO_SNDBUF, kSocketBytes);
    socket.setSocketOption(SOL_SOCKET, SO_RCVBUF, kSocketBytes);
    socket.setSocketOption(SOL_SOCKET, SO_KEEPALIVE, 1);
    socket.setSocketOption(IPPROTO_TCP, TCP_NODELAY, 1);
}

} // namespace

HandshakeStream::~HandshakeStream() = default;

std::size_t HandshakeStream::read(char* buffer, std::size_t length)
{
    if (mWaits) return mStream.read(buffer, length);
    const ssize_t count = ::recv(mStream.getSocket().getFd(), buffer, length, MSG_DONTWAIT);
    const int error = errno;
    if (count > 0) return static_cast<std::size_t>(count);
    if (count == 0) mHasEnded = true;
    if (count < 0 && !isForLater(error)) throw StreamIOException("the connection is broken");
    return 0; // TLS takes it for the end of the stream, and can be asked again
}

void HandshakeStream::write(const char* buffer, std::size_t length)
{
    if (mWaits) {
        mStream.write(buffer, length);
        return;
    }
    mKept.append(buffer, length);
    if (!flush()) throw StreamIOException("the connection is broken");
}

bool HandshakeStream::flush()
{
    if (mKept.empty()) return true;
    const ssize_t count = sendSome(mStream.getSocket().getFd(), mKept.data(), mKept.size());
    if (count < 0) return false;
    mKept.erase(0, static_cast<std::size_t>(count));
    return true;
}

ProxyEnd::ProxyEnd(Socket socket) : mSocket(std::move(socket)), mDescriptor(mSocket.getFd()) { tune(mSocket); }

ProxyEnd::~ProxyEnd() = default;

Stream& ProxyEnd::clear()
{
    if (mStream == nullptr) mStream = std::make_unique<SocketStream>(std::move(mSocket));
    return *mStream;
}

SSLStream& ProxyEnd::protect(SSLContext& context)
{
    clear();
    auto below = std::make_unique<HandshakeStream>(*mStream);
    mBelow = below.get();
    mTls = std::make_unique<SSLStream>(context, std::move(below));
    return *mTls;
}

void ProxyEnd::stopWaiting()
{
    if (mStream != nullptr) {
        // A peer that has no room for data is waited for without a limit, like the peers would do.
        const int none = 0;
        static_cast<void>(::setsockopt(mDescriptor, IPPROTO_TCP, TCP_USER_TIMEOUT, &none, sizeof(none)));
    }
    if (mBelow == nullptr) return;
    mBelow->stopWaiting();
    mMayHaveMore = true; // what came with the end of the handshake
}

ProxyEnd::Reading ProxyEnd::read(char* buffer, std::size_t length)
{
    return mTls != nullptr ? pReadTls(buffer, length) : pReadSocket(buffer, length);
}

ProxyEnd::Reading ProxyEnd::pReadSocket(char* buffer, std::size_t length)
{
    const ssize_t count = ::recv(mDescriptor, buffer, length, MSG_DONTWAIT);
    const int error = errno;
    if (count > 0) return {Got::Bytes, static_cast<std::size_t>(count)};
    if (count == 0) return {Got::End, 0};
    if (isForLater(error)) return {Got::Nothing, 0};
    mIsBroken = true;
    return {Got::Broken, 0};
}

ProxyEnd::Reading ProxyEnd::pReadTls(char* buffer, std::size_t length)
{
    try {
        // One byte makes TLS decrypt a record, and no more than that: a bad record after a good one would discard both.
        const std::size_t wanted = std::max<std::size_t>(mTls->getReadableBytes(), 1);
        const std::size_t count = mTls->read(buffer, std::min(wanted, length));
        mMayHaveMore = count > 0;
        if (count > 0) return {Got::Bytes, count};
        return {mBelow->hasEnded() ? Got::End : Got::Nothing, 0};
    } catch (const StreamIOException& error) {
        mMayHaveMore = false;
        const bool isPoliteEnd = std::strcmp(error.what(), "SSL error 6") == 0; // the peer closes TLS
        mIsBroken = !isPoliteEnd;
        return {isPoliteEnd ? Got::End : Got::Broken, 0};
    }
}

std::size_t ProxyEnd::write(const char* buffer, std::size_t length)
{
    if (mIsBroken) return 0;
    if (mTls == nullptr) {
        const ssize_t count = sendSome(mDescriptor, buffer, length);
        if (count < 0) mIsBroken = true;
        return count < 0 ? 0 : static_cast<std::size_t>(count);
    }
    flush();
    if (mIsBroken || hasRest()) return 0;
    const std::size_t record = std::min(length, kRecordBytes);
    try {
        mTls->write(buffer, record);
        return record;
    } catch (const StreamIOException&) {
        mIsBroken = true;
        return 0;
    }
}

void ProxyEnd::flush()
{
    if (mBelow == nullptr || mBelow->isEmpty()) return;
    if (!mBelow->flush()) mIsBroken = true;
    if (mBelow->isEmpty() && mEndsWriting) endWriting();
}

void ProxyEnd::endWriting()
{
    mEndsWriting = true;
    if (!hasRest()) static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
}

int ProxyEnd::takeError() const
{
    int error = 0;
    socklen_t length = sizeof(error);
    if (::getsockopt(mDescriptor, SOL_SOCKET, SO_ERROR, &error, &length) != 0) return errno;
    return error;
}

void ProxyEnd::cancel() noexcept { static_cast<void>(::shutdown(mDescriptor, SHUT_RDWR)); }

void ProxyEnd::reset()
{
    const linger atOnce{1, 0};
    static_cast<void>(::setsockopt(mDescriptor, SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce)));
    mIsBroken = true; // the descriptor is closed with this object
}

} // namespace qel::tool
