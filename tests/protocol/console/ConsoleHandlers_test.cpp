// What handlers may do while a console waits: against a fake hypervisor end.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"

#include <array>
#include <chrono>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using Broadcast = QelMessageDaxBroadcastOutboundAsync;
using ConnectionClosed = QelMessageKrogConnectionClosedAsync;

/// A console whose hypervisor end is ready to be written to, and read from, as the test says.
class ConsoleHandlers : public ::testing::Test {
protected:
    static Broadcast broadcast() { return Broadcast(1, 7, "them", "x"); }
    void answerNothing()
    {
        end->onMessage = [](const QelMessage&) {};
    }
    void answerTime(std::time_t time)
    {
        end->onMessage = [this, time](const QelMessage& message) {
            end->push(QelMessageGetQelTodRsp(message.getCallerId(), time));
        };
    }
    /// What the request throws whose console is destroyed by the handler of a notice.
    void destroyOn(const QelMessage& notice)
    {
        console->onNotice<Broadcast>([this](const auto&) { console.reset(); });
        console->onNotice<ConnectionClosed>([this](const auto&) { console.reset(); });
        end->push(notice);
    }

    const CapturedLog log{LogLevel::Warn};
    FakeHypervisorEnd* end = nullptr; // owned by the console
    std::optional<Console> console{FakeHypervisorEnd::makeConsole(end, FakeHypervisorEnd::plainOptions(), true)};
    const QelMessageGetQelTodReq request{};
};

// Requests.

TEST_F(ConsoleHandlers, AHandlerThatStartsTheSameRequestAndThrowsLeavesItUnderWay)
{
    answerNothing();
    const auto first = console->start(QelMessageGetQelTodReq());
    EXPECT_FALSE(console->process());
    std::optional<PendingResponse<QelMessageGetQelTodRsp>> inner;
    console->onNotice<Broadcast>([&](const auto&) {
        end->takeAgain();
        inner.emplace(console->start(request));
        throw std::out_of_range("mine");
    });
    end->stopTaking();
    end->push(broadcast());
    EXPECT_THAT([&] { console->exchange(request); }, ThrowsMessage<std::out_of_range>(StrEq("mine")));
    ASSERT_TRUE(inner);
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{5}));
    EXPECT_EQ(timeOf(*inner->get(milliseconds(5))), 5);
}

// Failures.

TEST_F(ConsoleHandlers, AnExceptionDoesNotHideTheEndOfTheConnection)
{
    SerialSession session = console->openSerial(1);
    console->onNotice<ConnectionClosed>([](const auto&) { throw std::out_of_range("mine"); });
    end->push(ConnectionClosed());
    EXPECT_THAT([&] { console->process(); }, ThrowsMessage<std::out_of_range>(StrEq("mine")));
    EXPECT_EQ(session.getEnd(), SessionEnd::ConnectionClosed);
    EXPECT_THAT([&] { console->request(request); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(ConsoleHandlers, APendingResponseIsReadyOnceNothingCanBeReceived)
{
    answerNothing();
    auto pending = console->start(request);
    end->end();
    EXPECT_THAT([&] { console->process(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_TRUE(pending.isReady());
    EXPECT_THAT([&] { pending.get(); }, failsWith<ClosedByPeer>("connection lost: EOF"));
}

TEST_F(ConsoleHandlers, APendingResponseIsReadyAfterTheConnectionClosedNotice)
{
    answerNothing();
    const auto pending = console->start(request);
    end->push(ConnectionClosed());
    EXPECT_THAT([&] { console->process(); }, failsWith<ClosedByPeer>("the server closed the connection"));
    EXPECT_TRUE(pending.isReady());
}

TEST_F(ConsoleHandlers, APendingResponseIsReadyOnceTheConsoleHasLeft)
{
    answerNothing();
    end->end();
    auto pending = console->start(request);
    console->leave();
    EXPECT_TRUE(pending.isReady());
    EXPECT_THAT([&] { pending.get(); }, failsWith<Error>("this console has left"));
}

// Lifetime. What these tests guard against shows itself under a sanitizer.

TEST_F(ConsoleHandlers, AHandlerMayDestroyTheConsoleThatWaitsForAResponse)
{
    answerNothing();
    destroyOn(broadcast());
    EXPECT_THAT([&] { console->request(request); }, failsWith<Error>("this console is closed"));
}

TEST_F(ConsoleHandlers, AHandlerMayDestroyTheConsoleThatProcesses)
{
    destroyOn(broadcast());
    EXPECT_TRUE(console->process());
    EXPECT_FALSE(console);
}

TEST_F(ConsoleHandlers, AHandlerMayDestroyTheConsoleWhoseConnectionCloses)
{
    destroyOn(ConnectionClosed());
    EXPECT_THAT([&] { console->process(); }, failsWith<Error>("this console is closed"));
    EXPECT_FALSE(console);
}

TEST_F(ConsoleHandlers, AHandlerMayDestroyThePendingResponseThatIsAwaited)
{
    answerNothing();
    auto pending = std::make_unique<PendingResponse<QelMessageGetQelTodRsp>>(console->start(request));
    console->onNotice<Broadcast>([&](const auto&) { pending.reset(); });
    end->push(broadcast());
    EXPECT_THAT([&] { pending->get(milliseconds(-1)); },
                ThrowsMessage<std::logic_error>(StrEq("the pending response was given up")));
}

TEST_F(ConsoleHandlers, AHandlerMayMoveThePendingResponseThatIsAwaited)
{
    answerNothing();
    auto pending = console->start(request);
    std::optional<PendingResponse<QelMessageGetQelTodRsp>> other;
    console->onNotice<Broadcast>([&](const auto&) { other.emplace(std::move(pending)); });
    end->push(broadcast());
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{5}));
    EXPECT_EQ(timeOf(*pending.get()), 5);
}

TEST_F(ConsoleHandlers, AHandlerMayDestroyTheSessionThatReads)
{
    std::optional<SerialSession> session(console->openSerial(1));
    console->onNotice<Broadcast>([&](const auto&) { session.reset(); });
    end->push(broadcast());
    std::array<char, 10> buffer;
    EXPECT_EQ(session->read(buffer.data(), buffer.size()), 0U);
}

TEST_F(ConsoleHandlers, AHandlerMayDestroyTheSessionThatWrites)
{
    std::optional<SerialSession> session(console->openSerial(1));
    console->onNotice<Broadcast>([&](const auto&) { session.reset(); });
    end->stopTaking();
    end->push(broadcast());
    EXPECT_EQ(session->write("x"), 0U);
}

TEST_F(ConsoleHandlers, AHandlerThatOwnsASessionGoesWithTheConsole)
{
    const auto mark = std::make_shared<int>(1);
    const auto session = std::make_shared<SerialSession>(console->openSerial(1));
    console->onNotice<Broadcast>([mark, session](const auto&) {});
    console->onOtherNotice([mark, session](const QelMessage&) {});
    console.reset();
    EXPECT_EQ(mark.use_count(), 1);
    EXPECT_EQ(session.use_count(), 1);
}

} // namespace

} // namespace qel::test
