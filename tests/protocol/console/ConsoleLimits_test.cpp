// Deadlines that hold against any peer, and what a call leaves behind that gave up: against a fake hypervisor end.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "console/FrameLink.hpp"
#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "support/SettableClock.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <functional>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using Broadcast = QelMessageDaxBroadcastOutboundAsync;

constexpr milliseconds kShort(5);

ConsoleOptions impatientOptions()
{
    ConsoleOptions options = FakeHypervisorEnd::plainOptions();
    options.requestTimeout = kShort;
    return options;
}

class ConsoleLimits : public ::testing::Test {
protected:
    static Broadcast broadcast() { return Broadcast(1, 7, "them", "x"); }

    /// From now on the peer sends one notice after the other, each after 60 ms; and after 20 of them something else.
    void flood(SettableClock& clock, std::function<void()> last)
    {
        console.onNotice<Broadcast>([this, &clock, last = std::move(last)](const auto&) {
            clock.advance(milliseconds(60));
            if (++notices == 20) return last();
            end->push(broadcast());
        });
        end->push(broadcast());
    }
    void answerNothing()
    {
        end->onMessage = [](const QelMessage&) {};
    }
    std::vector<unsigned int> operations() const
    {
        std::vector<unsigned int> all;
        for (const auto& message : end->received)
            all.push_back(message->getOperation());
        return all;
    }
    /// Answers the next request of an operation only now, after that grants everything again.
    std::unique_ptr<QelMessage> giveUp(QelMessageOpTypes operation, const std::function<void()>& call)
    {
        std::unique_ptr<QelMessage> request;
        end->onMessage = [&](const QelMessage& message) {
            if (message.getOperation() != operation) return end->grant(message);
            request = message.clone();
        };
        EXPECT_THAT(call, failsWith<DeadlinePassed>(HasSubstr("no response to request")));
        end->onMessage = [this](const QelMessage& message) { end->grant(message); };
        end->forget();
        return request;
    }
    /// From now on answers an earlier request before each new one, which it refuses.
    void refuseAfter(const QelMessage& earlier, QelMessageStatusCodes status)
    {
        end->onMessage = [this, &earlier, status](const QelMessage& message) {
            end->respond(earlier, QelMessageStatusNoError);
            end->respond(message, status);
            end->onMessage = [this](const QelMessage& next) { end->grant(next); };
        };
    }

    const CapturedLog log{LogLevel::Warn};
    FakeHypervisorEnd* end = nullptr; // owned by the console
    Console console = FakeHypervisorEnd::makeConsole(end, impatientOptions(), true);
    int notices = 0;
};

// A peer that goes on sending.

TEST_F(ConsoleLimits, NoticesDoNotExtendARequest)
{
    const QelMessageGetQelTodReq request;
    SettableClock clock;
    answerNothing();
    flood(clock, [&] { end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{1})); });
    EXPECT_THAT([&] { console.request(request, milliseconds(100)); },
                failsWith<DeadlinePassed>("the peer did not answer in time: no response to request 0x6003/0x0107"));
    EXPECT_EQ(notices, 2);
}

TEST_F(ConsoleLimits, AResponseThatComesLastInTimeIsTaken)
{
    const QelMessageGetQelTodReq request;
    SettableClock clock;
    end->onMessage = [&](const QelMessage& message) {
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), std::time_t{3}));
        clock.advance(milliseconds(200));
    };
    EXPECT_EQ(timeOf(*console.request(request, milliseconds(100))), 3);
}

TEST_F(ConsoleLimits, NoticesDoNotExtendAWrite)
{
    SerialSession session = console.openSerial(1);
    SettableClock clock;
    end->stopTaking();
    flood(clock, [&] { end->takeAgain(); });
    EXPECT_THAT([&] { session.write("x"); }, failsWith<DeadlinePassed>("the peer did not take a message in time"));
    EXPECT_EQ(notices, 1);
}

TEST_F(ConsoleLimits, NoticesDoNotExtendARead)
{
    SerialSession session = console.openSerial(1);
    SettableClock clock;
    flood(clock, [&] { end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 1, "x")); });
    std::array<char, 10> buffer;
    EXPECT_THAT([&] { session.read(buffer.data(), buffer.size(), milliseconds(100)); },
                failsWith<DeadlinePassed>("partition 1 sent nothing in time"));
    EXPECT_EQ(notices, 2);
}

TEST_F(ConsoleLimits, AMessageHasTheTimeThatIsLeftWhenItBegins)
{
    SettableClock clock;
    end->onMessage = [&](const QelMessage& message) {
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), std::time_t{3}));
    };
    end->beforeRead = [&] {
        clock.advance(milliseconds(600));
        end->beforeRead = {};
    };
    EXPECT_EQ(timeOf(*console.request(QelMessageGetQelTodReq(), milliseconds(1000))), 3);
    EXPECT_THAT(end->readDeadlines, ElementsAre(milliseconds(1000), milliseconds(400)));
}

TEST_F(ConsoleLimits, LookingForAMessageDoesNotWaitInTheStream)
{
    EXPECT_FALSE(console.process());
    EXPECT_THAT(end->readDeadlines, IsEmpty());
    end->push(broadcast());
    EXPECT_TRUE(console.process());
}

TEST_F(ConsoleLimits, TakingLeaveHasADeadline)
{
    struct Row {
        milliseconds limit;
        milliseconds wait;
    };
    for (const Row& row : {Row{milliseconds(200), milliseconds(200)}, Row{milliseconds(5000), milliseconds(1000)},
                           Row{milliseconds(-1), milliseconds(1000)}}) {
        SettableClock clock;
        auto owned = std::make_unique<FakeHypervisorEnd>();
        const FakeHypervisorEnd& stream = *owned;
        CloseSwitch closeSwitch;
        ConnectedStream connected;
        connected.descriptor = owned->descriptor();
        connected.stream = std::move(owned);
        FrameLink link(std::move(connected), "fake:1", milliseconds(1000), closeSwitch);
        link.leave(deadlineIn(row.limit));
        EXPECT_THAT(stream.readDeadlines, ElementsAre(row.wait));
    }
}

TEST_F(ConsoleLimits, LeavingAndDestroyingNeedNoMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    auto pending = std::make_optional(console.start(QelMessageGetQelTodReq()));
    std::optional<Console> owned(std::move(console));
    {
        Allocations allocations;
        allocations.failAll();
        owned->leave();
        pending.reset();
        owned.reset();
    }
    console = FakeHypervisorEnd::makeConsole(end);
}

/// A stream without a descriptor that knows what it can do. Notes the steps of taking leave.
class LeavingStream final : public Stream, public Readiness {
public:
    explicit LeavingStream(std::vector<std::string>& steps) : mSteps(steps) {}

    void close() override { mSteps.emplace_back("close"); }
    void setReadDeadline(milliseconds timeout) override
    {
        mSteps.push_back("limit " + std::to_string(timeout.count()));
    }
    void setWriteDeadline(milliseconds) override {}
    std::size_t read(char*, std::size_t) override
    {
        mSteps.emplace_back("read");
        return 0;
    }
    void write(const char*, std::size_t) override { mSteps.emplace_back("write"); }
    Ready awaitReady(bool, milliseconds) override { return {true, false}; }
    void endOutput() noexcept override { mSteps.emplace_back("end output"); }

private:
    std::vector<std::string>& mSteps;
};

TEST(ConsoleLeaving, OverAStreamWithoutADescriptorWaitsForThePeerToo)
{
    const SettableClock clock;
    std::vector<std::string> steps;
    CloseSwitch closeSwitch;
    auto stream = std::make_unique<LeavingStream>(steps);
    ConnectedStream connected;
    connected.readiness = stream.get();
    connected.stream = std::move(stream);
    FrameLink link(std::move(connected), "fake:1", milliseconds(1000), closeSwitch);
    link.leave(TimePoint::max());
    EXPECT_THAT(steps, ElementsAre("end output", "limit 1000", "read", "close"));
}

TEST(ConsoleTimeouts, MayBeAsLongAsAnybodyLikes)
{
    ConsoleOptions options = FakeHypervisorEnd::plainOptions();
    options.handshakeTimeout = options.requestTimeout = options.frameTimeout = milliseconds::max();
    FakeHypervisorEnd* end = nullptr;
    Console console = FakeHypervisorEnd::makeConsole(end, options);
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
}

// Sessions that the hypervisor opens or closes after the call has given up.

TEST_F(ConsoleLimits, AHypervisorSessionThatIsGrantedLateIsOpen)
{
    const auto request = giveUp(QelMessageOpOpenKrogSession, [&] { console.openSession(kShort); });
    end->respond(*request, QelMessageStatusNoError);
    EXPECT_TRUE(console.process());
    EXPECT_NO_THROW(console.openSession());
    EXPECT_THAT(end->received, IsEmpty()) << "it is open already";
}

TEST_F(ConsoleLimits, AHypervisorSessionThatIsGrantedWhileItIsAskedForAgainIsOpen)
{
    const auto request = giveUp(QelMessageOpOpenKrogSession, [&] { console.openSession(kShort); });
    refuseAfter(*request, QelMessageStatusKrogSessionAlreadyOpen);
    EXPECT_NO_THROW(console.openSession());
}

TEST_F(ConsoleLimits, AHypervisorSessionThatAPlainRequestOpensAndClosesIsKnown)
{
    console.exchange(QelMessageInterfaceCmpOpenKrogSessionReq());
    end->forget();
    SerialSession session = console.openSerial(1);
    EXPECT_THAT(operations(), ElementsAre(0x0402U, 0x0406U));
    console.exchange(QelMessageInterfaceCmpCloseKrogSessionReq());
    EXPECT_EQ(session.getEnd(), SessionEnd::Closed);
    end->forget();
    console.closeSession();
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleLimits, AHypervisorSessionThatIsClosedLateIsClosed)
{
    SerialSession session = console.openSerial(1);
    const auto request = giveUp(QelMessageOpCloseKrogSession, [&] { console.closeSession(kShort); });
    EXPECT_EQ(session.getEnd(), SessionEnd::None);
    refuseAfter(*request, QelMessageStatusCmdFailed);
    EXPECT_NO_THROW(console.closeSession());
    EXPECT_EQ(session.getEnd(), SessionEnd::Closed);
}

TEST_F(ConsoleLimits, ASerialSessionThatIsOpenedTooLateIsClosedAgain)
{
    const auto request =
        giveUp(QelMessageOpOpenVirtualSerialSession, [&] { console.openSerial(7, SerialOptions(), kShort); });
    EXPECT_FALSE(console.process());
    EXPECT_THAT(end->received, IsEmpty());
    end->respond(*request, QelMessageStatusNoError);
    EXPECT_TRUE(console.process());
    ASSERT_THAT(operations(), ElementsAre(0x0403U));
    EXPECT_EQ(dynamic_cast<const QelMessageVirtualSerialCloseReq&>(*end->received[0]).getLpId(), 7U);
}

TEST_F(ConsoleLimits, ASerialSessionThatIsRefusedTooLateNeedsNoClosing)
{
    const auto request =
        giveUp(QelMessageOpOpenVirtualSerialSession, [&] { console.openSerial(7, SerialOptions(), kShort); });
    end->respond(*request, QelMessageStatusConnectionNotAvailable);
    EXPECT_TRUE(console.process());
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleLimits, ASerialSessionThatIsOpenedTooLateDoesNotHarmTheNextOne)
{
    const auto request =
        giveUp(QelMessageOpOpenVirtualSerialSession, [&] { console.openSerial(7, SerialOptions(), kShort); });
    end->onMessage = [&](const QelMessage& message) {
        if (message.getOperation() == QelMessageOpOpenVirtualSerialSession) {
            end->respond(*request, QelMessageStatusNoError);
        }
        end->grant(message);
    };
    const SerialSession session = console.openSerial(7);
    EXPECT_THAT(operations(), ElementsAre(0x0402U, 0x0406U));
    EXPECT_EQ(session.getEnd(), SessionEnd::None);
}

TEST_F(ConsoleLimits, ASerialSessionThatIsOpenedTooLateIsClosedWhenTheNextOneIsRefused)
{
    const auto request =
        giveUp(QelMessageOpOpenVirtualSerialSession, [&] { console.openSerial(7, SerialOptions(), kShort); });
    refuseAfter(*request, QelMessageStatusConnectionNotAvailable);
    EXPECT_THROW(console.openSerial(7), StatusError);
    EXPECT_THAT(operations(), ElementsAre(0x0402U, 0x0403U));
}

TEST_F(ConsoleLimits, ASerialSessionThatIsClosedLateIsClosed)
{
    SerialSession session = console.openSerial(1);
    const auto request = giveUp(QelMessageOpCloseVirtualSerialSession, [&] { session.close(kShort); });
    EXPECT_EQ(session.getEnd(), SessionEnd::None);
    refuseAfter(*request, QelMessageStatusConnectionClosureFailure);
    EXPECT_NO_THROW(session.close());
    EXPECT_EQ(session.getEnd(), SessionEnd::Closed);
}

// Input that is sent in part.

TEST_F(ConsoleLimits, AWriteThatIsNotTakenFurtherSaysHowMuchWasSent)
{
    SerialSession session = console.openSerial(1);
    end->onMessage = [&](const QelMessage&) { end->stopTaking(); };
    EXPECT_EQ(session.write(std::string(40000, 'x')), SerialSession::kMaxData);
    EXPECT_THAT([&] { session.write(std::string(40000, 'x')); },
                failsWith<DeadlinePassed>("the peer did not take a message in time"));
    end->takeAgain();
    answerNothing();
    EXPECT_EQ(session.write(std::string(23654, 'x')), 23654U);
}

TEST_F(ConsoleLimits, ASessionKnowsHowMuchWasSentWhenAHandlerThrows)
{
    SerialSession session = console.openSerial(1);
    EXPECT_EQ(session.getSent(), 0U);
    console.onNotice<Broadcast>([](const auto&) { throw std::out_of_range("mine"); });
    end->onMessage = [&](const QelMessage&) {
        end->stopTaking();
        end->push(broadcast());
    };
    EXPECT_THAT([&] { session.write(std::string(40000, 'x')); }, ThrowsMessage<std::out_of_range>(StrEq("mine")));
    EXPECT_EQ(session.getSent(), SerialSession::kMaxData);
    end->takeAgain();
    answerNothing();
    std::string rest(10, 'x');
    session.writeSome(rest);
    EXPECT_EQ(session.getSent(), SerialSession::kMaxData + 10);
}

// Output that nobody reads.

TEST_F(ConsoleLimits, ASessionThatIsFullCanBeClosed)
{
    SerialOptions options;
    options.maxUnread = 10;
    SerialSession session = console.openSerial(1, options);
    end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 10, "0123456789"));
    EXPECT_TRUE(console.process());
    EXPECT_THAT([&] { console.process(); },
                failsWith<LimitReached>("the session of partition 1 holds 10 bytes of output that nobody reads"));
    end->onMessage = [&](const QelMessage& message) {
        end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 3, "abc"));
        end->grant(message);
    };
    EXPECT_NO_THROW(session.close());
    EXPECT_EQ(session.getAvailable(), 13U);
}

TEST_F(ConsoleLimits, ASessionThatMayHoldNothingIsRefused)
{
    SerialOptions options;
    options.maxUnread = 0;
    EXPECT_THAT([&] { console.openSerial(1, options); },
                ThrowsMessage<std::invalid_argument>(StrEq("maxUnread: zero")));
    EXPECT_THAT(end->received, IsEmpty());
    options.maxUnread = 1;
    EXPECT_NO_THROW(console.openSerial(1, options));
}

TEST_F(ConsoleLimits, ASessionThatWasNotClosedInTimeHasItsLimitAgain)
{
    SerialOptions options;
    options.maxUnread = 10;
    SerialSession session = console.openSerial(1, options);
    end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 10, "0123456789"));
    EXPECT_TRUE(console.process());
    answerNothing();
    EXPECT_THROW(session.close(kShort), DeadlinePassed);
    EXPECT_THROW(console.process(), LimitReached);
}

} // namespace

} // namespace qel::test
