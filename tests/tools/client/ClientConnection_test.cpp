#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "base/Failures.hpp"
#include "client/ClientConnection.hpp"
#include "support/ScriptedStream.hpp"

#include <gmock/gmock.h>
#include <thread>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ClientConnection;
using tool::CommandFailure;
using tool::ExitStatus;
using tool::RequestRefused;

std::vector<char> frameOf(const QelMessage& message)
{
    return std::vector<char>(message.serialize(), message.serialize() + message.msgLength());
}

QelMessageGeneric responseTo(const QelMessage& request, QelMessageStatusCodes status = QelMessageStatusNoError)
{
    QelMessageGeneric response(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
    response.setStatus(status);
    return response;
}

class ClientConnectionTest : public ::testing::Test {
protected:
    ClientConnectionTest()
    {
        auto owned = std::make_unique<ScriptedStream>();
        stream = owned.get();
        connection = std::make_unique<ClientConnection>(std::move(owned));
    }

    void deliver(const QelMessage& message) { stream->deliver(frameOf(message)); }

    /// The exit status that a failing operation would end a command with.
    template <typename F>
    static ExitStatus exitStatusOf(F operation)
    {
        try {
            operation();
        } catch (const std::exception& error) {
            return tool::exitStatusOf(error);
        }
        return ExitStatus::Done;
    }

    ScriptedStream* stream = nullptr; // owned by the connection
    std::unique_ptr<ClientConnection> connection;
    const QelMessageGetQelTodReq request;
};

TEST_F(ClientConnectionTest, ARequestIsSentAndItsResponseReturned)
{
    deliver(responseTo(request));
    const auto response = connection->exchange(request);
    EXPECT_EQ(response->getCallerId(), request.getCallerId());
    EXPECT_THAT(stream->writes(), ElementsAre(frameOf(request)));
}

TEST_F(ClientConnectionTest, ExchangeReturnsARefusal)
{
    deliver(responseTo(request, QelMessageStatusInvalidData));
    EXPECT_EQ(connection->exchange(request)->getStatus(), QelMessageStatusInvalidData);
}

TEST_F(ClientConnectionTest, RequireThrowsOnARefusal)
{
    deliver(responseTo(request, QelMessageStatusInvalidData));
    EXPECT_THAT([&] { connection->require("the time", request); },
                ThrowsMessage<RequestRefused>(StrEq(
                    "the server does not accept the values in the request: 0x00000003 (QelMessageStatusInvalidData)")));
}

TEST_F(ClientConnectionTest, NoticesBeforeTheResponseGoToTheHandler)
{
    deliver(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    deliver(QelMessageGetQelTodReq()); // what a hypervisor should not send is handed on as well
    deliver(responseTo(request));
    std::vector<unsigned int> operations;
    connection->setNoticeHandler([&](const QelMessage& notice) { operations.push_back(notice.getOperation()); });
    EXPECT_NE(connection->exchange(request), nullptr);
    EXPECT_THAT(operations, ElementsAre(0x0B0BU, 0x0107U));
}

TEST_F(ClientConnectionTest, WithoutAHandlerNoticesAreDropped)
{
    deliver(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    deliver(responseTo(request));
    EXPECT_NE(connection->exchange(request), nullptr);
}

TEST_F(ClientConnectionTest, TheAbortNoticeEndsTheExchange)
{
    deliver(QelMessageAbortHandshakeAsync());
    EXPECT_THAT([&] { connection->exchange(request); },
                ThrowsMessage<CommandFailure>(StrEq("the server refused the connection: it accepts only TLS; give "
                                                    "credentials instead of --plain")));
    deliver(QelMessageAbortHandshakeAsync());
    EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::Refused);
}

TEST_F(ClientConnectionTest, APlainConnectionIsNotProtectedAndHasNothingPending)
{
    EXPECT_FALSE(connection->isProtected());
    EXPECT_FALSE(connection->hasPending());
}

TEST_F(ClientConnectionTest, EndOfTheHandshakeWithoutADeadlineChangesNoDeadline)
{
    connection->onHandshakeDone();
    EXPECT_TRUE(stream->readDeadlines().empty());
    EXPECT_TRUE(stream->writeDeadlines().empty());
}

TEST_F(ClientConnectionTest, TheConnectionClosedNoticeEndsTheExchange)
{
    deliver(QelMessageKrogConnectionClosedAsync());
    EXPECT_THAT([&] { connection->exchange(request); },
                ThrowsMessage<CommandFailure>(StrEq("the server closed the connection")));
    deliver(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::ClosedByPeer);
}

TEST_F(ClientConnectionTest, AResponseToAnotherRequestIsABrokenProtocol)
{
    deliver(responseTo(QelMessageGetQelTodReq()));
    EXPECT_THAT(
        [&] { connection->exchange(request); },
        ThrowsMessage<CommandFailure>(StrEq("the peer broke the protocol: a response to a request that was not sent")));
}

TEST_F(ClientConnectionTest, AResponseOfAnotherKindIsABrokenProtocol)
{
    for (const auto& identity : {std::make_pair(0x6003U, 0x0105U), std::make_pair(0x6002U, 0x0107U)}) {
        QelMessageGeneric other(request.getCallerId(), static_cast<unsigned short>(identity.first),
                                static_cast<unsigned short>(identity.second), MsgResponse);
        deliver(other);
        EXPECT_THAT([&] { connection->exchange(request); },
                    ThrowsMessage<CommandFailure>(
                        StrEq("the peer broke the protocol: a response of another kind than its request")));
        deliver(other);
        EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::ProtocolBroken);
    }
}

TEST_F(ClientConnectionTest, ABrokenFrameIsABrokenProtocol)
{
    stream->deliver(std::vector<char>(40, 'x'));
    EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::ProtocolBroken);
}

TEST_F(ClientConnectionTest, TheEndOfTheStreamIsAClosedConnection)
{
    stream->end();
    EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::ClosedByPeer);
}

TEST_F(ClientConnectionTest, AConnectionThatBreaksWhileSendingIsAClosedConnection)
{
    stream->failWriteAt(3, "socket stream send failure");
    EXPECT_EQ(exitStatusOf([&] { connection->exchange(request); }), ExitStatus::ClosedByPeer);
}

TEST_F(ClientConnectionTest, DeadlinesAreSetAndClearedForBothDirections)
{
    connection->setDeadline(std::chrono::milliseconds(250));
    connection->clearDeadline();
    EXPECT_THAT(stream->readDeadlines(), ElementsAre(std::chrono::milliseconds(250), std::chrono::milliseconds(-1)));
    EXPECT_THAT(stream->writeDeadlines(), ElementsAre(std::chrono::milliseconds(250), std::chrono::milliseconds(-1)));
}

TEST_F(ClientConnectionTest, MessagesAreSentAndReceivedWithoutAnExchange)
{
    deliver(QelMessageKrogConnectionClosedAsync());
    connection->send(request);
    EXPECT_THAT(stream->writes(), ElementsAre(frameOf(request)));
    EXPECT_EQ(connection->receive()->getOperation(), 0xA009U);
}

TEST_F(ClientConnectionTest, WithoutADescriptorThePollFdIsIgnored)
{
    EXPECT_EQ(connection->getPollFd(PollEvents::Read).mFd.fd, -1);
    const ClientConnection other(std::make_unique<ScriptedStream>(), 42);
    EXPECT_EQ(other.getPollFd(PollEvents::Read).mFd.fd, 42);
    EXPECT_EQ(other.getPollFd(PollEvents::Write).mFd.events, 0x3C);
}

TEST_F(ClientConnectionTest, LeavingClosesTheStream)
{
    connection->leave();
    EXPECT_EQ(stream->closeCount(), 1U);
}

TEST_F(ClientConnectionTest, IntroducingSendsTheIdentity)
{
    const unsigned int callerId = QelMessage::generateNextUint32() + 1; // the next request's
    deliver(QelMessageGetEnclTypeAndInterfaceVersionRsp(callerId, 'Q', 1, 0, "type", "serial"));
    tool::IdentityOptions identity;
    identity.toolType = 0x01020304;
    identity.toolId = "me";
    const auto response = tool::introduce(*connection, identity);
    EXPECT_EQ(qelMessageCast<QelMessageGetEnclTypeAndInterfaceVersionRsp>(*response).getSystemMachineType(), "type");
    const auto sent = stream->written();
    const QelMessageGetEnclTypeAndInterfaceVersionReq version(sent.data(), static_cast<unsigned int>(sent.size()));
    EXPECT_EQ(version.getToolType(), 0x01020304U);
    EXPECT_EQ(version.getToolId(), "me");
    EXPECT_EQ(version.getInterfaceVersion(), 1U);
    EXPECT_EQ(version.getMajorVersion(), 1U);
    EXPECT_EQ(version.getMinorVersion(), 0U);
}

TEST_F(ClientConnectionTest, OpeningTheSessionSendsItsRequest)
{
    const unsigned int callerId = QelMessage::generateNextUint32() + 1;
    QelMessageGeneric refusal(callerId, 0x6003, 0x0102, MsgResponse);
    refusal.setStatus(QelMessageStatusKrogSessionAlreadyOpen);
    deliver(refusal);
    EXPECT_THAT([&] { tool::openHypervisorSession(*connection); },
                ThrowsMessage<RequestRefused>(HasSubstr("this console has opened its session already: 0x00000017")));
}

// With real sockets.

tool::ConnectOptions plainTo(const IPEndpoint& endpoint, double timeoutSeconds)
{
    tool::ConnectOptions options;
    options.endpoint = endpoint.str();
    options.transport.plain = true;
    options.timeoutSeconds = timeoutSeconds;
    return options;
}

TEST(ClientConnection, WhereNobodyListensThereIsNoConnection)
{
    const IPEndpoint endpoint = [] {
        const Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        return listener.getSocketName();
    }(); // free again by now
    try {
        ClientConnection::connect(plainTo(endpoint, 10));
        ADD_FAILURE() << "connected";
    } catch (const CommandFailure& failure) {
        EXPECT_EQ(failure.getExitStatus(), ExitStatus::CannotConnect);
        EXPECT_THAT(failure.what(), HasSubstr("cannot connect to " + endpoint.str() + ": "));
        EXPECT_THAT(failure.what(), HasSubstr("111 (Connection refused)"));
    }
}

TEST(ClientConnection, TheTimeoutLimitsTheExchange)
{
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    const auto connection = ClientConnection::connect(plainTo(listener.getSocketName(), 0.1));
    const Socket silent = listener.accept();
    try {
        connection->exchange(QelMessageGetQelTodReq());
        ADD_FAILURE() << "answered";
    } catch (const std::exception& error) {
        EXPECT_EQ(tool::exitStatusOf(error), ExitStatus::DeadlinePassed);
    }
}

TEST(ClientConnection, TheHandshakeTimeoutEndsWithTheVersionRequest)
{
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    tool::ConnectOptions options = plainTo(listener.getSocketName(), 20);
    options.transport.handshakeSeconds = 0.1;
    const auto connection = ClientConnection::connect(options);
    SocketStream other(listener.accept());
    EXPECT_THROW(tool::introduce(*connection, {}), StreamIOException);

    const auto patient = ClientConnection::connect(options);
    SocketStream slow(listener.accept());
    QelMessageRegistry registry;
    QelMessageStream messages(slow, registry);
    std::thread server([&] {
        const auto version = messages.read();
        messages.write(responseTo(*version));
        const auto asked = messages.read();
        // Not before the time of the handshake is over.
        PollSet(slow.getSocket().getPollFd(PollEvents::Read)).wait(std::chrono::milliseconds(200));
        messages.write(responseTo(*asked));
    });
    tool::introduce(*patient, {});
    EXPECT_NO_THROW(patient->exchange(QelMessageGetQelTodReq()));
    server.join();
}

TEST(ClientConnection, LeavingWaitsForThePeer)
{
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    const auto connection = ClientConnection::connect(plainTo(listener.getSocketName(), 10));
    Socket other = listener.accept();
    std::string unread(100000, 'x');
    std::thread end([&] {
        EXPECT_GT(other.write(unread.data(), unread.size()), 0);
        char byte = 0;
        EXPECT_EQ(other.read(&byte, 1), 0); // it has said that nothing more comes
        other.shutdown();
    });
    connection->leave();
    end.join();
}

} // namespace

} // namespace qel::test
