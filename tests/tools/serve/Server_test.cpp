// The server among its connections; as a process it is in tests/integration.

#include <qel/common/LogBackend.hpp>
#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "base/WakeUp.hpp"
#include "serve/Server.hpp"
#include "support/Authority.hpp"
#include "support/SettableClock.hpp"
#include "tools/serve/HypervisorFixture.hpp"
#include "tools/transport/Loopback.hpp"

#include <chrono>
#include <functional>
#include <future>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::Contains;
using ::testing::EndsWith;
using tool::ConnectionLimits;
using tool::Server;

/// Does something when a line with a certain part is logged.
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

/// A server that takes its time: whatever it ends soon, it has not ended because a time was over, unless the clock was
/// moved.
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

    /// Whatever the test came to, its consoles are gone by now, so that the server can end.
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

    /// A console that has asked for nothing yet. Its reads have a deadline, on the server's clock.
    std::unique_ptr<SocketStream> connect() const
    {
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(mEndpoint, Loopback::kDeadline);
        auto stream = std::make_unique<SocketStream>(std::move(socket));
        stream->setReadDeadline(Loopback::kDeadline);
        return stream;
    }

    /// Takes a message in the clear and expects that it is a T.
    template <typename T>
    static void expect(Stream& stream)
    {
        const auto message = QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).read();
        EXPECT_NE(dynamic_cast<const T*>(message.get()), nullptr) << message->getLogID();
    }

    /// Asks for TLS and gets it.
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
    tool::WakeUp mStop;
    std::unique_ptr<Server> mServer;
    std::future<void> mServed; // goes first, and waits for the thread
};

TEST_F(ServerTest, ConsolesOnTheirWayInAreNotWaitedForWhenItStops)
{
    serve();
    const auto silent = connect();
    const auto stalled = connect();
    ask(*stalled); // by now the other one, which came first, is there too
    stop();
    expect<QelMessageAbortHandshakeAsync>(*silent);
    EXPECT_TRUE(isClosed(*silent));
    EXPECT_TRUE(isClosed(*stalled));
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains(EndsWith(": not let in: the server stops")));
}

TEST_F(ServerTest, TheTimeForComingInIsNotGivenOnceMoreInsideTls)
{
    QelLogger::get().setLevel(LogLevel::Info);
    QelLogger::get().addBackend(std::make_shared<OnLine>(": over TLS: ", [this] { clock.advance(kTime); }));
    SSLClientContext context;
    context.setCredentials(Authority::trusted().clientCredentials());
    serve();
    auto socket = connect();
    ask(*socket);
    socket->clearReadDeadline(); // the clock will be moved
    SSLStream console(context, std::move(socket));
    console.handshake();
    // It says nothing more, and the time is over.
    auto closed = std::async(std::launch::async, [&console] { return isClosed(console); });
    EXPECT_EQ(closed.wait_for(Loopback::kDeadline), std::future_status::ready);
    console.close(); // if it was not
    EXPECT_TRUE(closed.get());
    stop();
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

} // namespace

} // namespace qel::test
