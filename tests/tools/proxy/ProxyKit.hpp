#pragma once

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "proxy/Proxy.hpp"
#include "tools/proxy/FlowKit.hpp"

#include <cerrno>
#include <chrono>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <utility>
#include <vector>

namespace qel::test {

/// Notes what a proxy tells. Read it when the proxy has stopped.
struct ProxyNotes : tool::ProxyObserver {
    void onFault(const tool::FlowPlace&, std::uint64_t, const tool::FaultRule&, const std::string& what) override
    {
        lines.push_back("fault: " + what);
    }
    void onNote(const tool::FlowPlace&, const std::string& text) override { lines.push_back(text); }
    void onConnectionNote(std::uint64_t, const std::string& text) override { lines.push_back(text); }
    void onEnd(const tool::FlowPlace& place) override
    {
        lines.push_back(std::string(tool::wayText(place.way)) + " end");
    }
    void onClosed(std::uint64_t, const std::string& why, const tool::FrameFlow&, const tool::FrameFlow&) override
    {
        lines.push_back("closed: " + why);
    }
    void onRefused(std::uint64_t, const std::string& why) override { lines.push_back("refused: " + why); }

    std::vector<std::string> lines;
};

/// A proxy that runs on a thread of its own, in front of a listener of the test.
class ProxyFixture {
public:
    static constexpr std::chrono::seconds kDeadline{20};

    explicit ProxyFixture(const std::vector<std::string>& rules = {}, tool::ProxyOptions options = {})
        : mListener(listenOn(IPEndpoint("127.0.0.1:0"), 8))
    {
        if (options.target.endpoints.empty()) options.target.endpoints = {mListener.getSocketName()};
        options.plan.rules = rulesOf(rules);
        options.plan.seed = 1;
        mProxy = std::make_unique<tool::Proxy>(std::move(options), notes);
        mThread = std::thread([this] { mProxy->run(mStop.getPollFd()); });
    }
    ~ProxyFixture() { stop(); }

    /// Ends the proxy. @return what it told
    const std::vector<std::string>& stop()
    {
        if (mThread.joinable()) {
            mStop.interrupt();
            mThread.join();
            mProxy->finish();
        }
        return notes.lines;
    }

    std::unique_ptr<SocketStream> connect()
    {
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(mProxy->endpoints().front(), kDeadline);
        return limited(std::move(socket));
    }
    /// True when a new connection is reset, be it while it is made.
    bool resetsNewConnection()
    {
        try {
            const auto stream = connect();
            char byte = 0;
            static_cast<void>(stream->read(&byte, 1));
            return false;
        } catch (const PosixError& error) {
            return error.getErrorCode() == PosixErrorCode(ECONNRESET);
        } catch (const StreamIOException&) {
            return true;
        }
    }
    std::unique_ptr<SocketStream> accept() { return limited(mListener.accept()); }

    Socket& listener() { return mListener; }

    ProxyNotes notes;

private:
    static std::unique_ptr<SocketStream> limited(Socket socket)
    {
        auto stream = std::make_unique<SocketStream>(std::move(socket));
        stream->setReadDeadline(kDeadline);
        return stream;
    }

    Socket mListener;
    protocol::WakeUp mStop;
    std::unique_ptr<tool::Proxy> mProxy;
    std::thread mThread;
};

inline void send(Stream& stream, const std::string& bytes) { stream.write(bytes.data(), bytes.size()); }

inline std::string receive(Stream& stream, std::size_t length)
{
    std::string bytes(length, '\0');
    stream.fill(bytes.data(), length);
    return bytes;
}

/// True when the peer has ended its direction and no byte was left to read.
inline bool isAtEnd(Stream& stream)
{
    char byte = 0;
    return stream.read(&byte, 1) == 0;
}

/// True when the connection has been reset.
inline bool isReset(Stream& stream)
{
    try {
        char byte = 0;
        static_cast<void>(stream.read(&byte, 1));
        return false;
    } catch (const StreamIOException&) {
        return true;
    }
}

inline void endWriting(const SocketStream& stream) { ::shutdown(stream.getSocket().getFd(), SHUT_WR); }

/// Closes it with a reset.
inline void resetStream(std::unique_ptr<SocketStream> stream)
{
    const linger atOnce{1, 0};
    ::setsockopt(stream->getSocket().getFd(), SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce));
}

} // namespace qel::test
