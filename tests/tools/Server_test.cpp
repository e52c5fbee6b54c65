// The server among its connections; as a process it is in tests/integration.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>

#include "Server.hpp"
#include "WakeUp.hpp"
#include "support/Authority.hpp"
#include "tools/HypervisorFixture.hpp"
#include "tools/Loopback.hpp"

#include <chrono>
#include <future>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::Contains;
using ::testing::EndsWith;
using tool::ConnectionLimits;
using tool::Server;

/// A server that takes its time: whatever it ends soon, it has not ended because a time was over.
class ServerTest : public HypervisorFixture {
protected:
    ServerTest()
    {
        Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 8);
        mEndpoint = listener.getSocketName();
        ConnectionLimits limits;
        limits.handshake = std::chrono::hours(1);
        limits.linger = std::chrono::hours(1);
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

    /// A console that has asked for nothing yet. Its reads have a deadline.
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

    static bool isClosed(Stream& stream)
    {
        char byte = 0;
        return stream.read(&byte, 1) == 0;
    }

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
    QelMessageStream(*stalled, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
    expect<QelMessageUpgradeConnectionAsync>(*stalled); // by now the other one, which came first, is there too
    stop();
    expect<QelMessageAbortHandshakeAsync>(*silent);
    EXPECT_TRUE(isClosed(*silent));
    EXPECT_TRUE(isClosed(*stalled));
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains(EndsWith(": not let in: the server stops")));
}

} // namespace

} // namespace qel::test
