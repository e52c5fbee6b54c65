// The server and its connections in one process; tests/integration runs it as a process of its own.

#include <qel/common/LogBackend.hpp>
#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "protocol/hypervisor/HypervisorFixture.hpp"
#include "server/Server.hpp"
#include "support/Authority.hpp"
#include "support/LoopbackEnds.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <functional>
#include <future>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::ConnectionLimits;
using protocol::Server;
using ::testing::Contains;
using ::testing::EndsWith;

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

/// A server with timeouts of an hour: nothing ends by a timeout unless the test moves the clock.
class ServerTest : public HypervisorFixture {
protected:
    static constexpr std::chrono::hours kTime{1};

    ServerTest()
    {
        Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 8);
        mEndpoint = listener.getSocketName();
        ConnectionLimits limits;
        limits.handshake = kTime;
        limits.linger = kTime;
        auto context = std::make_unique<SSLServerContext>();
        context->setCredentials(Authority::trusted().serverCredentials());
        mServer = std::make_unique<Server>(*hypervisor, std::move(listener), limits, std::move(context));
    }

    /// The consoles of the test are destroyed by now, so the server can end even after a failure.
    void TearDown() override { stop(); }

    /// Serves on a thread of its own until stop(), and then ends as the program does.
    void serve()
    {
        mServed = std::async(std::launch::async, [this] {
            mServer->run(mStop.getPollFd());
            hypervisor->shutDown();
            mServer->finish();
        });
    }
    void stop() { mStop.interrupt(); }
    bool hasEnded() const { return mServed.wait_for(Loopback::kDeadline) == std::future_status::ready; }

    /// A connection that has sent nothing yet. Its reads have a deadline, on the server's clock.
    std::unique_ptr<SocketStream> connect() const
    {
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(mEndpoint, Loopback::kDeadline);
        auto stream = std::make_unique<SocketStream>(std::move(socket));
        stream->setReadDeadline(Loopback::kDeadline);
        return stream;
    }

    /// Reads a message in the clear and expects a T.
    template <typename T>
    static void expect(Stream& stream)
    {
        const auto message = QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).read();
        EXPECT_NE(dynamic_cast<const T*>(message.get()), nullptr) << message->getLogID();
    }

    /// Asks for TLS and expects it to be granted.
    static void ask(Stream& stream)
    {
        QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
        expect<QelMessageUpgradeConnectionAsync>(stream);
    }

    static bool isClosed(Stream& stream)
    {
        char byte = 0;
        return stream.read(&byte, 1) == 0;
    }

    SettableClock clock;

private:
    IPEndpoint mEndpoint;
    protocol::WakeUp mStop;
    std::unique_ptr<Server> mServer;
    std::future<void> mServed; // destroyed first; waits for the thread
};

TEST_F(ServerTest, StopsWithoutWaitingForUnfinishedHandshakes)
{
    serve();
    const auto silent = connect();
    const auto stalled = connect();
    ask(*stalled); // the other connection came first, so it is accepted too
    stop();
    expect<QelMessageAbortHandshakeAsync>(*silent);
    EXPECT_TRUE(isClosed(*silent));
    EXPECT_TRUE(isClosed(*stalled));
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains(EndsWith(": refused: the server stops")));
}

TEST_F(ServerTest, TheHandshakeDeadlineContinuesInsideTls)
{
    QelLogger::get().setLevel(LogLevel::Info);
    QelLogger::get().addBackend(std::make_shared<OnLine>(": over TLS: ", [this] { clock.advance(kTime); }));
    SSLClientContext context;
    context.setCredentials(Authority::trusted().clientCredentials());
    serve();
    auto socket = connect();
    ask(*socket);
    socket->clearReadDeadline(); // the test moves the clock
    SSLStream console(context, std::move(socket));
    console.handshake();
    // It sends nothing more, and the deadline has passed.
    auto closed = std::async(std::launch::async, [&console] { return isClosed(console); });
    EXPECT_EQ(closed.wait_for(Loopback::kDeadline), std::future_status::ready);
    console.close(); // in case it was not closed
    EXPECT_TRUE(closed.get());
    stop();
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

} // namespace

} // namespace qel::test
