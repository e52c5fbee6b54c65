#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "base/Failures.hpp"
#include "console/ConsoleSession.hpp"
#include "support/CapturedLog.hpp"
#include "tools/client/FakeHypervisorEnd.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::Eq;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ClientConnection;
using tool::CommandFailure;
using tool::ConsoleSession;
using tool::ExitStatus;
using tool::RequestRefused;
using tool::SessionEnd;

using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;
using DataNotice = QelMessageVirtualSerialDataToDaxAsync;

constexpr std::chrono::milliseconds kTimeout(1234);

/// Keeps what came.
struct RecordingReceiver : ConsoleSession::Receiver {
    std::string output;
    std::vector<std::string> broadcasts;

    void onOutput(const char* data, std::size_t length) override
    {
        if (length != 0) output.append(data, length);
    }
    void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast) override
    {
        broadcasts.push_back(broadcast.getSenderToolId());
    }
};

DataNotice dataFrom(std::uint16_t partition, std::uint16_t connection, const std::string& text)
{
    return DataNotice(partition, connection, static_cast<std::uint16_t>(text.size()), text.data());
}

/// The frame of a message with some other payload.
QelMessageGeneric withPayload(const QelMessage& message, const std::string& payload)
{
    QelMessageGeneric changed(message);
    changed.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return changed;
}

class ConsoleSessionTest : public ::testing::Test {
protected:
    ConsoleSessionTest()
    {
        auto owned = std::make_unique<FakeHypervisorEnd>();
        end = owned.get();
        connection = std::make_unique<ClientConnection>(std::move(owned));
        session.emplace(*connection, ConsoleSession::Address{7, 3}, kTimeout, receiver);
    }

    void open()
    {
        session->open(false);
        end->received.clear();
    }
    void receive(const QelMessage& message)
    {
        end->push(message);
        session->receive();
    }
    /// The operations of the messages that came, in order.
    std::vector<unsigned int> operations() const
    {
        std::vector<unsigned int> all;
        for (const auto& message : end->received)
            all.push_back(message->getOperation());
        return all;
    }
    template <typename T>
    const T& received(std::size_t index) const
    {
        return qelMessageCast<T>(*end->received.at(index));
    }
    void refuse(QelMessageOpTypes operation, QelMessageStatusCodes status)
    {
        end->onMessage = [this, operation, status](const QelMessage& message) {
            if (message.getOperation() == operation) return end->respond(message, status);
            end->grant(message);
        };
    }
    /// The exit status that receiving a message ends a command with.
    ExitStatus exitStatusOf(const QelMessage& message)
    {
        try {
            receive(message);
        } catch (const std::exception& error) {
            return tool::exitStatusOf(error);
        }
        return ExitStatus::Done;
    }

    CapturedLog log{LogLevel::Warn};
    FakeHypervisorEnd* end = nullptr; // owned by the connection
    std::unique_ptr<ClientConnection> connection;
    RecordingReceiver receiver;
    std::optional<ConsoleSession> session;
};

TEST_F(ConsoleSessionTest, OpeningTakesThreeRequests)
{
    session->open(false);
    EXPECT_THAT(operations(), ElementsAre(0x0102U, 0x0402U, 0x0406U));
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(1).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(1).getVssConnectionNumber(), 3U);
    EXPECT_FALSE(received<QelMessageVirtualSerialOpenReq>(1).isForceOpen());
    EXPECT_EQ(received<QelMessageVirtualSerialSetupSessionReq>(2).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialSetupSessionReq>(2).getVssConnectionNumber(), 3U);
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

TEST_F(ConsoleSessionTest, OpeningCanBeForced)
{
    session->open(true);
    EXPECT_TRUE(received<QelMessageVirtualSerialOpenReq>(1).isForceOpen());
}

TEST_F(ConsoleSessionTest, ARefusalOfAnyStepIsReportedAndEndsTheOpening)
{
    struct Row {
        QelMessageOpTypes operation;
        const char* text;
        std::size_t requests;
    };
    const Row rows[] = {
        {QelMessageOpOpenKrogSession, "open session refused: 0x00000013 (QelMessageStatusConnectionNotAvailable)", 1},
        {QelMessageOpOpenVirtualSerialSession,
         "partition 7 is held by another console; --force takes it: 0x00000013 "
         "(QelMessageStatusConnectionNotAvailable)",
         2},
        {QelMessageOpSetupVirtualSerialSession,
         "set up serial session refused: 0x00000013 (QelMessageStatusConnectionNotAvailable)", 3},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        end->received.clear();
        refuse(row.operation, QelMessageStatusConnectionNotAvailable);
        EXPECT_THAT([&] { session->open(false); }, ThrowsMessage<RequestRefused>(StrEq(row.text)));
        EXPECT_EQ(end->received.size(), row.requests);
    }
}

TEST_F(ConsoleSessionTest, InputIsSent)
{
    open();
    std::string typed("ls\r\0\xFF", 5);
    session->send(typed);
    EXPECT_EQ(typed, "");
    const auto& data = received<QelMessageVirtualSerialDataToOsAsync>(0);
    EXPECT_EQ(data.getLpId(), 7U);
    EXPECT_EQ(data.getVssConnectionNumber(), 3U);
    EXPECT_EQ(std::string(data.getSerialData(), data.getSerialDataLength()), std::string("ls\r\0\xFF", 5));
}

TEST_F(ConsoleSessionTest, AFullFrameIsSentAtATime)
{
    ASSERT_EQ(ConsoleSession::kMaxData, 16346U);
    open();
    std::string typed(16346, 'x');
    session->send(typed);
    EXPECT_EQ(typed, "");
    EXPECT_EQ(end->received.at(0)->msgLength(), 16384U);

    typed = std::string(16346, 'x') + "y";
    session->send(typed);
    EXPECT_EQ(typed, "y");
    EXPECT_EQ(end->received.at(1)->msgLength(), 16384U);
    session->send(typed);
    EXPECT_EQ(received<QelMessageVirtualSerialDataToOsAsync>(2).getSerialDataLength(), 1U);
}

TEST_F(ConsoleSessionTest, OutputGoesToTheReceiver)
{
    open();
    receive(dataFrom(7, 3, "one"));
    receive(dataFrom(7, 3, ""));
    receive(dataFrom(7, 3, std::string("\0\x1B two", 6)));
    EXPECT_EQ(receiver.output, "one" + std::string("\0\x1B two", 6));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(ConsoleSessionTest, NoticesOfAnotherSessionAreIgnored)
{
    open();
    receive(dataFrom(8, 3, "another partition"));
    receive(dataFrom(7, 0, "another connection"));
    receive(ClosedNotice(8, 3, ClosedNotice::CloseReasonForceClose));
    receive(ClosedNotice(7, 0, ClosedNotice::CloseReasonForceClose));
    EXPECT_EQ(receiver.output, "");
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
    EXPECT_EQ(log.lines().size(), 4U);
    EXPECT_THAT(log.lines(), Each(HasSubstr("ignored [CID: ")));
}

TEST_F(ConsoleSessionTest, NoticesBeforeTheSessionIsOpenAreIgnored)
{
    receive(dataFrom(7, 3, "early"));
    receive(ClosedNotice(7, 3, ClosedNotice::CloseReasonReadFailure));
    EXPECT_EQ(receiver.output, "");
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

TEST_F(ConsoleSessionTest, UnknownNoticesAreIgnored)
{
    open();
    receive(QelMessageGeneric(1, 0x7000, 0x1234, NoFlagSet));
    receive(QelMessageGetQelTodReq()); // a hypervisor asks nothing
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("OP: 0x1234"), HasSubstr("OP: 0x0107")));
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleSessionTest, ANoticeEndsTheSessionWithItsReason)
{
    struct Row {
        unsigned int reason;
        SessionEnd end;
        ExitStatus status;
        const char* text;
    };
    const Row rows[] = {
        {0, SessionEnd::Unknown, ExitStatus::ClosedByPeer, "session closed: unknown reason"},
        {1, SessionEnd::Unknown, ExitStatus::ClosedByPeer, "session closed: unknown reason"},
        {2, SessionEnd::Taken, ExitStatus::Refused, "session closed: taken or closed by another console"},
        {3, SessionEnd::ShutDown, ExitStatus::ClosedByPeer, "session closed: the server shut down"},
        {4, SessionEnd::CommandEnded, ExitStatus::Done, "session closed: the command ended"},
        {5, SessionEnd::WriteFailure, ExitStatus::ClosedByPeer, "session closed: the partition takes no input"},
        {9, SessionEnd::Unknown, ExitStatus::ClosedByPeer, "session closed: unknown reason"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.reason);
        session.emplace(*connection, ConsoleSession::Address{7, 3}, kTimeout, receiver);
        open();
        receive(ClosedNotice(7, 3, static_cast<ClosedNotice::CloseReason>(row.reason)));
        EXPECT_EQ(session->getEnd(), row.end);
        EXPECT_EQ(tool::exitStatusOf(row.end), row.status);
        EXPECT_STREQ(tool::describe(row.end), row.text);
        receive(dataFrom(7, 3, "late"));
        EXPECT_EQ(receiver.output, "");
    }
}

TEST_F(ConsoleSessionTest, AnOpenSessionHasNotEnded)
{
    EXPECT_EQ(tool::exitStatusOf(SessionEnd::None), ExitStatus::Done);
    EXPECT_STREQ(tool::describe(SessionEnd::None), "session open");
}

TEST_F(ConsoleSessionTest, TheEndOfTheConnectionEndsTheSession)
{
    open();
    receive(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(session->getEnd(), SessionEnd::ConnectionClosed);
    EXPECT_EQ(tool::exitStatusOf(SessionEnd::ConnectionClosed), ExitStatus::ClosedByPeer);
    EXPECT_STREQ(tool::describe(SessionEnd::ConnectionClosed), "the server closed the connection");
}

TEST_F(ConsoleSessionTest, BroadcastsGoToTheReceiver)
{
    open();
    receive(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    EXPECT_THAT(receiver.broadcasts, ElementsAre("them"));
}

TEST_F(ConsoleSessionTest, AnUnexpectedResponseBreaksTheProtocol)
{
    open();
    const QelMessageGeneric response(99, 0x6003, 0x0107, MsgResponse);
    EXPECT_THAT(
        [&] { receive(response); },
        ThrowsMessage<CommandFailure>(StrEq("the peer broke the protocol: a response to a request that was not sent")));
    EXPECT_EQ(exitStatusOf(response), ExitStatus::ProtocolBroken);
}

TEST_F(ConsoleSessionTest, AMalformedNoticeBreaksTheProtocol)
{
    open();
    const QelMessageGeneric malformed[] = {
        withPayload(dataFrom(7, 3, "x"), std::string("\0\7\0\3\0\2x", 7)), // says two bytes, has one
        withPayload(ClosedNotice(7, 3, ClosedNotice::CloseReasonReadFailure), std::string("\0\7\0\3\0\0\0", 7)),
        withPayload(QelMessageDaxBroadcastOutboundAsync(0, 1, "", ""), std::string(41, '\0')),
    };
    for (const QelMessageGeneric& message : malformed) {
        SCOPED_TRACE(message.getOperation());
        EXPECT_EQ(exitStatusOf(message), ExitStatus::ProtocolBroken);
        EXPECT_THAT([&] { receive(message); },
                    ThrowsMessage<CommandFailure>(HasSubstr("the peer broke the protocol: malformed notice [CID: ")));
    }
    EXPECT_EQ(receiver.output, "");
}

TEST_F(ConsoleSessionTest, TheEndOfTheStreamIsAnError)
{
    open();
    end->end();
    EXPECT_THAT([&] { session->receive(); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST_F(ConsoleSessionTest, ClosingTakesTwoRequests)
{
    open();
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0403U, 0x0103U));
    EXPECT_EQ(received<QelMessageVirtualSerialCloseReq>(0).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialCloseReq>(0).getVssConnectionNumber(), 3U);
    EXPECT_FALSE(received<QelMessageVirtualSerialCloseReq>(0).isForceClose());
}

TEST_F(ConsoleSessionTest, ASessionThatHasEndedIsNotClosedAgain)
{
    open();
    receive(ClosedNotice(7, 3, ClosedNotice::CloseReasonReadFailure));
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0103U));
}

TEST_F(ConsoleSessionTest, NothingIsSentToAHypervisorThatShutsDown)
{
    open();
    receive(ClosedNotice(7, 3, ClosedNotice::CloseReasonQelShutdown));
    session->close();
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleSessionTest, NothingIsSentOverAConnectionThatCloses)
{
    open();
    receive(QelMessageKrogConnectionClosedAsync());
    session->close();
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleSessionTest, OutputDuringClosingGoesToTheReceiver)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        end->push(dataFrom(7, 3, "last words"));
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
        end->grant(message);
    };
    session->close();
    EXPECT_EQ(receiver.output, "last words"); // those before the session was closed
    EXPECT_THAT(receiver.broadcasts, ElementsAre("them", "them"));
}

TEST_F(ConsoleSessionTest, ASessionMayEndWhileItIsClosed)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        if (message.getOperation() != QelMessageOpCloseVirtualSerialSession) return end->grant(message);
        end->push(ClosedNotice(7, 3, ClosedNotice::CloseReasonReadFailure));
        end->respond(message, QelMessageStatusConnectionClosureFailure);
    };
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0403U, 0x0103U));
    EXPECT_EQ(session->getEnd(), SessionEnd::CommandEnded);
}

TEST_F(ConsoleSessionTest, TheHypervisorMayShutDownWhileTheSessionIsClosed)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        end->push(ClosedNotice(7, 3, ClosedNotice::CloseReasonQelShutdown));
        end->respond(message, QelMessageStatusConnectionClosureFailure);
    };
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0403U));
    EXPECT_EQ(session->getEnd(), SessionEnd::ShutDown);
}

TEST_F(ConsoleSessionTest, ARefusalToCloseIsReported)
{
    open();
    refuse(QelMessageOpCloseVirtualSerialSession, QelMessageStatusConnectionClosureFailure);
    EXPECT_THAT([&] { session->close(); },
                ThrowsMessage<RequestRefused>(StrEq("this console does not hold partition 7: 0x00000014 "
                                                    "(QelMessageStatusConnectionClosureFailure)")));
    refuse(QelMessageOpCloseKrogSession, QelMessageStatusCmdFailed);
    EXPECT_THAT([&] { session->close(); }, ThrowsMessage<RequestRefused>(HasSubstr(
                                               "the server could not carry out the request; its log may say why: ")));
}

TEST_F(ConsoleSessionTest, EachMessageAndEachResponseHasTheTimeout)
{
    open();
    EXPECT_THAT(end->readDeadlines, IsEmpty()) << "opening has what connecting leaves";
    std::string typed = "x";
    session->send(typed);
    receive(dataFrom(7, 3, "x"));
    session->close();
    EXPECT_EQ(end->readDeadlines.size(), 4U);
    EXPECT_THAT(end->readDeadlines, Each(Eq(kTimeout)));
    EXPECT_THAT(end->writeDeadlines, Each(Eq(kTimeout)));
}

TEST_F(ConsoleSessionTest, DestructionRemovesTheNoticeHandler)
{
    open();
    session.reset();
    end->onMessage = [&](const QelMessage& message) {
        end->push(dataFrom(7, 3, "late"));
        end->grant(message);
    };
    EXPECT_NE(connection->exchange(QelMessageGetQelTodReq()), nullptr);
    EXPECT_EQ(receiver.output, "");
}

} // namespace

} // namespace qel::test
