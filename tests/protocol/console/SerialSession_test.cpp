// Virtual serial sessions of a console: on one thread, against a fake hypervisor end.

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

// Opening.

TEST_F(SerialSessionTest, OpeningTakesThreeRequests)
{
    session.emplace(console->openSerial(kPartition, address()));
    EXPECT_THAT(operations(), ElementsAre(0x0102U, 0x0402U, 0x0406U));
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(1).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(1).getVssConnectionNumber(), 3U);
    EXPECT_FALSE(received<QelMessageVirtualSerialOpenReq>(1).isForceOpen());
    EXPECT_EQ(received<QelMessageVirtualSerialSetupSessionReq>(2).getLpId(), 7U);
    EXPECT_EQ(received<QelMessageVirtualSerialSetupSessionReq>(2).getVssConnectionNumber(), 3U);
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
    EXPECT_EQ(session->describeEnd(), "session open");
    EXPECT_EQ(session->getPartition(), 7U);
    EXPECT_EQ(session->getConnection(), 3U);
}

TEST_F(SerialSessionTest, ASecondSessionUsesTheSameHypervisorSession)
{
    open();
    const SerialSession second = console->openSerial(8);
    EXPECT_THAT(operations(), ElementsAre(0x0402U, 0x0406U));
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(0).getLpId(), 8U);
    EXPECT_EQ(received<QelMessageVirtualSerialOpenReq>(0).getVssConnectionNumber(), 0U);
}

TEST_F(SerialSessionTest, OpeningCanBeForced)
{
    SerialOptions options;
    options.force = true;
    session.emplace(console->openSerial(kPartition, options, std::chrono::seconds(1)));
    EXPECT_TRUE(received<QelMessageVirtualSerialOpenReq>(1).isForceOpen());
}

TEST_F(SerialSessionTest, ARefusalOfAnyStepEndsTheOpening)
{
    struct Row {
        QelMessageOpTypes operation;
        std::vector<unsigned int> operations;
    };
    // After a refused set-up the session that is open is closed again. The hypervisor session stays.
    const Row rows[] = {
        {QelMessageOpOpenKrogSession, {0x0102}},
        {QelMessageOpOpenVirtualSerialSession, {0x0102, 0x0402}},
        {QelMessageOpSetupVirtualSerialSession, {0x0402, 0x0406, 0x0403}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.operation);
        end->forget();
        refuse(row.operation, QelMessageStatusConnectionNotAvailable);
        try {
            console->openSerial(kPartition, address());
            ADD_FAILURE() << "opened";
        } catch (const StatusError& error) {
            EXPECT_EQ(error.getStatus(), QelMessageStatusConnectionNotAvailable);
            EXPECT_EQ(error.getResponse().getOperation(), row.operation);
        }
        EXPECT_EQ(operations(), row.operations);
    }
}

TEST_F(SerialSessionTest, ThereIsOneDeadlineForAllSteps)
{
    SettableClock clock;
    end->onMessage = [&](const QelMessage& message) {
        clock.advance(std::chrono::milliseconds(300));
        end->grant(message);
    };
    session.emplace(console->openSerial(kPartition, address(), std::chrono::milliseconds(1000)));
    EXPECT_THAT(end->writeDeadlines, ElementsAre(std::chrono::milliseconds(1000), std::chrono::milliseconds(700),
                                                 std::chrono::milliseconds(400)));
}

// Input.

TEST_F(SerialSessionTest, InputIsSent)
{
    open();
    const std::string typed("ls\r\0\xFF", 5);
    EXPECT_EQ(session->write(typed), 5U);
    const auto& data = received<QelMessageVirtualSerialDataToOsAsync>(0);
    EXPECT_EQ(data.getLpId(), 7U);
    EXPECT_EQ(data.getVssConnectionNumber(), 3U);
    EXPECT_EQ(std::string(data.getSerialData(), data.getSerialDataLength()), typed);
}

TEST_F(SerialSessionTest, LongInputIsSplitIntoFrames)
{
    ASSERT_EQ(SerialSession::kMaxData, 16346U);
    open();
    EXPECT_EQ(session->write(std::string(16346, 'x')), 16346U);
    ASSERT_EQ(end->received.size(), 1U);
    EXPECT_EQ(end->received[0]->msgLength(), 16384U);
    EXPECT_EQ(session->write(std::string(16347, 'y')), 16347U);
    ASSERT_EQ(end->received.size(), 3U);
    EXPECT_EQ(end->received[1]->msgLength(), 16384U);
    EXPECT_EQ(received<QelMessageVirtualSerialDataToOsAsync>(2).getSerialDataLength(), 1U);
    EXPECT_EQ(session->write(std::string()), 0U);
    EXPECT_EQ(end->received.size(), 3U);
}

TEST_F(SerialSessionTest, OneMessageIsSentAtATime)
{
    open();
    std::string typed = std::string(16346, 'x') + "y";
    session->writeSome(typed);
    EXPECT_EQ(typed, "y");
    EXPECT_EQ(end->received.at(0)->msgLength(), 16384U);
    session->writeSome(typed);
    EXPECT_EQ(typed, "");
    EXPECT_EQ(received<QelMessageVirtualSerialDataToOsAsync>(1).getSerialDataLength(), 1U);
}

TEST_F(SerialSessionTest, NothingIsSentToASessionThatHasEnded)
{
    open();
    receive(closed(ClosedNotice::CloseReasonForceClose));
    EXPECT_EQ(session->write("ls"), 0U);
    std::string typed = "ls";
    session->writeSome(typed);
    EXPECT_EQ(typed, "");
    EXPECT_THAT(end->received, IsEmpty());
}

// Output.

TEST_F(SerialSessionTest, OutputIsKeptUntilItIsRead)
{
    open();
    receive(output("one"));
    receive(output(""));
    receive(output(std::string("\0\x1B two", 6)));
    EXPECT_EQ(session->getAvailable(), 9U);
    EXPECT_EQ(available(), "one" + std::string("\0\x1B two", 6));
    EXPECT_EQ(session->getAvailable(), 0U);
    EXPECT_EQ(available(), "");
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(SerialSessionTest, ReadingWaitsForOutput)
{
    open();
    end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    end->push(output("abcde"));
    EXPECT_EQ(read(3), "abc");
    EXPECT_EQ(read(3), "de");
}

TEST_F(SerialSessionTest, ReadingWithoutOutputInTimeThrows)
{
    open();
    std::array<char, 10> buffer;
    EXPECT_THAT([&] { session->read(buffer.data(), buffer.size(), std::chrono::milliseconds(5)); },
                failsWith<DeadlinePassed>("partition 7 sent nothing in time"));
    end->push(output("x"));
    EXPECT_EQ(read(), "x");
}

TEST_F(SerialSessionTest, ReadingIntoNothingIsAnInvalidArgument)
{
    open();
    char byte = 0;
    EXPECT_THAT([&] { session->read(&byte, 0); }, ThrowsMessage<std::invalid_argument>(StrEq("length: zero")));
}

TEST_F(SerialSessionTest, ReadingOfOneSessionKeepsTheOutputOfAnother)
{
    open();
    SerialSession other = console->openSerial(8);
    end->push(dataFrom(8, 0, "theirs"));
    end->push(output("ours"));
    EXPECT_EQ(read(), "ours");
    std::string text(10, '\0');
    text.resize(other.readAvailable(text.data(), text.size()));
    EXPECT_EQ(text, "theirs");
}

TEST_F(SerialSessionTest, OutputBeforeAResponseIsKept)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        end->push(output("meanwhile"));
        end->grant(message);
    };
    EXPECT_NE(console->exchange(QelMessageGetQelTodReq()), nullptr);
    EXPECT_EQ(available(), "meanwhile");
}

TEST_F(SerialSessionTest, ManyBytesAreReadInOrder)
{
    open();
    std::string sent;
    std::string got;
    for (int i = 0; i < 200; ++i) {
        const std::string piece(static_cast<std::size_t>(1 + i * 37 % 4000), static_cast<char>('a' + i % 26));
        receive(output(piece));
        sent += piece;
        std::string part(static_cast<std::size_t>(1 + i * 53 % 3000), '\0');
        part.resize(session->readAvailable(part.data(), part.size()));
        got += part;
    }
    while (session->getAvailable() > 0)
        got += available();
    EXPECT_EQ(got, sent);
}

TEST_F(SerialSessionTest, UnreadOutputHasALimit)
{
    SerialOptions options = address();
    options.maxUnread = 100;
    open(options);
    receive(output(std::string(99, 'x')));
    receive(output(std::string(50, 'y'))); // one message beyond the limit
    end->push(output("z"));
    const std::string text = "the session of partition 7 holds 149 bytes of output that nobody reads";
    EXPECT_THAT([&] { console->process(); }, failsWith<Error>(text));
    EXPECT_THAT([&] { console->exchange(QelMessageGetQelTodReq()); }, failsWith<Error>(text));
    std::string part(50, '\0');
    EXPECT_EQ(session->readAvailable(part.data(), part.size()), 50U);
    EXPECT_TRUE(console->process()) << "99 bytes are left";
    EXPECT_EQ(session->getAvailable(), 100U);
    EXPECT_THAT([&] { console->process(); }, failsWith<Error>(HasSubstr("holds 100 bytes")));
    EXPECT_EQ(available().size(), 100U);
    EXPECT_TRUE(console->process()) << "the response to the request that was given up";
    EXPECT_FALSE(console->process());
}

TEST_F(SerialSessionTest, NoticesOfTheSessionGoToItAlone)
{
    open();
    console->onOtherNotice([](const QelMessage&) { ADD_FAILURE(); });
    console->onNotice<DataNotice>([](const DataNotice&) { ADD_FAILURE(); });
    receive(output("x"));
    receive(closed(ClosedNotice::CloseReasonForceClose));
    EXPECT_EQ(available(), "x");
    EXPECT_EQ(session->getEnd(), SessionEnd::Taken);
}

TEST_F(SerialSessionTest, NoticesOfAnotherSessionAreNotOurs)
{
    open();
    std::vector<unsigned int> others;
    console->onOtherNotice([&](const QelMessage& notice) { others.push_back(notice.getOperation()); });
    receive(dataFrom(8, 3, "another partition"));
    receive(dataFrom(7, 0, "another connection"));
    receive(ClosedNotice(8, 3, ClosedNotice::CloseReasonForceClose));
    receive(ClosedNotice(7, 0, ClosedNotice::CloseReasonForceClose));
    EXPECT_EQ(session->getAvailable(), 0U);
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
    EXPECT_THAT(others, ElementsAre(0x0401U, 0x0401U, 0xA005U, 0xA005U));
}

TEST_F(SerialSessionTest, NoticesBeforeTheSessionIsOpenAreAboutAnEarlierOne)
{
    end->onMessage = [&](const QelMessage& message) {
        if (message.getOperation() == QelMessageOpOpenVirtualSerialSession) {
            end->push(output("early"));
            end->push(closed(ClosedNotice::CloseReasonForceClose));
        }
        end->grant(message);
    };
    session.emplace(console->openSerial(kPartition, address()));
    EXPECT_EQ(session->getAvailable(), 0U);
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

TEST_F(SerialSessionTest, ASessionThatIsOpenedAgainByForceEndsTheOldOne)
{
    open();
    end->onMessage = [&](const QelMessage& message) {
        if (message.getOperation() == QelMessageOpOpenVirtualSerialSession) {
            end->push(closed(ClosedNotice::CloseReasonForceClose));
        }
        end->grant(message);
    };
    SerialOptions options = address();
    options.force = true;
    SerialSession second = console->openSerial(kPartition, options);
    EXPECT_EQ(session->getEnd(), SessionEnd::Taken);
    EXPECT_EQ(second.getEnd(), SessionEnd::None);
    receive(output("x"));
    EXPECT_EQ(session->getAvailable(), 0U);
    EXPECT_EQ(second.getAvailable(), 1U);
}

TEST_F(SerialSessionTest, AMalformedNoticeBreaksTheProtocol)
{
    const QelMessageGeneric malformed[] = {
        withPayload(output("x"), std::string("\0\7\0\3\0\2x", 7)), // says two bytes, has one
        withPayload(closed(ClosedNotice::CloseReasonReadFailure), std::string("\0\7\0\3\0\0\0", 7)),
    };
    for (const QelMessageGeneric& message : malformed) {
        SCOPED_TRACE(message.getOperation());
        session.reset();
        console.emplace(FakeHypervisorEnd::makeConsole(end));
        open();
        end->push(message);
        EXPECT_THAT([&] { console->process(); },
                    failsWith<ProtocolBroken>(StartsWith("the peer broke the protocol: malformed notice [CID: ")));
        EXPECT_EQ(session->getAvailable(), 0U);
    }
}

} // namespace

} // namespace qel::test
