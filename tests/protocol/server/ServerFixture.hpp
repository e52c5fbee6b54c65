#pragma once

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/LogBackendThrottled.hpp>
#include <qel/protocol/MemoryStream.hpp>
#include <qel/protocol/Server.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "support/Authority.hpp"
#include "support/CapturedLog.hpp"
#include "support/LoopbackEnds.hpp"

#include <functional>
#include <future>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <utility>

namespace qel::test {

/// Runs a function when a line with a given part is logged.
class OnLine : public LogBackend {
public:
    OnLine(std::string part, std::function<void()> work) : mPart(std::move(part)), mWork(std::move(work)) {}
    void log(LogLevel::Level, const std::string& line) override
    {
        if (line.find(mPart) != std::string::npos) mWork();
    }

private:
    const std::string mPart;
    const std::function<void()> mWork;
};

/// A server, the thread that runs it, and consoles that the test plays.
class ServerFixture : public ::testing::Test {
protected:
    static protocol::ServerOptions plainOptions()
    {
        protocol::ServerOptions options;
        options.plain = true;
        return options;
    }
    static protocol::ServerOptions tlsOptions()
    {
        protocol::ServerOptions options;
        options.credentials = protocol::Credentials::fromTexts(Authority::trusted().serverCredentials());
        return options;
    }

    /// Makes the server, in place of an earlier one.
    void make(const protocol::ServerOptions& options)
    {
        server.reset();
        server = std::make_unique<protocol::Server>(machine, options);
    }

    /// The consoles of the test are destroyed by now, so the server can end even after a failure.
    void TearDown() override
    {
        stop();
        if (mServed.valid()) mServed.wait();
    }

    /// Runs the server on a thread of its own until stop(), after which it ends, or pause(), after which it serves on.
    void run()
    {
        mStop.eoi();
        mEnds = true;
        mServed = std::async(std::launch::async, [this] {
            server->run(mStop.getPollFd());
            if (mEnds) server->finish();
        });
    }
    void stop() { mStop.interrupt(); }
    void pause()
    {
        mEnds = false;
        stop();
        mServed.wait();
    }
    bool hasEnded() const { return mServed.wait_for(Loopback::kDeadline) == std::future_status::ready; }
    PollFd stopFd() const { return mStop.getPollFd(); }

    /// A connection that has sent nothing yet. Its reads have a deadline.
    std::unique_ptr<SocketStream> connect() const { return connect(server->endpoints().front()); }
    static std::unique_ptr<SocketStream> connect(const IPEndpoint& to)
    {
        Socket socket(to.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(to, Loopback::kDeadline);
        auto stream = std::make_unique<SocketStream>(std::move(socket));
        stream->setReadDeadline(Loopback::kDeadline);
        return stream;
    }
    std::unique_ptr<Stream> connectInMemory(const std::string& address) const
    {
        auto ends = protocol::makeMemoryStreams();
        ends.first->setReadDeadline(Loopback::kDeadline);
        server->serve(std::move(ends.second), address);
        return std::move(ends.first);
    }
    std::unique_ptr<SSLStream> connectTls()
    {
        auto socket = connect();
        askForTls(*socket);
        auto stream = std::make_unique<SSLStream>(clientContext(), std::move(socket));
        stream->handshake();
        return stream;
    }

    /// Of consoles that the authority trusts.
    SSLClientContext& clientContext()
    {
        if (mClientContext == nullptr) {
            mClientContext = std::make_unique<SSLClientContext>();
            mClientContext->setCredentials(Authority::trusted().clientCredentials());
        }
        return *mClientContext;
    }

    /// Reads a message in the clear and expects a T.
    template <typename T>
    static void expect(Stream& stream)
    {
        const auto message = QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).read();
        EXPECT_NE(dynamic_cast<const T*>(message.get()), nullptr) << message->getLogID();
    }

    /// Asks for TLS and expects it to be granted.
    static void askForTls(Stream& stream)
    {
        QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
        expect<QelMessageUpgradeConnectionAsync>(stream);
    }

    /// @return the status of the response to the version request
    static unsigned int introduce(Stream& stream, const std::string& toolId)
    {
        return LoopbackMessages(stream)
            .ask(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 7, 2, 3, toolId))
            ->getStatus();
    }

    /// Whether a console can connect now and introduce itself.
    bool canIntroduce(const std::string& toolId) const
    {
        try {
            return introduce(*connect(), toolId) == 0;
        } catch (const StreamIOException&) {
            return false;
        }
    }

    /// @param afterMessage  a message may come first
    static bool isClosed(Stream& stream, bool afterMessage = false)
    {
        char byte = 0;
        if (!afterMessage) return stream.read(&byte, 1) == 0;
        while (stream.read(&byte, 1) != 0) {
        }
        return true;
    }

    CapturedLog log{LogLevel::Warn};
    protocol::Hypervisor machine;
    std::unique_ptr<protocol::Server> server;

private:
    protocol::WakeUp mStop;
    std::atomic<bool> mEnds = true; // set before the thread starts and before it is stopped
    std::unique_ptr<SSLClientContext> mClientContext;
    std::future<void> mServed; // destroyed first; waits for the thread
};

} // namespace qel::test
