// Why a connection has ended, as the machine is told.

#include <qel/common/QelMessageDax.hpp>

#include "protocol/hypervisor/ScriptedMachine.hpp"
#include "protocol/server/ServedFixture.hpp"
#include "support/LoopbackEnds.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <cstring>
#include <gmock/gmock.h>
#include <sys/socket.h>

namespace qel::test {

namespace {

using protocol::Connection;
using protocol::ConnectionLimits;
using protocol::DisconnectReason;
using ::testing::ElementsAre;

class ConnectionEnd : public ServedFixture {
protected:
    ConnectionEnd()
    {
        auto scripted = std::make_unique<ScriptedMachine>();
        user = scripted.get();
        HypervisorFixture::serve(std::move(scripted));
    }

    void start(ConnectionLimits limits = {})
    {
        connection = ServedFixture::serve(loopback, limits);
        connection->start();
        ASSERT_EQ(messages.ask(versionRequest("a"))->getStatus(), 0U);
    }

    void expectEnd(DisconnectReason why)
    {
        awaitEnd(*connection);
        EXPECT_THAT(user->reasons, ElementsAre(why));
    }

    /// Sends the beginning of a request.
    void sendPart()
    {
        const QelMessageGetInterfaceLimitsReq request;
        loopback.near->write(request.serialize(), request.msgLength() - 1);
    }

    /// Closes with a reset.
    void reset()
    {
        constexpr linger kReset{1, 0};
        ASSERT_EQ(::setsockopt(loopback.near->getSocket().getFd(), SOL_SOCKET, SO_LINGER, &kReset, sizeof(kReset)), 0);
        loopback.near.reset();
    }

    ScriptedMachine* user = nullptr; // owned by the fixture
    Loopback loopback;
    LoopbackMessages messages{*loopback.near};
    std::unique_ptr<Connection> connection; // destroyed before what it borrows
};

TEST_F(ConnectionEnd, TheConsoleHasClosedIt)
{
    start();
    loopback.near.reset();
    expectEnd(DisconnectReason::Closed);
}

TEST_F(ConnectionEnd, ItBrokeWithinAMessage)
{
    start();
    sendPart();
    loopback.near.reset();
    expectEnd(DisconnectReason::Lost);
}

TEST_F(ConnectionEnd, ItWasReset)
{
    start();
    reset();
    expectEnd(DisconnectReason::Lost);
}

TEST_F(ConnectionEnd, ItWasCut)
{
    start();
    connection->abort();
    expectEnd(DisconnectReason::Lost);
}

TEST_F(ConnectionEnd, TheConsoleSentAMalformedFrame)
{
    start();
    QelMessageGetInterfaceLimitsReq request;
    std::vector<char> frame(request.serialize(), request.serialize() + request.msgLength());
    std::memset(frame.data(), 0, sizeof(std::uint32_t)); // the length
    loopback.near->write(frame.data(), frame.size());
    expectEnd(DisconnectReason::Protocol);
}

TEST_F(ConnectionEnd, TheConsoleDidNotFinishAMessage)
{
    ConnectionLimits limits;
    limits.frame = std::chrono::milliseconds(20);
    start(limits);
    sendPart();
    expectEnd(DisconnectReason::Timeout);
}

/// The server reads nothing from it, because it takes no responses.
TEST_F(ConnectionEnd, AConsoleThatIsNotReadHasHungUp)
{
    start();
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string piece(16000, 'x');
    for (int i = 0; i < 5; ++i)
        messages.send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, piece.data()));
    while (hypervisor->mayReceive(1))
        std::this_thread::yield();
    loopback.near.reset();
    expectEnd(DisconnectReason::Closed);
}

class IdleConnection : public ConnectionEnd {
protected:
    static constexpr std::chrono::seconds kTimeout{600};
    static constexpr std::chrono::seconds kLinger{2};

    IdleConnection()
    {
        hypervisor.reset();
        hypervisor = std::make_unique<protocol::HypervisorEngine>(
            *machine, protocol::HypervisorEngine::kDefaultMaxConsoles, [] {}, protocol::IdleLimits{kTimeout, kLinger});
    }

    ~IdleConnection() override { connection.reset(); } // its threads read the clock

    void pass(std::chrono::seconds time)
    {
        clock.advance(time);
        hypervisor->serviceLines();
    }

    SettableClock clock;
};

TEST_F(IdleConnection, GetsTheNoticeAndTheEnd)
{
    start();
    pass(kTimeout);
    loopback.near->setReadDeadline(Loopback::kDeadline); // the one before has passed
    EXPECT_NE(dynamic_cast<const QelMessageKrogConnectionClosedAsync*>(messages.receive().get()), nullptr);
    EXPECT_TRUE(messages.isClosed());
    expectEnd(DisconnectReason::Idle);
}

TEST_F(IdleConnection, IsCutWhenItTakesNothing)
{
    constexpr int kSmall = 4096; // less than is queued fits the buffers of the system
    ASSERT_EQ(::setsockopt(loopback.near->getSocket().getFd(), SOL_SOCKET, SO_RCVBUF, &kSmall, sizeof(kSmall)), 0);
    ASSERT_EQ(::setsockopt(loopback.far->getSocket().getFd(), SOL_SOCKET, SO_SNDBUF, &kSmall, sizeof(kSmall)), 0);
    start();
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    while (!hypervisor->serialWatches().empty()) { // until its queue is full
        port1->output = {std::string(4096, 'x')};
        hypervisor->serviceSerial(1);
    }
    pass(kTimeout);
    EXPECT_FALSE(connection->hasEnded());
    pass(kLinger);
    expectEnd(DisconnectReason::Idle);
}

} // namespace

} // namespace qel::test
