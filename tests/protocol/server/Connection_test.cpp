#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "protocol/server/ServedFixture.hpp"
#include "support/LoopbackEnds.hpp"

#include <future>
#include <gmock/gmock.h>
#include <sstream>
#include <thread>

namespace qel::test {

namespace {

using protocol::Connection;
using protocol::ConnectionLimits;
using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::StartsWith;

/// Closes, and throws something unusual.
class BadCloseStream : public Stream {
public:
    explicit BadCloseStream(std::unique_ptr<Stream> stream) : mStream(std::move(stream)) {}

    void close() override
    {
        mStream->close();
        throw 42;
    }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream->setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream->setWriteDeadline(timeout); }
    std::size_t read(char* buffer, std::size_t length) override { return mStream->read(buffer, length); }
    void write(const char* buffer, std::size_t length) override { mStream->write(buffer, length); }

private:
    const std::unique_ptr<Stream> mStream;
};

class ConnectionTest : public ServedFixture {
protected:
    void start(ConnectionLimits limits = {})
    {
        connection = ServedFixture::serve(loopback, limits);
        connection->start();
    }

    void identify() { ASSERT_EQ(messages.ask(versionRequest("a"))->getStatus(), 0U); }

    void expectEnd() { awaitEnd(*connection); }

    bool endsWithin(std::chrono::milliseconds time) const { return PollSet(ended.getPollFd()).wait(time).anyReady(); }

    /// Sends requests without reading responses until the server stops reading. @return how many it sent
    unsigned sendUntilStuck(const QelMessage& request)
    {
        loopback.near->setWriteDeadline(std::chrono::milliseconds(300));
        unsigned sent = 0;
        try {
            for (;; ++sent)
                messages.send(request);
        } catch (const StreamIOException&) {
            return sent;
        }
    }

    /// Opens partition 1 and lets it print, while the console reads nothing, until the partition is held back.
    /// @return how many pieces of 4 KiB it has printed
    unsigned printUntilHeldBack()
    {
        messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
        messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
        messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
        unsigned chunks = 0;
        for (unsigned full = 0; full < 50; full = hypervisor->serialWatches().empty() ? full + 1 : 0) {
            if (full > 0) {
                std::this_thread::sleep_for(std::chrono::milliseconds(1)); // the system's buffers may still be filling
                continue;
            }
            port1->output = {std::string(4096, static_cast<char>('a' + ++chunks % 26))};
            hypervisor->serviceSerial(1);
        }
        return chunks;
    }

    Loopback loopback;
    /// Sends many requests before it reads the first response.
    void expectAnswersInOrder()
    {
        std::vector<unsigned int> asked;
        for (int i = 0; i < 100; ++i) {
            const QelMessageGetInterfaceLimitsReq request;
            asked.push_back(request.getCallerId());
            messages.send(request);
        }
        for (const unsigned int callerId : asked)
            EXPECT_EQ(messages.receive()->getCallerId(), callerId);
    }

    LoopbackMessages messages{*loopback.near};
    std::unique_ptr<Connection> connection; // destroyed before what it borrows
};

TEST_F(ConnectionTest, RequestsAreAnsweredInOrder)
{
    start();
    identify();
    expectAnswersInOrder();
}

TEST_F(ConnectionTest, EndsWhenTheConsoleDisconnects)
{
    start();
    identify();
    loopback.near.reset();
    expectEnd();
    FakeConsole other;
    const auto id = hypervisor->connect(other, protocol::Peer());
    hypervisor->receive(id, versionRequest("a"));
    EXPECT_EQ(other.take()->getStatus(), 0U); // the identity is free again
}

TEST_F(ConnectionTest, AHalfClosedConsoleStillGetsItsResponses)
{
    start();
    identify();
    const QelMessageGetInterfaceLimitsReq request;
    messages.send(request);
    ASSERT_EQ(::shutdown(loopback.near->getSocket().getFd(), SHUT_WR), 0);
    EXPECT_EQ(messages.receive()->getCallerId(), request.getCallerId());
    EXPECT_TRUE(messages.isClosed());
    expectEnd();
}

TEST_F(ConnectionTest, AMalformedFrameEndsTheConnection)
{
    struct Case {
        const char* name;
        std::string bytes;
        const char* reason;
    };
    const std::vector<Case> cases{
        {"length 0", std::string("\xDE\xCA\xFF\x20\0\0\0\0", 8), "Invalid length"},
        {"length 16385", std::string("\xDE\xCA\xFF\x20\0\0\x40\x01", 8), "Invalid length"},
        {"length 9", std::string("\xDE\xCA\xFF\x20\0\0\0\x09x", 9), "length"},
        {"eyecatcher", std::string("XXXX\0\0\0\x20", 8) + std::string(24, '\0'), "i_buffer bad eyecatcher"},
        {"version", std::string("\xDE\xCA\xFF\x10\0\0\0\x20", 8) + std::string(24, '\0'),
         "i_buffer bad header version"},
    };
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.name);
        log.clear();
        Loopback own;
        LoopbackMessages frames(*own.near);
        ended.eoi();
        const auto broken = ServedFixture::serve(own);
        broken->start();
        EXPECT_EQ(frames.ask(versionRequest("a"))->getStatus(), 0U); // free again each time
        frames.sendBytes(entry.bytes);
        EXPECT_TRUE(frames.isClosed());
        awaitEnd(*broken);
        EXPECT_THAT(log.lines(), Contains(HasSubstr(std::string(": closed for a malformed frame: ") + entry.reason)));
    }
}

TEST_F(ConnectionTest, ResponsesFromBeforeAMalformedFrameAreStillSent)
{
    start();
    identify();
    const QelMessageGetInterfaceLimitsReq request;
    messages.sendBytes(std::string(request.serialize(), request.msgLength()) + std::string(8, 'x'));
    EXPECT_EQ(messages.receive()->getCallerId(), request.getCallerId());
    EXPECT_TRUE(messages.isClosed());
}

TEST_F(ConnectionTest, ASilentConsoleIsClosed)
{
    ConnectionLimits limits;
    limits.handshake = std::chrono::milliseconds(20);
    start(limits);
    EXPECT_TRUE(messages.isClosed());
    expectEnd();
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

TEST_F(ConnectionTest, AConsoleThatAsksWithoutIdentifyingItselfIsClosed)
{
    ConnectionLimits limits;
    limits.handshake = std::chrono::milliseconds(50);
    start(limits);
    EXPECT_THROW(
        {
            for (;;)
                EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 4U);
        },
        StreamIOException);
    expectEnd();
}

TEST_F(ConnectionTest, AConsoleThatNeitherReadsNorIdentifiesItselfIsClosed)
{
    ConnectionLimits limits;
    limits.handshake = std::chrono::milliseconds(400);
    limits.linger = std::chrono::milliseconds(20);
    start(limits);
    sendUntilStuck(QelMessageGetQelTodReq());
    expectEnd();
}

TEST_F(ConnectionTest, AnIdentifiedConsoleHasNoReadDeadline)
{
    ConnectionLimits limits;
    limits.handshake = std::chrono::milliseconds(1000);
    start(limits);
    identify();
    EXPECT_FALSE(endsWithin(std::chrono::milliseconds(1200)));
    EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
}

TEST_F(ConnectionTest, AnIdentifiedConsoleMayBeHeldBackBeyondTheHandshakeTimeout)
{
    ConnectionLimits limits;
    limits.handshake = std::chrono::milliseconds(1000);
    start(limits);
    identify();
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string data(16000, 'x');
    for (int i = 0; i < 5; ++i) // more than the 64 KiB that the server keeps
        messages.send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    EXPECT_FALSE(endsWithin(std::chrono::milliseconds(1200)));
    EXPECT_FALSE(hypervisor->mayReceive(1));
}

TEST_F(ConnectionTest, AConsoleThatDoesNotReadItsResponsesIsNotReadAndLosesNothing)
{
    start();
    identify();
    messages.ask(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'm')));
    const QelMessageGetGlobalSaveAreaMetadataReq request;
    const unsigned sent = sendUntilStuck(request); // a request of 32 bytes gets 16 KiB
    EXPECT_GT(sent, 10U);
    EXPECT_FALSE(hypervisor->mayReceive(1));
    for (unsigned i = 0; i < sent; ++i) {
        const auto response = messages.receive();
        ASSERT_EQ(response->getCallerId(), request.getCallerId());
        ASSERT_EQ(response->dataLength(), 16002U);
    }
}

TEST_F(ConnectionTest, AConsoleThatDoesNotReadDelaysNoOther)
{
    start();
    identify();
    messages.ask(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'm')));
    sendUntilStuck(QelMessageGetGlobalSaveAreaMetadataReq());

    Loopback other;
    LoopbackMessages frames(*other.near);
    const auto second = ServedFixture::serve(other);
    second->start();
    EXPECT_EQ(frames.ask(versionRequest("b"))->getStatus(), 0U);
    EXPECT_EQ(frames.ask(QelMessageDaxBroadcastReq(0, 1, 0, "", "x"))->getStatus(), 0U);
}

TEST_F(ConnectionTest, APartitionThatPrintsWithoutEndLeavesRoomForResponses)
{
    start();
    identify();
    const unsigned chunks = printUntilHeldBack();
    EXPECT_TRUE(hypervisor->mayReceive(1));
    const QelMessageGetQelTodReq request;
    messages.send(request);

    // The queue holds at most half of the limit and one message, and one message waits for room. The rest must be in
    // the buffers of the system.
    std::ostringstream text;
    connection->dumpStatistics(text);
    EXPECT_THAT(text.str(), HasSubstr("\n  Limits:         131072/262144\n"));
    EXPECT_THAT(text.str(), HasSubstr("\n  Max Size (HWM): 13")); // 131072 to 135211
    for (unsigned i = 1; i <= chunks; ++i) {
        const auto data = messages.receive<QelMessageVirtualSerialDataToDaxAsync>();
        ASSERT_EQ(data->getSerialDataLength(), 4096);
        ASSERT_EQ(data->getSerialData()[0], static_cast<char>('a' + i % 26)) << i;
    }
    EXPECT_EQ(messages.receive()->getCallerId(), request.getCallerId());
}

TEST_F(ConnectionTest, TheStatisticsNameTheConsole)
{
    ConnectionLimits limits;
    limits.queueBytes = 1001;
    start(limits);
    identify();
    std::ostringstream text;
    connection->dumpStatistics(text);
    EXPECT_THAT(text.str(), StartsWith("Queue of console 1, the test:\n"
                                       "  In Front:       0 (0 B)\n"
                                       "  Waited:         0, at most 0 us\n"
                                       "  Limits:         501/1001\n"
                                       "  Max Size (HWM): 80 B\n"
                                       "  Pending:        0 (0 B)\n"
                                       "  Dropped:        0 (0 B)\n"
                                       "  Completed:      1 (80 B)\n"));
}

TEST_F(ConnectionTest, TheSmallestQueueHoldsOneMessage)
{
    ConnectionLimits limits;
    limits.queueBytes = 1;
    start(limits);
    identify();
    expectAnswersInOrder();
}

TEST_F(ConnectionTest, NoticesADisconnectWhileItDoesNotRead)
{
    start();
    identify();
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string data(16000, 'x');
    // Five stop the reader; what follows stays unread in the buffers of the system.
    for (int i = 0; i < 5; ++i)
        messages.send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    messages.send(QelMessageGetQelTodReq());
    loopback.near.reset();
    expectEnd();
}

TEST_F(ConnectionTest, ReadingResumesWhenThePartitionTakesItsInput)
{
    start();
    identify();
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string data(16000, 'x');
    for (int i = 0; i < 10; ++i)
        messages.send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    const QelMessageGetQelTodReq request;
    messages.send(request);
    std::promise<unsigned int> answered;
    std::thread reader([&] { answered.set_value(messages.receive()->getCallerId()); });
    auto answer = answered.get_future();
    EXPECT_EQ(answer.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    do {
        port1->takes = 1000 * 1000;
        hypervisor->serviceSerial(1);
    } while (answer.wait_for(std::chrono::milliseconds(1)) != std::future_status::ready);
    reader.join();
    EXPECT_EQ(answer.get(), request.getCallerId());
}

TEST_F(ConnectionTest, ARefusedConsoleGetsItsResponseAndIsClosed)
{
    limitConsoles(1);
    Peer first;
    HypervisorFixture::identify(first, "first");
    start();
    EXPECT_EQ(messages.ask(versionRequest("a"))->getStatus(), 18U);
    EXPECT_TRUE(messages.isClosed());
    expectEnd();
}

TEST_F(ConnectionTest, OnShutdownTheNoticeIsSentAndTheConnectionEnds)
{
    start();
    identify();
    hypervisor->shutDown();
    EXPECT_NE(messages.receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(messages.isClosed());
    expectEnd();
}

TEST_F(ConnectionTest, AbortEndsTheConnectionWhateverTheConsoleDoes)
{
    start();
    identify();
    messages.ask(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'm')));
    sendUntilStuck(QelMessageGetGlobalSaveAreaMetadataReq());
    connection->abort();
    expectEnd();
}

TEST_F(ConnectionTest, ARefusedConsoleThatDoesNotReadIsCut)
{
    ConnectionLimits limits;
    limits.linger = std::chrono::milliseconds(20);
    start(limits);
    identify();
    printUntilHeldBack();
    messages.send(QelMessageUpgradeConnectionAsync());
    expectEnd();
}

TEST_F(ConnectionTest, ARefusedConsoleThatReadsGetsEverythingQueued)
{
    start();
    identify();
    const unsigned chunks = printUntilHeldBack();
    messages.send(QelMessageUpgradeConnectionAsync());
    for (unsigned i = 1; i <= chunks; ++i)
        ASSERT_NE(messages.receive<QelMessageVirtualSerialDataToDaxAsync>(), nullptr) << i;
    const auto last = messages.receive();
    EXPECT_EQ(last->getFunction(), 0x6001);
    EXPECT_EQ(last->getOperation(), 0x0002);
    EXPECT_TRUE(messages.isClosed());
    expectEnd();
}

/// A connection over streams in memory.
class FrameTimeoutTest : public ConnectionTest {
protected:
    static constexpr std::chrono::milliseconds kFrame{60};

    FrameTimeoutTest()
    {
        ConnectionLimits limits;
        limits.frame = kFrame;
        auto ends = protocol::makeMemoryStreams();
        console = std::move(ends.first);
        console->setReadDeadline(Loopback::kDeadline);
        connection = ServedFixture::serve(std::move(ends.second), -1, limits);
        connection->start();
        frames = std::make_unique<LoopbackMessages>(*console);
        EXPECT_EQ(frames->ask(versionRequest("a"))->getStatus(), 0U);
    }
    ~FrameTimeoutTest() override { connection.reset(); }

    void send(std::size_t begin, std::size_t end)
    {
        frames->sendBytes(std::string(request.serialize(), request.msgLength()).substr(begin, end - begin));
    }

    const QelMessageGetInterfaceLimitsReq request;
    std::unique_ptr<Stream> console;
    std::unique_ptr<LoopbackMessages> frames;
};

/// The bytes of a frame after which it stops.
class StoppedFrameTest : public FrameTimeoutTest, public ::testing::WithParamInterface<std::size_t> {};

TEST_P(StoppedFrameTest, EndsTheConnection)
{
    send(0, GetParam());
    EXPECT_TRUE(frames->isClosed());
    expectEnd();
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not finish a message in time"));
}

INSTANTIATE_TEST_SUITE_P(Bytes, StoppedFrameTest, ::testing::Values(1, 7, 8, 9, 31));

TEST_F(FrameTimeoutTest, AFrameThatStopsAfterAWholeOneEndsTheConnection)
{
    const std::string bytes(request.serialize(), request.msgLength());
    frames->sendBytes(bytes + bytes.substr(0, 20));
    EXPECT_EQ(frames->receive()->getCallerId(), request.getCallerId());
    EXPECT_TRUE(frames->isClosed());
    expectEnd();
}

TEST_F(FrameTimeoutTest, BetweenFramesTheTimeIsNotLimited)
{
    EXPECT_FALSE(endsWithin(3 * kFrame));
    EXPECT_EQ(frames->ask(request)->getStatus(), 0U);
    EXPECT_FALSE(endsWithin(3 * kFrame));
    EXPECT_EQ(frames->ask(request)->getStatus(), 0U);
}

TEST_F(FrameTimeoutTest, EachFrameHasTheTimeAnew)
{
    for (int frame = 0; frame < 6; ++frame) {
        send(0, 9);
        EXPECT_FALSE(endsWithin(kFrame / 3)); // together they take longer than one may
        send(9, request.msgLength());
        EXPECT_EQ(frames->receive()->getCallerId(), request.getCallerId());
    }
}

TEST_F(FrameTimeoutTest, AByteNowAndThenGivesNoMoreTime)
{
    const auto giveAll = [this] {
        for (std::size_t sent = 0; sent + 1 < request.msgLength(); ++sent) {
            send(sent, sent + 1); // once the server has closed: "EOF"
            if (endsWithin(kFrame / 4)) throw StreamIOException("EOF");
        }
    };
    EXPECT_THROW(giveAll(), StreamIOException) << "it was never closed";
}

TEST_F(FrameTimeoutTest, AConsoleThatIsHeldBackWithinAFrameIsNotClosed)
{
    frames->ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    frames->ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    frames->ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string data(16000, 'x');
    for (int i = 0; i < 5; ++i) // more than the 64 KiB that the server keeps
        frames->send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    send(0, 9);
    EXPECT_FALSE(endsWithin(3 * kFrame));
    send(9, request.msgLength());
    port1->takes = 1000 * 1000;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(frames->receive()->getCallerId(), request.getCallerId());
}

TEST_F(FrameTimeoutTest, AnAbortedConnectionInMemoryEndsThoughItIsHeldBack)
{
    frames->ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    frames->ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    frames->ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    port1->takes = 0;
    const std::string data(16000, 'x');
    for (int i = 0; i < 5; ++i)
        frames->send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    connection->abort();
    expectEnd();
}

TEST_F(ConnectionTest, CanBeDestroyedAtAnyTime)
{
    start();
    identify();
    connection.reset();
    EXPECT_TRUE(messages.isClosed());
}

TEST_F(ConnectionTest, CanBeDestroyedWithoutAStart)
{
    connection = ServedFixture::serve(loopback);
    connection.reset();
    EXPECT_TRUE(messages.isClosed());
}

TEST_F(ConnectionTest, WhateverItsStreamThrowsWhenItIsClosedIsLogged)
{
    auto ends = protocol::makeMemoryStreams();
    connection = ServedFixture::serve(std::make_unique<BadCloseStream>(std::move(ends.second)), -1);
    connection->start();
    ends.first.reset();
    expectEnd();
    EXPECT_THAT(log.lines(), Contains("E: [qel] the test: cannot close: an exception that is not a std::exception"));
}

TEST_F(ConnectionTest, KeepsItsHandshakePlaceUntilItHasEnded)
{
    protocol::HandshakePlaces places(1, 1);
    auto ends = protocol::makeMemoryStreams(1);
    ConnectionLimits limits;
    limits.linger = Loopback::kDeadline;
    connection = std::make_unique<Connection>(
        protocol::ConnectionServices{*hypervisor, pins, limits, throttle, ended, refusals},
        protocol::ServedStream{std::move(ends.second), -1, "the test", "the source"}, nullptr, places.take("x"));
    connection->start();
    LoopbackMessages console(*ends.first);
    console.send(QelMessageGetQelTodReq());                                      // the response is not taken
    console.sendBytes(std::string("XXXX\0\0\0\x20", 8) + std::string(24, '\0')); // the end, but for the response
    EXPECT_FALSE(endsWithin(std::chrono::milliseconds(100)));
    EXPECT_FALSE(places.take("x"));
    ends.first.reset();
    expectEnd();
    EXPECT_TRUE(places.take("x"));
}

} // namespace

} // namespace qel::test
