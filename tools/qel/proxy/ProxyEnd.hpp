#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>

#include <cstddef>
#include <memory>
#include <string>

namespace qel::tool {

/// The stream below the TLS of one side. During the handshake it waits, as a stream does. From then on it takes what is
/// there and keeps what finds no room, so that one thread can serve many connections.
///
/// Lifetime: borrows the socket stream. Thread safety: one thread at a time.
class HandshakeStream final : public Stream {
public:
    explicit HandshakeStream(SocketStream& stream) : mStream(stream) {}
    ~HandshakeStream() override;

    /// The handshake is complete.
    void stopWaiting() noexcept { mWaits = false; }

    /// While waiting: as the stream below. Then: what has arrived, or 0 if that is nothing; see hasEnded().
    std::size_t read(char* buffer, std::size_t length) override;
    void write(const char* buffer, std::size_t length) override;
    void close() override { mStream.close(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream.setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream.setWriteDeadline(timeout); }

    /// The peer has ended its direction.
    bool hasEnded() const noexcept { return mHasEnded; }

    /// What found no room. @return false: the connection is broken
    bool flush();
    bool isEmpty() const noexcept { return mKept.empty(); }

private:
    SocketStream& mStream;
    bool mWaits = true;
    bool mHasEnded = false;
    std::string mKept;
};

/// One side of a proxied connection: a socket, with TLS or without. Nothing here waits, except in the handshake.
///
/// Ownership: owns the socket. Thread safety: one thread at a time; cancel() from any thread.
class ProxyEnd {
public:
    enum class Got { Bytes, Nothing, End, Broken };
    struct Reading {
        Got got;
        std::size_t bytes;
    };

    /// Takes a connected socket, or one that connects. Sets its options.
    explicit ProxyEnd(Socket socket);
    ~ProxyEnd();
    ProxyEnd(const ProxyEnd&) = delete;
    ProxyEnd& operator=(const ProxyEnd&) = delete;

    int descriptor() const noexcept { return mDescriptor; }

    /// For the steps before TLS, which wait.
    Stream& clear();

    /// Puts TLS on top; the handshake is the caller's. @throws SSLException
    SSLStream& protect(SSLContext& context);

    /// The steps that wait are complete.
    void stopWaiting();

    /// Reads what has arrived.
    Reading read(char* buffer, std::size_t length);

    /// Whether read() may have something that the descriptor does not report.
    bool mayHaveMore() const noexcept { return mMayHaveMore; }

    /// Sends what finds room. @return 0: nothing does now, or the connection is broken
    std::size_t write(const char* buffer, std::size_t length);

    /// Whether sent bytes still wait for room here.
    bool hasRest() const noexcept { return mBelow != nullptr && !mBelow->isEmpty(); }

    /// The connection can send nothing more, because the peer is gone.
    bool isBroken() const noexcept { return mIsBroken; }

    /// Sends the rest, if there is room for it.
    void flush();

    /// Ends the direction towards the peer, after what has been sent.
    void endWriting();

    /// The error that the system holds for the socket; 0: none.
    int takeError() const;

    /// From any thread: makes a handshake that waits fail.
    void cancel() noexcept;

    /// Closes the connection at once, with a reset.
    void reset();

    /// The addresses. @throws PosixError
    IPEndpoint here() const { return pSocket().getSocketName(); }
    IPEndpoint peer() const { return pSocket().getPeerName(); }

private:
    const Socket& pSocket() const noexcept { return mStream != nullptr ? mStream->getSocket() : mSocket; }
    Reading pReadTls(char* buffer, std::size_t length);
    Reading pReadSocket(char* buffer, std::size_t length);

    Socket mSocket;
    int mDescriptor;
    std::unique_ptr<SocketStream> mStream; // from clear() on: it owns the socket
    HandshakeStream* mBelow = nullptr;     // of mTls
    std::unique_ptr<SSLStream> mTls;
    bool mMayHaveMore = false;
    bool mIsBroken = false;
    bool mEndsWriting = false;
};

} // namespace qel::tool
