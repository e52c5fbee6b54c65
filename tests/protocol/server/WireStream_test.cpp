#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/server/RecordingStream.hpp"
#include "server/WireStream.hpp"
#include "support/LoopbackEnds.hpp"
#include "support/SettableClock.hpp"

#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <utility>

namespace qel::test {

namespace {

using protocol::WireStream;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

std::string readSome(Stream& stream, std::size_t length = 100)
{
    std::string bytes(length, '\0');
    bytes.resize(stream.read(&bytes[0], length));
    return bytes;
}

class WireStreamTest : public ::testing::Test {
protected:
    WireStreamTest()
    {
        auto owned = std::make_unique<RecordingStream>();
        below = owned.get();
        stream = std::make_unique<WireStream>(std::move(owned), -1);
    }

    RecordingStream* below;
    std::unique_ptr<WireStream> stream;
};

TEST_F(WireStreamTest, SaysBeforeEachReadThatItMayWait)
{
    below->chunks = {"one", "two"};
    std::vector<std::size_t> readsBefore;
    stream->onRead([&] { readsBefore.push_back(below->lengths.size()); });
    EXPECT_EQ(readSome(*stream), "one");
    EXPECT_EQ(readSome(*stream), "two");
    EXPECT_THAT(readsBefore, ElementsAre(0, 1));
}

TEST_F(WireStreamTest, WhatIsThrownBeforeAReadIsThrownByIt)
{
    stream->onRead([] { throw StreamIOException("not sent"); });
    EXPECT_THROW(readSome(*stream), StreamIOException);
    EXPECT_THAT(below->lengths, IsEmpty());
}

TEST_F(WireStreamTest, ADeadlineReachesTheStreamBelowWithTheNextRead)
{
    stream->setReadDeadline(milliseconds(5));
    stream->setReadDeadline(milliseconds(6));
    EXPECT_THAT(below->settings, IsEmpty());
    readSome(*stream);
    readSome(*stream);
    EXPECT_THAT(below->settings, ElementsAre(6));
}

TEST_F(WireStreamTest, WithoutASocketWritesMayAlwaysWait)
{
    EXPECT_FALSE(stream->needsNoWait());
    stream->setMayWait(false);
    stream->write("out", 3);
    EXPECT_EQ(below->written, "out");
    EXPECT_FALSE(stream->hasRest());
}

TEST_F(WireStreamTest, PassesTheRestThrough)
{
    stream->setWriteDeadline(milliseconds(5));
    EXPECT_EQ(below->writeDeadline(), 5);
    stream->close();
    EXPECT_TRUE(below->isClosed);
    EXPECT_EQ(&stream->below(), below);
}

class WireStreamOverSocket : public ::testing::Test {
protected:
    WireStreamOverSocket()
    {
        const int descriptor = ends.far->getSocket().getFd();
        stream = std::make_unique<WireStream>(std::move(ends.far), descriptor);
    }

    /// Reads so many bytes at the peer's end.
    std::string take(std::size_t length)
    {
        std::string bytes(length, '\0');
        ends.near->fill(&bytes[0], length);
        return bytes;
    }

    void resetByPeer()
    {
        const linger atOnce{1, 0};
        ASSERT_EQ(::setsockopt(ends.near->getSocket().getFd(), SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce)), 0);
        ends.near.reset();
    }

    Loopback ends;
    std::unique_ptr<WireStream> stream;
};

TEST_F(WireStreamOverSocket, WhatFindsRoomIsSentAtOnce)
{
    stream->setMayWait(false);
    stream->write("some", 4);
    EXPECT_FALSE(stream->hasRest());
    EXPECT_EQ(take(4), "some");
}

TEST_F(WireStreamOverSocket, WhatFindsNoRoomIsKeptAndSentInOrder)
{
    std::string sent;
    stream->setMayWait(false);
    while (!stream->hasRest()) { // the peer does not read
        const std::string piece(10007, static_cast<char>('a' + sent.size() % 26));
        stream->write(piece.data(), piece.size());
        sent += piece;
    }
    stream->write("later", 5);
    sent += "later";
    auto taken = std::async(std::launch::async, [&] { return take(sent.size()); });
    stream->setMayWait(true);
    stream->sendRest();
    EXPECT_FALSE(stream->hasRest());
    EXPECT_EQ(taken.get(), sent);
    stream->sendRest(); // nothing
    stream->write("end", 3);
    EXPECT_EQ(take(3), "end");
}

TEST_F(WireStreamOverSocket, AFailureIsThatOfTheSocket)
{
    stream->close();
    stream->setMayWait(false);
    try {
        stream->write("some", 4);
        FAIL() << "it was sent";
    } catch (const StreamIOException& error) {
        EXPECT_STREQ(error.what(), "socket stream send failure");
    }
    EXPECT_FALSE(stream->hasRest());
}

/// The receive timeout that the socket has, in milliseconds; 0: none.
long timeoutOf(int descriptor)
{
    timeval value{};
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(descriptor, SOL_SOCKET, SO_RCVTIMEO, &value, &length), 0);
    return value.tv_sec * 1000 + value.tv_usec / 1000;
}

TEST_F(WireStreamOverSocket, ADeadlineIsNotSetForWhatHasArrived)
{
    const int descriptor = dynamic_cast<SocketStream&>(stream->below()).getSocket().getFd();
    stream->setReadDeadline(std::chrono::seconds(20));
    ends.near->write("some", 4);
    ASSERT_TRUE(PollSet(PollFd(descriptor, PollEvents::Read)).wait(Loopback::kDeadline).anyReady());
    EXPECT_EQ(readSome(*stream), "some");
    EXPECT_EQ(timeoutOf(descriptor), 0);
    stream->setReadDeadline(milliseconds(1));
    EXPECT_THROW(readSome(*stream), StreamIOException);
    EXPECT_GT(timeoutOf(descriptor), 0); // this one had to wait
}

TEST_F(WireStreamOverSocket, ADeadlineThatPassesIsThatOfTheSocket)
{
    stream->setReadDeadline(milliseconds(1));
    EXPECT_THROW(readSome(*stream), StreamIOException);
    stream->setReadDeadline(milliseconds(0));
    ends.near->write("some", 4);
    EXPECT_THROW(
        {
            for (;;)
                readSome(*stream); // what has arrived, and then nothing more
        },
        StreamIOException);
}

TEST_F(WireStreamOverSocket, APeerThatKeepsSendingDoesNotStopTheTime)
{
    SettableClock clock;
    stream->setReadDeadline(std::chrono::seconds(10));
    ends.near->write("onetwothree", 11);
    EXPECT_EQ(readSome(*stream, 3), "one");
    clock.advance(std::chrono::seconds(10));
    EXPECT_EQ(readSome(*stream, 3), "two");
    clock.advance(milliseconds(1));
    try {
        readSome(*stream);
        FAIL() << "the deadline has passed";
    } catch (const StreamIOException& error) {
        EXPECT_STREQ(error.what(), "I/O deadline");
    }
}

TEST_F(WireStreamOverSocket, AReadWithADeadlineSaysThatThePeerHasResetTheConnection)
{
    resetByPeer();
    stream->setReadDeadline(Loopback::kDeadline);
    try {
        readSome(*stream);
        FAIL() << "the end of the stream";
    } catch (const StreamIOException& error) {
        EXPECT_STREQ(error.what(), "socket stream receive failure");
        EXPECT_THROW(std::rethrow_if_nested(error), PosixError);
    }
}

TEST_F(WireStreamOverSocket, AWriteThatDoesNotWaitSaysThatThePeerHasResetTheConnection)
{
    resetByPeer();
    stream->setMayWait(false);
    try {
        stream->write("some", 4);
        FAIL() << "it was sent";
    } catch (const StreamIOException& error) {
        EXPECT_EQ(protocol::explain(error),
                  "socket stream send failure: socket stream send failure: 104 (Connection reset by peer)");
    }
}

TEST_F(WireStreamOverSocket, TheEndIsThatOfTheSocket)
{
    stream->setReadDeadline(Loopback::kDeadline);
    ends.near.reset();
    EXPECT_EQ(readSome(*stream), "");
}

} // namespace

} // namespace qel::test
