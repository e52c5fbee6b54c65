// How virtual serial sessions of a console end: on one thread, against a fake hypervisor end.

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/SerialSessionFixture.hpp"
#include "support/Errors.hpp"
#include "support/SettableClock.hpp"

#include <array>
#include <functional>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

// The end.

TEST_F(SerialSessionTest, ANoticeEndsTheSessionWithItsReason)
{
    struct Row {
        unsigned int reason;
        SessionEnd end;
        const char* text;
    };
    const Row rows[] = {
        {0, SessionEnd::Unknown, "session closed: unknown reason"},
        {1, SessionEnd::Unknown, "session closed: unknown reason"},
        {2, SessionEnd::Taken, "session closed: taken or closed by another console"},
        {3, SessionEnd::ShutDown, "session closed: the server shut down"},
        {4, SessionEnd::CommandEnded, "session closed: the command ended"},
        {5, SessionEnd::WriteFailure, "session closed: the partition takes no input"},
        {9, SessionEnd::Unknown, "session closed: unknown reason"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.reason);
        open();
        receive(output("last words"));
        receive(closed(static_cast<ClosedNotice::CloseReason>(row.reason)));
        EXPECT_EQ(session->getEnd(), row.end);
        EXPECT_EQ(session->describeEnd(), row.text);
        EXPECT_STREQ(describe(row.end), row.text);
        receive(output("late"));
        EXPECT_EQ(read(), "last words");
        EXPECT_EQ(read(), "") << "the end, again and again";
        EXPECT_EQ(read(), "");
    }
}

TEST_F(SerialSessionTest, TheEndSaysHowTheCommandEnded)
{
    open();
    EXPECT_EQ(session->getCommandEnd().kind, CommandEnd::Kind::Unknown);
    receive(exitedWith3());
    EXPECT_EQ(session->getCommandEnd().kind, CommandEnd::Kind::Exited);
    EXPECT_EQ(session->getCommandEnd().number, 3U);
    EXPECT_EQ(session->describeEnd(), "session closed: the command exited with status 3");
}

TEST_F(SerialSessionTest, TheConnectionClosedNoticeEndsTheSession)
{
    open();
    receive(output("last words"));
    end->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(read(), "last words");
    EXPECT_EQ(read(), "");
    EXPECT_EQ(session->getEnd(), SessionEnd::ConnectionClosed);
    EXPECT_EQ(session->describeEnd(), "the server closed the connection");
    EXPECT_THAT([&] { console->process(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(SerialSessionTest, ALostConnectionThrowsAfterTheOutputHasBeenRead)
{
    open();
    receive(output("last words"));
    end->end();
    EXPECT_EQ(read(), "last words");
    EXPECT_THAT([&] { read(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

// Closing.

TEST_F(SerialSessionTest, ClosingSendsItsRequest)
{
    open();
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0403U));
    EXPECT_EQ(received<QelMessageVirtualSerialCloseReq>(0).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialCloseReq>(0).getVssConnectionNumber(), 3U);
    EXPECT_FALSE(received<QelMessageVirtualSerialCloseReq>(0).isForceClose());
    EXPECT_EQ(session->getEnd(), SessionEnd::Closed);
    EXPECT_EQ(session->describeEnd(), "session closed");
    session->close();
    session.reset();
    EXPECT_THAT(operations(), ElementsAre(0x0403U)) << "once";
}

TEST_F(SerialSessionTest, ASessionThatHasEndedIsNotClosedAgain)
{
    for (const auto reason : {ClosedNotice::CloseReasonReadFailure, ClosedNotice::CloseReasonQelShutdown}) {
        open();
        receive(closed(reason));
        session->close();
        session.reset();
        EXPECT_THAT(end->received, IsEmpty());
    }
}

TEST_F(SerialSessionTest, NothingIsSentOverAConnectionThatCloses)
{
    open();
    end->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(read(), "");
    session->close();
    session.reset();
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(SerialSessionTest, OutputDuringClosingIsKept)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        end->push(output("last words"));
        end->grant(message);
    };
    session->close();
    EXPECT_EQ(available(), "last words");
    EXPECT_EQ(read(), "");
}

TEST_F(SerialSessionTest, ASessionMayEndWhileItIsClosed)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        end->push(exitedWith3());
        end->respond(message, QelMessageStatusConnectionClosureFailure);
    };
    session->close();
    EXPECT_EQ(session->getEnd(), SessionEnd::CommandEnded);
    EXPECT_EQ(session->describeEnd(), "session closed: the command exited with status 3");
}

TEST_F(SerialSessionTest, ARefusalToCloseIsReported)
{
    open();
    refuse(QelMessageOpCloseVirtualSerialSession, QelMessageStatusConnectionClosureFailure);
    try {
        session->close(std::chrono::seconds(1));
        ADD_FAILURE() << "closed";
    } catch (const StatusError& error) {
        EXPECT_EQ(error.getStatus(), QelMessageStatusConnectionClosureFailure);
    }
}

TEST_F(SerialSessionTest, ClosingTheHypervisorSessionEndsAllSessions)
{
    open();
    SerialSession other = console->openSerial(8);
    end->forget();
    console->closeSession();
    EXPECT_EQ(session->getEnd(), SessionEnd::Closed);
    EXPECT_EQ(other.getEnd(), SessionEnd::Closed);
    session->close();
    EXPECT_THAT(operations(), ElementsAre(0x0103U));
}

TEST_F(SerialSessionTest, DestructionClosesTheSessionWithoutWaiting)
{
    open();
    std::unique_ptr<QelMessage> request;
    end->onMessage = [&](const QelMessage& message) { request = message.clone(); };
    session.reset();
    ASSERT_NE(request, nullptr);
    EXPECT_EQ(request->getOperation(), 0x0403U);
    end->respond(*request, QelMessageStatusNoError);
    EXPECT_TRUE(console->process()) << "the response is dropped";
    receive(output("late"));
}

TEST_F(SerialSessionTest, DestructionSendsNothingOverAStreamThatCannotTellWhetherItTakesIt)
{
    console.emplace(FakeHypervisorEnd::makeConsole(end));
    open();
    session.reset();
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(SerialSessionTest, AMovedSessionIsNotClosed)
{
    open();
    SerialSession moved(std::move(*session));
    session.reset();
    EXPECT_THAT(end->received, IsEmpty());
    receive(output("x"));
    EXPECT_EQ(moved.getAvailable(), 1U);
    SerialSession other = console->openSerial(8);
    end->forget();
    other = std::move(moved);
    EXPECT_THAT(operations(), ElementsAre(0x0403U)) << "the session of partition 8";
    EXPECT_EQ(other.getPartition(), 7U);
    EXPECT_EQ(other.getAvailable(), 1U);
}

TEST_F(SerialSessionTest, ASessionMayOutliveItsConsole)
{
    open();
    receive(output("left"));
    console.reset();
    EXPECT_EQ(read(), "left");
    EXPECT_THAT([&] { read(); }, failsWith<Error>("this console is closed"));
    EXPECT_THAT([&] { session->write("x"); }, failsWith<Error>("this console is closed"));
    EXPECT_THAT([&] { session->close(); }, failsWith<Error>("this console is closed"));
    session.reset();
}

} // namespace

} // namespace qel::test
