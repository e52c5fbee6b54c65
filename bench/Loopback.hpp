#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>

#include <boost/asio.hpp>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>
#include <vector>

/// @file
/// What the contests over loopback have in common, with and without TLS: frames, connections, and how a peer receives.

namespace qel::bench {

constexpr std::size_t kPrefix = 8; // what is read of a frame first: it tells the length

/// A frame of exactly so many bytes.
inline std::unique_ptr<QelMessage> messageOf(std::size_t length)
{
    constexpr std::size_t kFixedPart = 38; // of a serial-data frame: header, address and length
    const std::vector<char> data(length - kFixedPart, 'x');
    return std::make_unique<QelMessageVirtualSerialDataToOsAsync>(static_cast<std::uint16_t>(1),
                                                                  static_cast<std::uint16_t>(0),
                                                                  static_cast<std::uint16_t>(data.size()), data.data());
}

/// The length of the frame that begins with these kPrefix bytes.
inline std::size_t frameLength(const char* prefix)
{
    be_uint32_t length;
    std::memcpy(&length, prefix + 4, sizeof(length));
    return length;
}

/// Both ends of a TCP connection over loopback, tuned as the library tunes them.
struct TcpPair {
    TcpPair()
    {
        Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        Socket connecting(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        connecting.connect(listener.getSocketName(), std::chrono::seconds(5));
        near = std::make_unique<SocketStream>(std::move(connecting));
        far = std::make_unique<SocketStream>(listener.accept());
    }

    int nearFd() const { return near->getSocket().getFd(); }
    int farFd() const { return far->getSocket().getFd(); }

    std::unique_ptr<SocketStream> near;
    std::unique_ptr<SocketStream> far;
};

inline void readAll(int descriptor, char* buffer, std::size_t length)
{
    while (length > 0) {
        const ssize_t count = ::read(descriptor, buffer, length);
        if (count <= 0) throw std::runtime_error("read");
        buffer += count;
        length -= static_cast<std::size_t>(count);
    }
}

inline void sendAll(int descriptor, const char* buffer, std::size_t length)
{
    while (length > 0) {
        const ssize_t count = ::send(descriptor, buffer, length, MSG_NOSIGNAL);
        if (count <= 0) throw std::runtime_error("send");
        buffer += count;
        length -= static_cast<std::size_t>(count);
    }
}

/// Reads one frame with two calls, as the message stream does.
inline void readFrame(int descriptor, char* buffer)
{
    readAll(descriptor, buffer, kPrefix);
    readAll(descriptor, buffer + kPrefix, frameLength(buffer) - kPrefix);
}

/// Duplicates of the pair's descriptors for Boost.Asio, which needs descriptors of its own.
struct AsioPair {
    AsioPair()
        : near(context, boost::asio::ip::tcp::v4(), ::dup(pair.nearFd())),
          far(context, boost::asio::ip::tcp::v4(), ::dup(pair.farFd()))
    {}

    TcpPair pair;
    boost::asio::io_context context{1};
    boost::asio::ip::tcp::socket near;
    boost::asio::ip::tcp::socket far;
};

/// What a program that uses Boost.Asio would receive into: a message that owns its bytes.
struct OwnedMessage {
    std::unique_ptr<char[]> bytes;
    std::size_t length;
};

/// Receives one frame from a stream of Boost.Asio.
template <typename AsioStream>
std::unique_ptr<OwnedMessage> asioRead(AsioStream& stream)
{
    char prefix[kPrefix];
    boost::asio::read(stream, boost::asio::buffer(prefix, kPrefix));
    auto message = std::make_unique<OwnedMessage>();
    message->length = frameLength(prefix);
    message->bytes.reset(new char[message->length]);
    std::memcpy(message->bytes.get(), prefix, kPrefix);
    boost::asio::read(stream, boost::asio::buffer(message->bytes.get() + kPrefix, message->length - kPrefix));
    return message;
}

} // namespace qel::bench
