// Lines that throw or lie, as a user's line may.

#include <qel/common/util/Poll.hpp>

#include "hypervisor/GuardedLine.hpp"
#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <array>
#include <gmock/gmock.h>
#include <stdexcept>
#include <unistd.h>

namespace qel::test {

namespace {

using protocol::CommandEnd;
using protocol::GuardedLine;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;

using LineState = protocol::SerialLine::LineState;

constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kReadFailure = 4;
constexpr unsigned int kWriteFailure = 5;

class SerialLineFailuresTest : public VirtualSerialFixture {
protected:
    struct Kind {
        std::function<void()> fail;
        std::string logged; ///< for partition 1
    };

    static std::vector<Kind> kinds()
    {
        return {{[] { throw std::runtime_error("unplugged"); }, "E: [qel] partition 1: unplugged"},
                {[] { throw 42; }, "E: [qel] partition 1: an exception that is not a std::exception"}};
    }

    /// Makes one operation of line 1 fail; an empty one: none.
    void failIn(const std::string& operation, const Kind& kind)
    {
        log.clear();
        port1->onCall = [operation, kind](const std::string& called) {
            if (called == operation) kind.fail();
        };
    }

    /// Starts over with a console whose data flows.
    std::unique_ptr<Peer> begin()
    {
        serveWith(keeping(0));
        auto peer = std::make_unique<Peer>();
        setUpSerial(*peer, "a", 1);
        return peer;
    }

    /// The line works, and so does its session.
    void expectUsable(Peer& peer)
    {
        port1->onCall = nullptr;
        port1->ended = false;
        ASSERT_EQ(open(peer, 1), 0U);
        ASSERT_EQ(setUp(peer, 1), 0U);
        port1->output = {"again"};
        hypervisor->serviceSerial(1);
        EXPECT_EQ(takeData(peer, 1), "again");
    }
};

TEST_F(SerialLineFailuresTest, StartFailsTheRequest)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        serveWith(keeping(0));
        Peer peer;
        openSession(peer, "a");
        failIn("start", kind);
        EXPECT_EQ(open(peer, 1), kCmdFailed);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        EXPECT_THAT(watched(), IsEmpty());
        expectUsable(peer);
    }
}

TEST_F(SerialLineFailuresTest, AHolderIsToldWhenItsLineIsDownAfterAFailedStart)
{
    serveWith(keeping(0));
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    port1->failsToStart = true;
    port1->goesDownWhenItFailsToStart = true;
    EXPECT_EQ(open(other, 1, 0, true), kCmdFailed);
    expectClosed(holder, 1, kReadFailure);
    port1->failsToStart = false;
    expectUsable(other);
}

TEST_F(SerialLineFailuresTest, ReadEndsTheSession)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        const auto peer = begin();
        failIn("read", kind);
        port1->output = {"x"};
        hypervisor->serviceSerial(1);
        expectClosed(*peer, 1, kReadFailure, 0x0100);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        port1->output.clear();
        expectUsable(*peer);
    }
}

TEST_F(SerialLineFailuresTest, WriteEndsTheSession)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        const auto peer = begin();
        failIn("write", kind);
        sendData(*peer, 1, "x");
        expectClosed(*peer, 1, kWriteFailure);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        expectUsable(*peer);
    }
}

TEST_F(SerialLineFailuresTest, AHangUpThatCannotBeAskedAboutIsOne)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        serveWith(waiting()); // otherwise the line is read, and says itself that it has ended
        const auto peer = std::make_unique<Peer>();
        setUpSerial(*peer, "a", 1);
        ASSERT_EQ(close(*peer, 1), 0U);
        failIn("hasHungUp", kind);
        hypervisor->serviceSerial(1);
        EXPECT_EQ(port1->stopped, 1U);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        expectUsable(*peer);
    }
}

TEST_F(SerialLineFailuresTest, AnEndThatCannotBeAskedAboutIsUnknown)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        const auto peer = begin();
        failIn("commandEnd", kind);
        port1->ended = true;
        hypervisor->serviceSerial(1);
        expectClosed(*peer, 1, kReadFailure, 0);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        expectUsable(*peer);
    }
}

TEST_F(SerialLineFailuresTest, ALineWithoutADescriptorIsNotWaitedFor)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        const auto peer = begin();
        failIn("descriptor", kind);
        for (const protocol::SerialWatch& watch : hypervisor->serialWatches())
            EXPECT_EQ(watch.fd.mFd.fd, -1);
        EXPECT_THAT(log.lines(), Not(IsEmpty()));
        EXPECT_THAT(log.lines(), Each(kind.logged));
        port1->onCall = nullptr;
        EXPECT_THAT(watched(), ElementsAre(1));
    }
}

TEST_F(SerialLineFailuresTest, StopIsLoggedAndTheSessionEndsAllTheSame)
{
    for (const Kind& kind : kinds()) {
        SCOPED_TRACE(kind.logged);
        const auto peer = begin();
        failIn("stop", kind);
        port1->ended = true;
        hypervisor->serviceSerial(1);
        expectClosed(*peer, 1, kReadFailure, 0x0100);
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged));
        EXPECT_THAT(watched(), IsEmpty());
        failIn("stop", kind);
        hypervisor->shutDown();
        hypervisor->disconnect(peer->id);
        hypervisor.reset();
        EXPECT_THAT(log.lines(), ElementsAre(kind.logged)); // of the shutdown
    }
}

TEST_F(SerialLineFailuresTest, OneBrokenLineDoesNotTouchTheOther)
{
    const auto peer = begin();
    Peer other;
    setUpSerial(other, "b", 2);
    port1->onCall = [](const std::string&) { throw 42; };
    hypervisor->serviceSerial(1);
    expectClosed(*peer, 1, kReadFailure, 0);
    port2->output = {"fine"};
    hypervisor->serviceSerial(2);
    EXPECT_EQ(takeData(other, 2), "fine");
    sendData(other, 2, "in");
    EXPECT_EQ(port2->input, "in");
}

// Lies.

TEST_F(SerialLineFailuresTest, ALineThatHasReadMoreThanThereWasRoomForIsBroken)
{
    const auto peer = begin();
    port1->saysRead = protocol::PartitionSessions::kPiece;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(*peer, 1).size(), protocol::PartitionSessions::kPiece);
    port1->saysRead = protocol::PartitionSessions::kPiece + 1;
    hypervisor->serviceSerial(1);
    expectClosed(*peer, 1, kReadFailure, 0x0100);
    EXPECT_THAT(log.lines(),
                ElementsAre("E: [qel] partition 1: the line says it has read more than there was room for"));
    port1->saysRead.reset();
    expectUsable(*peer);
}

TEST_F(SerialLineFailuresTest, ALineThatHasTakenMoreThanThereWasIsBroken)
{
    const auto peer = begin();
    port1->saysTaken = 3;
    sendData(*peer, 1, "abc");
    EXPECT_EQ(peer->link.posted(), 0U);
    port1->saysTaken = 4;
    sendData(*peer, 1, "abc");
    expectClosed(*peer, 1, kWriteFailure);
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: the line says it has taken more than there was"));
    port1->saysTaken.reset();
    expectUsable(*peer);
}

TEST_F(SerialLineFailuresTest, DataWithoutBytesAreNone)
{
    const auto peer = begin();
    port1->saysRead = 0;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer->link.posted(), 0U);
    EXPECT_THAT(watched(), ElementsAre(1));
}

// The line's own part.

TEST_F(SerialLineFailuresTest, ALineIsToldItsPartition)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 2);
    EXPECT_EQ(port2->partition, 2U);
}

/// A line of a user who overrides only what he must: the reading end of a pipe.
class PipeLine : public protocol::SerialLine {
public:
    PipeLine()
    {
        if (::pipe(mFds.data()) != 0) throw std::runtime_error("pipe");
    }
    ~PipeLine() override
    {
        ::close(mFds[0]);
        hangUp();
    }
    void hangUp()
    {
        if (mFds[1] >= 0) ::close(mFds[1]);
        mFds[1] = -1;
    }
    void start(std::uint16_t) override {}
    void stop() override {}
    ReadResult read(char*, std::size_t) override { return {LineState::Idle, 0}; }
    std::size_t write(const char*, std::size_t length) override { return length; }
    int descriptor() const override { return mFds[0]; }

private:
    std::array<int, 2> mFds{-1, -1};
};

TEST(SerialLineDefaults, HangUpIsWhatTheSystemSaysAboutTheDescriptor)
{
    PipeLine line;
    EXPECT_FALSE(line.hasHungUp());
    line.hangUp();
    EXPECT_TRUE(line.hasHungUp());
}

TEST(SerialLineDefaults, TheEndOfTheCommandIsUnknown)
{
    PipeLine line;
    const auto end = line.commandEnd();
    ASSERT_TRUE(end.has_value());
    EXPECT_EQ(end->kind, CommandEnd::Kind::Unknown);
}

TEST(SerialLineDefaults, TheLineIsUpAtOnceAndHasNothingToDoOfItsOwn)
{
    PipeLine line;
    EXPECT_TRUE(line.advance());
    EXPECT_FALSE(line.wantsToWrite());
    EXPECT_TRUE(line.advanceAt().isDisabled());
    EXPECT_EQ(line.endReason(), "");
    EXPECT_FALSE(line.sendBreak());
}

} // namespace

} // namespace qel::test
