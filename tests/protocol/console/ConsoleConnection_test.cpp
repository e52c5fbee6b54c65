// What ends a connection, deadlines, notices, the hypervisor session and leaving: against a fake hypervisor end.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/ConsoleFixture.hpp"
#include "support/Errors.hpp"
#include "support/SettableClock.hpp"

#include <cerrno>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <unistd.h>
#include <utility>
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

class ConsoleFailures : public ConsoleTestBase {};
class ConsoleDeadlines : public ConsoleTestBase {};
class ConsoleNotices : public ConsoleTestBase {};
class ConsoleEnd : public ConsoleTestBase {};

// Failures.

TEST_F(ConsoleFailures, AFailureIsThrownByEveryLaterCall)
{
    answerNothing();
    auto pending = console.start(request);
    end->end();
    EXPECT_THAT([&] { console.process(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_THAT([&] { console.process(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_THAT([&] { console.request(request); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_THAT([&] { console.send(QelMessageKrogConnectionClosedAsync()); },
                failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_THAT([&] { pending.get(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_EQ(end->received.size(), 1U) << "nothing is sent any more";
}

TEST_F(ConsoleFailures, AMalformedFrameBreaksTheProtocol)
{
    end->onMessage = [this](const QelMessage&) { end->pushBytes(std::string(40, 'x')); };
    EXPECT_THAT([&] { console.request(request); },
                failsWith<ProtocolBroken>("the peer broke the protocol: Invalid length"));
}

TEST_F(ConsoleFailures, AFailureWhileSendingLeavesReceivingAsItIs)
{
    end->push(QelMessageKrogConnectionClosedAsync());
    end->failWrites([] {
        try {
            throw PosixError(EPIPE, "socket stream send failure");
        } catch (const PosixError&) {
            std::throw_with_nested(StreamIOException("socket stream send failure"));
        }
    });
    const std::string text =
        "connection lost: socket stream send failure: socket stream send failure: 32 (Broken pipe)";
    EXPECT_THAT([&] { console.request(request); }, failsWith<ClosedByPeer>(text));
    EXPECT_THAT([&] { console.request(request); }, failsWith<ClosedByPeer>(text));
    EXPECT_THAT([&] { console.process(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(ConsoleFailures, AMessageThatIsNotTakenInTimeEndsSending)
{
    end->failWrites([] { throw StreamIOException("I/O deadline"); });
    EXPECT_THAT([&] { console.request(request); },
                failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
    end->failWrites({});
    EXPECT_THAT([&] { console.request(request); },
                failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"))
        << "a part of the message may have been sent";
}

TEST_F(ConsoleFailures, AMessageThatStopsInTheMidstEndsTheConnection)
{
    end->onMessage = [this](const QelMessage&) { end->pushBytes(std::string("\xDE\xCA\xFF\x20\0\0\0\x50", 8)); };
    EXPECT_THAT([&] { console.request(request); },
                failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
    EXPECT_THAT([&] { console.process(); }, failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
}

TEST_F(ConsoleFailures, TheErrorNamesTheServerAndNestsTheCause)
{
    end->end();
    try {
        console.process();
        ADD_FAILURE() << "received";
    } catch (const ClosedByPeer& error) {
        EXPECT_EQ(error.getPeer(), "fake:1");
        EXPECT_THROW(std::rethrow_if_nested(error), StreamIOException);
    }
}

// Deadlines.

TEST_F(ConsoleDeadlines, ARequestHasItsTimeoutForSendingAndReceiving)
{
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    SettableClock clock;
    console.request(request, std::chrono::milliseconds(1234));
    // Until the first byte, and from there to the last.
    EXPECT_THAT(end->readDeadlines, ElementsAre(std::chrono::milliseconds(1234), std::chrono::milliseconds(1234)));
    EXPECT_THAT(end->writeDeadlines, ElementsAre(std::chrono::milliseconds(1234)));
}

TEST_F(ConsoleDeadlines, AMessageHasTheFrameTimeoutFromItsFirstByteOn)
{
    ConsoleOptions options = FakeHypervisorEnd::plainOptions();
    options.frameTimeout = std::chrono::milliseconds(77);
    options.requestTimeout = std::chrono::milliseconds(500);
    Console other = FakeHypervisorEnd::makeConsole(end, options);
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    SettableClock clock;
    other.request(request);
    EXPECT_THAT(end->readDeadlines, ElementsAre(std::chrono::milliseconds(500), std::chrono::milliseconds(77)));
    EXPECT_THAT(end->writeDeadlines, ElementsAre(std::chrono::milliseconds(77)));
}

TEST_F(ConsoleDeadlines, WithoutALimitOnlyTheFrameTimeoutApplies)
{
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    console.request(request, std::chrono::milliseconds(-1));
    EXPECT_THAT(end->readDeadlines, ElementsAre(std::chrono::milliseconds(-1), std::chrono::milliseconds(10000)));
}

TEST_F(ConsoleDeadlines, ProcessingWaitsForTheBeginningOfAMessageOnly)
{
    end->push(QelMessageGetQelTodReq());
    SettableClock clock;
    EXPECT_TRUE(console.process(std::chrono::milliseconds(5)));
    EXPECT_THAT(end->readDeadlines, ElementsAre(std::chrono::milliseconds(5), std::chrono::milliseconds(10000)));
    EXPECT_FALSE(console.process());
    EXPECT_EQ(end->readDeadlines.back(), std::chrono::milliseconds(0));
}

// Notices.

TEST_F(ConsoleNotices, NoticesGoToTheHandlersOfTheirClass)
{
    std::vector<std::string> broadcasts;
    std::vector<unsigned int> others;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
        [&](const QelMessageDaxBroadcastOutboundAsync& notice) { broadcasts.push_back(notice.getSenderToolId()); });
    console.onOtherNotice([&](const QelMessage& notice) { others.push_back(notice.getOperation()); });
    end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    end->push(QelMessageGetQelTodReq()); // what a hypervisor should not send
    end->push(QelMessageGeneric(1, 0x7000, 0x1234, NoFlagSet));
    end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 1, "x")); // of no session
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    EXPECT_NO_THROW(console.request(request));
    EXPECT_THAT(broadcasts, ElementsAre("them"));
    EXPECT_THAT(others, ElementsAre(0x0107U, 0x1234U, 0x0401U));
}

TEST_F(ConsoleNotices, WithoutAHandlerNoticesAreDropped)
{
    log.clear();
    end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    EXPECT_NO_THROW(console.request(request));
    EXPECT_THAT(log.lines(), ::testing::Contains(StartsWith("D: [qel] ignored [CID: ")));
}

TEST_F(ConsoleNotices, AHandlerCanBeRemoved)
{
    int calls = 0;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto&) { ++calls; });
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(nullptr);
    console.onOtherNotice([&](const QelMessage&) { ++calls; });
    console.onOtherNotice(nullptr);
    end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    EXPECT_TRUE(console.process());
    EXPECT_EQ(calls, 0);
}

TEST_F(ConsoleNotices, AHandlerMayReplaceItself)
{
    std::string heard;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>([&, text = std::string(100, 'a')](const auto&) {
        console.onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto&) { heard += "second"; });
        heard += text;
    });
    for (int i = 0; i < 2; ++i) {
        end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
        EXPECT_TRUE(console.process());
    }
    EXPECT_EQ(heard, std::string(100, 'a') + "second");
}

TEST_F(ConsoleNotices, AHandlerMaySendRequests)
{
    std::time_t time = 0;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
        [&](const auto&) { time = timeOf(*console.request(QelMessageGetQelTodReq())); });
    std::time_t next = 1;
    end->onMessage = [&](const QelMessage& message) {
        if (next == 1) end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), next++));
    };
    EXPECT_EQ(timeOf(*console.request(request)), 1);
    EXPECT_EQ(time, 2);
}

TEST_F(ConsoleNotices, AnExceptionOfAHandlerDoesNoHarm)
{
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>([](const auto&) { throw std::out_of_range("mine"); });
    end->push(QelMessageDaxBroadcastOutboundAsync(1, 7, "them", "x"));
    EXPECT_THAT([&] { console.process(); }, ThrowsMessage<std::out_of_range>(StrEq("mine")));
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    EXPECT_NO_THROW(console.request(request));
}

TEST_F(ConsoleNotices, AMalformedNoticeBreaksTheProtocolForItsHandler)
{
    QelMessageGeneric malformed{QelMessageDaxBroadcastOutboundAsync(0, 1, "", "")};
    malformed.setData(std::string(41, '\0').data(), 41);
    end->push(malformed);
    EXPECT_TRUE(console.process()) << "nobody listens";
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>([](const auto&) { ADD_FAILURE(); });
    end->push(malformed);
    EXPECT_THAT([&] { console.process(); },
                failsWith<ProtocolBroken>(StartsWith("the peer broke the protocol: malformed notice [CID: ")));
}

TEST_F(ConsoleNotices, TheConnectionClosedNoticeEndsTheConnection)
{
    bool isTold = false;
    console.onNotice<QelMessageKrogConnectionClosedAsync>([&](const auto&) { isTold = true; });
    end->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_THAT([&] { console.request(request); }, failsWith<ClosedByPeer>("the server closed the connection"));
    EXPECT_TRUE(isTold);
    EXPECT_THAT([&] { console.process(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(ConsoleNotices, TheAbortNoticeEndsTheConnection)
{
    end->push(QelMessageAbortHandshakeAsync());
    EXPECT_THAT([&] { console.request(request); },
                failsWith<TurnedAway>("the server refused the connection: it accepts only TLS"));
}

// The hypervisor session.

TEST_F(ConsoleEnd, TheHypervisorSessionIsOpenedAndClosedOnce)
{
    console.closeSession();
    console.openSession();
    console.openSession();
    EXPECT_THAT(operations(), ElementsAre(0x0102U));
    console.closeSession();
    console.closeSession();
    EXPECT_THAT(operations(), ElementsAre(0x0102U, 0x0103U));
}

TEST_F(ConsoleEnd, ARefusedSessionIsNotOpen)
{
    answerWithStatus(QelMessageStatusKrogSessionAlreadyOpen);
    EXPECT_THROW(console.openSession(), StatusError);
    EXPECT_THROW(console.openSession(std::chrono::seconds(1)), StatusError);
    EXPECT_THAT(operations(), ElementsAre(0x0102U, 0x0102U));
}

// The end.

TEST_F(ConsoleEnd, AfterLeavingEveryCallFails)
{
    console.leave();
    EXPECT_THAT([&] { console.request(request); }, failsWith<Error>("this console has left"));
    EXPECT_THAT([&] { console.process(); }, failsWith<Error>("this console has left"));
}

TEST_F(ConsoleEnd, AfterClosingEveryCallFails)
{
    console.close();
    EXPECT_THAT([&] { console.process(); }, failsWith<Error>("this console is closed"));
    EXPECT_THAT([&] { console.request(request); }, failsWith<Error>("this console is closed"));
}

TEST_F(ConsoleEnd, APendingResponseMayOutliveTheConsole)
{
    answerNothing();
    std::optional<Console> other(FakeHypervisorEnd::makeConsole(end));
    answerNothing();
    auto pending = other->start(request);
    other.reset();
    EXPECT_TRUE(pending.isReady());
    EXPECT_THAT([&] { pending.get(); }, failsWith<Error>("this console is closed"));
}

TEST_F(ConsoleEnd, AMovedConsoleGoesOn)
{
    answerNothing();
    auto pending = console.start(request);
    Console moved(std::move(console));
    FakeHypervisorEnd* second = nullptr;
    console = FakeHypervisorEnd::makeConsole(second);
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{3}));
    EXPECT_EQ(timeOf(*pending.get()), 3);
    EXPECT_FALSE(console.process());
    console = std::move(moved);
    EXPECT_FALSE(console.process());
}

TEST_F(ConsoleEnd, AGivenStreamCannotBeReplaced)
{
    EXPECT_THAT([&] { console.reconnect(std::chrono::seconds(1)); },
                ThrowsMessage<std::logic_error>(StrEq("reconnect: the stream was given to the console")));
}

TEST_F(ConsoleEnd, TheDescriptorCanBeWaitedOn)
{
    EXPECT_EQ(console.getPollFd(PollEvents::Read).mFd.fd, -1);
    FakeHypervisorEnd* other = nullptr;
    const Console second = FakeHypervisorEnd::makeConsole(other, FakeHypervisorEnd::plainOptions(), true);
    EXPECT_EQ(second.getPollFd(PollEvents::Read).mFd.fd, other->descriptor());
    EXPECT_EQ(second.getPollFd(PollEvents::Write).mFd.events, 0x3C);
    EXPECT_FALSE(second.hasPending());
}

} // namespace

} // namespace qel::test
