#pragma once

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>

#include <chrono>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <utility>

namespace qel::test {

/// Two ends of one TCP connection over loopback.
struct Loopback {
    static constexpr std::chrono::seconds kDeadline{20};

    Loopback()
    {
        Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(listener.getSocketName(), kDeadline);
        near = std::make_unique<SocketStream>(std::move(socket));
        near->setReadDeadline(kDeadline);
        far = std::make_unique<SocketStream>(listener.accept());
    }

    std::unique_ptr<SocketStream> near; ///< the test's end; its reads have a deadline
    std::unique_ptr<SocketStream> far;
};

/// Frames over the test's end of a connection.
class LoopbackMessages {
public:
    explicit LoopbackMessages(Stream& stream) : mStream(stream), mMessages(stream, mRegistry) {}

    void send(const QelMessage& message) { mMessages.write(message); }
    std::unique_ptr<QelMessage> receive() { return mMessages.read(); }
    template <typename T>
    std::unique_ptr<T> receive()
    {
        std::unique_ptr<QelMessage> message = receive();
        return qelMessageCast<T>(message);
    }
    std::unique_ptr<QelMessage> ask(const QelMessage& request)
    {
        send(request);
        return receive();
    }
    Stream& stream() { return mStream; }
    void sendBytes(const std::string& bytes) { mStream.write(bytes.data(), bytes.size()); }

    /// True when the peer has closed the connection and no byte was left to read.
    bool isClosed()
    {
        char byte = 0;
        return mStream.read(&byte, 1) == 0;
    }

private:
    Stream& mStream;
    QelMessageRegistry mRegistry;
    QelMessageStream mMessages;
};

} // namespace qel::test
