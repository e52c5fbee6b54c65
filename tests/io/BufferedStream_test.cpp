// What a buffered stream requests of the stream below it, and when.

#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/EOFStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "support/Allocations.hpp"
#include "support/Bytes.hpp"
#include "support/ScriptedStream.hpp"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

using qel::BufferedStream;
using qel::BufferedStreamOptions;
using qel::Stream;
using qel::StreamIOException;
using qel::test::Allocations;
using qel::test::ScriptedStream;
using std::chrono::milliseconds;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

using Bytes = std::vector<char>;

namespace {

BufferedStreamOptions sizes(std::size_t readAhead, std::size_t gather)
{
    BufferedStreamOptions options;
    options.readAheadBytes = readAhead;
    options.gatherBytes = gather;
    return options;
}

BufferedStreamOptions oneThread(std::size_t readAhead, std::size_t gather)
{
    BufferedStreamOptions options = sizes(readAhead, gather);
    options.flushBeforeRead = true;
    return options;
}

Bytes bytesOf(const std::string& text) { return {text.begin(), text.end()}; }

std::string textOf(const Bytes& bytes) { return {bytes.begin(), bytes.end()}; }

std::string readSome(Stream& stream, std::size_t length)
{
    std::string text(length, '?');
    text.resize(stream.read(text.data(), length));
    return text;
}

std::string fillOf(Stream& stream, std::size_t length)
{
    std::string text(length, '?');
    stream.fill(text.data(), length);
    return text;
}

void put(Stream& stream, const std::string& text) { stream.write(text.data(), text.size()); }

std::vector<std::string> writesOf(const ScriptedStream& stream)
{
    std::vector<std::string> texts;
    for (const Bytes& one : stream.writes())
        texts.push_back(textOf(one));
    return texts;
}

class BufferedStreamTest : public testing::Test {
protected:
    ScriptedStream mBelow;
};

using BufferedStreamRead = BufferedStreamTest;
using BufferedStreamWrite = BufferedStreamTest;
using BufferedStreamForOneThread = BufferedStreamTest;
using BufferedStreamContract = BufferedStreamTest;

// Reading

TEST_F(BufferedStreamRead, ServesManyReadsFromOneReadOfTheStreamBelow)
{
    BufferedStream stream(mBelow);
    mBelow.deliver(bytesOf("abcdefghij"));
    EXPECT_EQ(readSome(stream, 3), "abc");
    EXPECT_EQ(readSome(stream, 1), "d");
    EXPECT_EQ(fillOf(stream, 4), "efgh");
    EXPECT_EQ(readSome(stream, 100), "ij");
    EXPECT_THAT(mBelow.reads(), ElementsAre(16384U));
}

TEST_F(BufferedStreamRead, DoesNotReadBelowForMoreThanTheBufferHolds)
{
    BufferedStream stream(mBelow, sizes(8, 0));
    mBelow.deliver(bytesOf("abc")).deliver(bytesOf("def"));
    EXPECT_EQ(readSome(stream, 1), "a");
    EXPECT_EQ(readSome(stream, 5), "bc");
    EXPECT_THAT(mBelow.reads(), ElementsAre(8U));
    EXPECT_EQ(readSome(stream, 5), "def");
}

TEST_F(BufferedStreamRead, OfTheBuffersSizeGoesDirectlyBelowWhenTheBufferIsEmpty)
{
    BufferedStream stream(mBelow, sizes(4, 0));
    mBelow.deliver(bytesOf("abcd")).deliver(bytesOf("efgh")).deliver(bytesOf("ijklm"));
    EXPECT_EQ(readSome(stream, 3), "abc");
    EXPECT_EQ(readSome(stream, 4), "d");
    EXPECT_EQ(readSome(stream, 4), "efgh");
    EXPECT_EQ(readSome(stream, 5), "ijklm");
    EXPECT_THAT(mBelow.reads(), ElementsAre(4U, 4U, 5U));
}

TEST_F(BufferedStreamRead, FillsAcrossTheEndOfTheBuffer)
{
    BufferedStream stream(mBelow, sizes(4, 0));
    mBelow.deliver(bytesOf("abcdefghijkl")).deliver(bytesOf("mn"));
    EXPECT_EQ(fillOf(stream, 3), "abc");
    EXPECT_EQ(fillOf(stream, 8), "defghijk"); // "d" of the buffer, 7 bytes directly
    EXPECT_EQ(fillOf(stream, 3), "lmn");
    EXPECT_THAT(mBelow.reads(), ElementsAre(4U, 7U, 4U, 4U));
}

TEST_F(BufferedStreamRead, WithoutReadAheadRequestsWhatTheCallerDoes)
{
    BufferedStream stream(mBelow, sizes(0, 0));
    mBelow.deliver(bytesOf("abcdefghijkl"));
    EXPECT_EQ(fillOf(stream, 3), "abc");
    EXPECT_EQ(readSome(stream, 2), "de");
    EXPECT_FALSE(stream.hasPending());
    EXPECT_THAT(mBelow.reads(), ElementsAre(3U, 2U));
}

TEST_F(BufferedStreamRead, OfNothingDoesNotReadBelow)
{
    BufferedStream stream(mBelow);
    EXPECT_EQ(readSome(stream, 0), "");
    EXPECT_EQ(fillOf(stream, 0), "");
    EXPECT_THAT(mBelow.reads(), IsEmpty());
}

TEST_F(BufferedStreamRead, EndOfStreamFollowsTheBytesAndStays)
{
    BufferedStream stream(mBelow);
    mBelow.deliver(bytesOf("abc")).end();
    EXPECT_EQ(readSome(stream, 2), "ab");
    EXPECT_EQ(readSome(stream, 2), "c");
    EXPECT_EQ(readSome(stream, 2), "");
    EXPECT_EQ(readSome(stream, 2), "");
    EXPECT_THAT([&] { fillOf(stream, 1); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST_F(BufferedStreamRead, AFailureFollowsTheBytesAndReadingGoesOnAfterIt)
{
    BufferedStream stream(mBelow);
    mBelow.deliver(bytesOf("abc")).fail("the cable is out").deliver(bytesOf("def"));
    EXPECT_EQ(fillOf(stream, 3), "abc");
    EXPECT_THAT([&] { readSome(stream, 1); }, ThrowsMessage<StreamIOException>(StrEq("the cable is out")));
    EXPECT_FALSE(stream.hasPending());
    EXPECT_EQ(fillOf(stream, 3), "def");
}

TEST_F(BufferedStreamRead, HasPendingBytesUntilTheLastIsRead)
{
    BufferedStream stream(mBelow);
    EXPECT_FALSE(stream.hasPending());
    mBelow.deliver(bytesOf("ab"));
    EXPECT_FALSE(stream.hasPending());
    EXPECT_EQ(readSome(stream, 1), "a");
    EXPECT_TRUE(stream.hasPending());
    EXPECT_EQ(readSome(stream, 1), "b");
    EXPECT_FALSE(stream.hasPending());
}

// Writing

TEST_F(BufferedStreamWrite, GathersUntilFlush)
{
    BufferedStream stream(mBelow);
    put(stream, "abc");
    put(stream, "");
    put(stream, "de");
    EXPECT_THAT(writesOf(mBelow), IsEmpty());
    stream.flush();
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abcde"));
    stream.flush();
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abcde"));
}

TEST_F(BufferedStreamWrite, ThatDoesNotFitSendsWhatWasGatheredAndIsNotDivided)
{
    BufferedStream stream(mBelow, sizes(0, 8));
    put(stream, "abcde");
    put(stream, "fgh"); // fits exactly
    EXPECT_THAT(writesOf(mBelow), IsEmpty());
    put(stream, "i");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abcdefgh"));
    put(stream, "jklmnopq"); // 8 bytes, beside one
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abcdefgh", "i"));
    stream.flush();
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abcdefgh", "i", "jklmnopq"));
}

TEST_F(BufferedStreamWrite, LongerThanTheBufferGoesOnAfterWhatWasGathered)
{
    BufferedStream stream(mBelow, sizes(0, 8));
    put(stream, "abc");
    put(stream, "123456789");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abc", "123456789"));
    put(stream, "123456789");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("abc", "123456789", "123456789"));
}

TEST_F(BufferedStreamWrite, GathersEightKibibytesUnlessToldOtherwise)
{
    BufferedStream stream(mBelow);
    put(stream, std::string(8191, 'a'));
    put(stream, "b");
    EXPECT_THAT(writesOf(mBelow), IsEmpty());
    put(stream, "c");
    EXPECT_THAT(writesOf(mBelow), ElementsAre(std::string(8191, 'a') + 'b'));
}

TEST_F(BufferedStreamWrite, WithoutGatheringGoesOnAtOnce)
{
    BufferedStream stream(mBelow, sizes(0, 0));
    put(stream, "");
    put(stream, "a");
    put(stream, "bc");
    stream.flush();
    EXPECT_THAT(writesOf(mBelow), ElementsAre("a", "bc"));
}

TEST_F(BufferedStreamWrite, AFailedFlushDropsWhatWasGathered)
{
    BufferedStream stream(mBelow);
    mBelow.failWriteAt(2, "the cable is out");
    put(stream, "abc");
    put(stream, "def");
    EXPECT_THAT([&] { stream.flush(); }, ThrowsMessage<StreamIOException>(StrEq("the cable is out")));
    EXPECT_THAT(writesOf(mBelow), ElementsAre("ab"));
    stream.flush(); // has nothing left, and does not send it twice
    EXPECT_THAT(writesOf(mBelow), ElementsAre("ab"));
}

TEST_F(BufferedStreamWrite, AWriteWhoseFlushFailsIsNotGathered)
{
    BufferedStream stream(mBelow, sizes(0, 4));
    mBelow.failWriteAt(0, "the cable is out");
    put(stream, "abc");
    EXPECT_THAT([&] { put(stream, "de"); }, ThrowsMessage<StreamIOException>(StrEq("the cable is out")));
    const std::size_t writes = mBelow.writes().size();
    stream.flush();
    EXPECT_EQ(mBelow.writes().size(), writes);
}

TEST_F(BufferedStreamWrite, ToAStreamThatHasEndedFailsInTheFlush)
{
    BufferedStream stream(qel::EOFStream::get());
    put(stream, "abc");
    EXPECT_THAT([&] { stream.flush(); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

// Both directions

TEST_F(BufferedStreamForOneThread, AReadThatGoesBelowFlushesFirst)
{
    BufferedStream stream(mBelow, oneThread(8, 8));
    mBelow.deliver(bytesOf("abc")).deliver(bytesOf("defghijkl"));
    put(stream, "1");
    EXPECT_EQ(readSome(stream, 1), "a");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("1"));
    put(stream, "2");
    EXPECT_EQ(readSome(stream, 2), "bc");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("1")); // served from the buffer
    EXPECT_EQ(readSome(stream, 8), "defghijk");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("1", "2")); // directly
    put(stream, "3");
    EXPECT_EQ(fillOf(stream, 1), "l");
    EXPECT_THAT(writesOf(mBelow), ElementsAre("1", "2", "3"));
}

TEST_F(BufferedStreamForOneThread, AReadThrowsWhatItsFlushThrowsAndReadsNothing)
{
    BufferedStream stream(mBelow, oneThread(8, 8));
    mBelow.failWriteAt(0, "the cable is out").deliver(bytesOf("abc"));
    put(stream, "1");
    EXPECT_THAT([&] { readSome(stream, 1); }, ThrowsMessage<StreamIOException>(StrEq("the cable is out")));
    EXPECT_THAT(mBelow.reads(), IsEmpty());
    EXPECT_EQ(readSome(stream, 3), "abc");
}

TEST_F(BufferedStreamForOneThread, WithoutTheModeReadsDoNotFlush)
{
    BufferedStream stream(mBelow);
    mBelow.deliver(bytesOf("abc"));
    put(stream, "1");
    EXPECT_EQ(readSome(stream, 3), "abc");
    EXPECT_THAT(writesOf(mBelow), IsEmpty());
}

TEST_F(BufferedStreamForOneThread, EightRequestsAndTheirResponsesAreTwoWritesAndTwoReads)
{
    qel::QelMessageRegistry registry;
    const qel::QelMessageVirtualSerialOpenReq request(1, 0, false);
    const qel::QelMessageVirtualSerialOpenRsp response(request.getCallerId(), 1, 0);
    Bytes responses;
    for (int i = 0; i < 8; ++i)
        responses.insert(responses.end(), response.serialize(), response.serialize() + response.msgLength());
    mBelow.deliver(responses);

    BufferedStream stream(mBelow, oneThread(16384, 8192));
    qel::QelMessageStream messages(stream, registry);
    for (int i = 0; i < 8; ++i)
        messages.write(request);
    for (int i = 0; i < 8; ++i)
        EXPECT_EQ(messages.read()->getOperation(), response.getOperation());
    EXPECT_EQ(mBelow.writes().size(), 1U);
    EXPECT_EQ(mBelow.written().size(), 8U * request.msgLength());
    EXPECT_EQ(mBelow.reads().size(), 1U);
}

// The contract beside the bytes

TEST_F(BufferedStreamContract, DeadlinesAreThoseOfTheStreamBelow)
{
    BufferedStream stream(mBelow);
    stream.setReadDeadline(milliseconds(10));
    stream.setWriteDeadline(milliseconds(20));
    stream.clearReadDeadline();
    EXPECT_THAT(mBelow.readDeadlines(), ElementsAre(milliseconds(10), milliseconds(-1)));
    EXPECT_THAT(mBelow.writeDeadlines(), ElementsAre(milliseconds(20)));
}

TEST_F(BufferedStreamContract, CloseSendsNothingAndLeavesWhatWasReadAhead)
{
    BufferedStream stream(mBelow);
    mBelow.deliver(bytesOf("abc"));
    EXPECT_EQ(readSome(stream, 1), "a");
    put(stream, "1");
    stream.close();
    EXPECT_EQ(mBelow.closeCount(), 1U);
    EXPECT_THAT(mBelow.writes(), IsEmpty());
    EXPECT_EQ(readSome(stream, 3), "bc");
    EXPECT_THAT([&] { readSome(stream, 1); }, ThrowsMessage<StreamIOException>(StrEq("closed")));
    EXPECT_THAT([&] { stream.flush(); }, ThrowsMessage<StreamIOException>(StrEq("closed")));
}

TEST_F(BufferedStreamContract, TheDestructorSendsNothing)
{
    {
        BufferedStream stream(mBelow);
        put(stream, "1");
    }
    EXPECT_THAT(mBelow.writes(), IsEmpty());
    EXPECT_EQ(mBelow.closeCount(), 0U);
}

class Counted : public ScriptedStream {
public:
    explicit Counted(int& alive) : mAlive(alive) { ++mAlive; }
    ~Counted() override { --mAlive; }

private:
    int& mAlive;
};

TEST_F(BufferedStreamContract, OwnsAStreamThatItIsGiven)
{
    int alive = 0;
    {
        auto below = std::make_unique<Counted>(alive);
        below->deliver(bytesOf("abc"));
        BufferedStream stream(std::move(below));
        EXPECT_EQ(readSome(stream, 3), "abc");
        EXPECT_EQ(alive, 1);
    }
    EXPECT_EQ(alive, 0);
}

TEST_F(BufferedStreamContract, DestroysAStreamThatItIsGivenWhenThereIsNoMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    int alive = 0;
    auto below = std::make_unique<Counted>(alive);
    {
        Allocations allocations;
        allocations.failAll();
        EXPECT_THROW(BufferedStream(std::move(below)), std::bad_alloc);
    }
    EXPECT_EQ(alive, 0);
}

TEST_F(BufferedStreamContract, RefusesANullPointerAndAnotherBufferedStream)
{
    EXPECT_THAT([] { BufferedStream(std::unique_ptr<Stream>()); },
                ThrowsMessage<std::invalid_argument>(StrEq("stream")));
    BufferedStream stream(mBelow);
    Stream& known = stream;
    EXPECT_THAT([&] { BufferedStream second(known); }, ThrowsMessage<std::invalid_argument>(StrEq("stream")));
}

/// Delivers and takes any number of bytes, and does not allocate.
class EndlessStream : public Stream {
public:
    void close() override {}
    std::size_t read(char* buffer, std::size_t length) override
    {
        std::fill_n(buffer, length, 'x');
        return length;
    }
    void write(const char*, std::size_t) override {}
};

TEST_F(BufferedStreamContract, AllocatesNothingAfterTheConstructor)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    EndlessStream below;
    BufferedStream stream(below, oneThread(64, 64));
    char buffer[200] = {};
    const Allocations allocations;
    for (std::size_t length = 0; length <= sizeof(buffer); ++length) {
        stream.write(buffer, length);
        stream.fill(buffer, length);
        stream.read(buffer, length);
        static_cast<void>(stream.hasPending());
    }
    stream.flush();
    stream.close();
    EXPECT_EQ(allocations.count(), 0U);
}

} // namespace
