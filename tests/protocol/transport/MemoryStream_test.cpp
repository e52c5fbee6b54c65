#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "transport/Readiness.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <gmock/gmock.h>
#include <numeric>
#include <stdexcept>
#include <string>
#include <thread>

namespace qel::test {

namespace {

using protocol::makeMemoryStreams;
using protocol::Readiness;
using protocol::Ready;
using testing::StrEq;
using testing::ThrowsMessage;

constexpr std::chrono::milliseconds kShort(5);

std::string readSome(Stream& stream, std::size_t length = 100)
{
    std::string bytes(length, '\0');
    bytes.resize(stream.read(bytes.data(), bytes.size()));
    return bytes;
}

void write(Stream& stream, const std::string& bytes) { stream.write(bytes.data(), bytes.size()); }

TEST(MemoryStream, EachReadsWhatTheOtherWrites)
{
    const auto streams = makeMemoryStreams();
    const auto& one = streams.first;
    const auto& other = streams.second;
    write(*one, "there");
    write(*other, "back");
    EXPECT_EQ(readSome(*other), "there");
    EXPECT_EQ(readSome(*one), "back");
}

TEST(MemoryStream, ReadsAtMostWhatWasAskedForAndKeepsTheRest)
{
    const auto streams = makeMemoryStreams();
    const auto& one = streams.first;
    const auto& other = streams.second;
    write(*one, "abcdef");
    EXPECT_EQ(readSome(*other, 4), "abcd");
    write(*one, "gh");
    EXPECT_EQ(readSome(*other), "efgh");
    char none = 0;
    EXPECT_EQ(other->read(&none, 0), 0U);
}

TEST(MemoryStream, OneDirectionCanEndAlone)
{
    const auto streams = makeMemoryStreams();
    const auto& one = streams.first;
    const auto& other = streams.second;
    write(*one, "last");
    dynamic_cast<Readiness&>(*one).endOutput();
    EXPECT_THAT([&] { write(*one, "x"); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    EXPECT_EQ(readSome(*other), "last");
    EXPECT_TRUE(dynamic_cast<Readiness&>(*other).awaitReady(true, kShort).receive);
    EXPECT_EQ(readSome(*other), "");
    write(*other, "back");
    EXPECT_EQ(readSome(*one), "back");
}

TEST(MemoryStream, AReaderWaitsForBytes)
{
    const auto streams = makeMemoryStreams();
    const auto& one = streams.first;
    const auto& other = streams.second;
    std::thread writer([stream = one.get()] { write(*stream, "late"); });
    EXPECT_EQ(readSome(*other), "late");
    writer.join();
}

TEST(MemoryStream, AWriterWaitsForRoomAndLosesNothing)
{
    const auto streams = makeMemoryStreams(3);
    const auto& one = streams.first;
    const auto& other = streams.second;
    std::string sent(1000, '\0');
    std::iota(sent.begin(), sent.end(), '\0');
    std::thread writer([stream = one.get(), &sent] { write(*stream, sent); });
    std::string received;
    while (received.size() < sent.size()) {
        const std::string piece = readSome(*other);
        EXPECT_LE(piece.size(), 3U);
        received += piece;
    }
    writer.join();
    EXPECT_EQ(received, sent);
}

TEST(MemoryStream, ADeadlineThatPassesLeavesTheStreamUsable)
{
    const auto streams = makeMemoryStreams(4);
    const auto& one = streams.first;
    const auto& other = streams.second;
    one->setReadDeadline(kShort);
    EXPECT_THAT([&] { readSome(*one); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    one->setWriteDeadline(kShort);
    EXPECT_THAT([&] { write(*one, "12345"); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    one->clearReadDeadline();
    write(*other, "ok");
    EXPECT_EQ(readSome(*one), "ok");
    EXPECT_EQ(readSome(*other), "1234");
}

TEST(MemoryStream, ADeadlineMayBeAsLongAsAnybodyLikes)
{
    const auto streams = makeMemoryStreams();
    streams.first->setReadDeadline(std::chrono::milliseconds::max());
    std::thread reader([&] { EXPECT_EQ(readSome(*streams.first), "late"); });
    write(*streams.second, "late");
    reader.join();
}

// Whether the stream is ready, as a console asks it.

Ready readiness(Stream& stream, bool wantsToReceive = true, std::chrono::milliseconds timeout = {})
{
    return dynamic_cast<Readiness&>(stream).awaitReady(wantsToReceive, timeout);
}

TEST(MemoryStreamReadiness, IsThatOfTheDirectionAsked)
{
    const auto streams = makeMemoryStreams(20000);
    write(*streams.first, "x");
    EXPECT_TRUE(readiness(*streams.first).send);
    EXPECT_FALSE(readiness(*streams.first).receive);
    EXPECT_TRUE(readiness(*streams.second).receive);
    EXPECT_FALSE(readiness(*streams.second, false).receive) << "not asked";
    readSome(*streams.second);
    EXPECT_FALSE(readiness(*streams.second).receive);
}

TEST(MemoryStreamReadiness, NeedsRoomForAWholeMessage)
{
    constexpr std::size_t kWhole = 16384 + 1024;
    const auto streams = makeMemoryStreams(kWhole + 10);
    write(*streams.first, std::string(10, 'x'));
    EXPECT_TRUE(readiness(*streams.first).send);
    write(*streams.first, "x");
    EXPECT_FALSE(readiness(*streams.first).send);
    readSome(*streams.second, 1);
    EXPECT_TRUE(readiness(*streams.first).send);
}

TEST(MemoryStreamReadiness, OfASmallStreamNeedsAllOfItsRoom)
{
    const auto streams = makeMemoryStreams(4);
    EXPECT_TRUE(readiness(*streams.first).send);
    write(*streams.first, "x");
    EXPECT_FALSE(readiness(*streams.first, true, kShort).send);
    readSome(*streams.second);
    EXPECT_TRUE(readiness(*streams.first).send);
}

TEST(MemoryStreamReadiness, ComesWithTheEnd)
{
    const auto streams = makeMemoryStreams(4);
    write(*streams.first, "full");
    EXPECT_FALSE(readiness(*streams.first).send);
    streams.second->close();
    EXPECT_TRUE(readiness(*streams.first).send);
    EXPECT_TRUE(readiness(*streams.first).receive);
}

TEST(MemoryStreamReadiness, IsWaitedFor)
{
    const auto streams = makeMemoryStreams(4);
    write(*streams.first, "full");
    for (const auto timeout : {std::chrono::milliseconds(-1), std::chrono::milliseconds::max()}) {
        std::thread other([&] { write(*streams.second, "x"); });
        EXPECT_TRUE(readiness(*streams.first, true, timeout).receive);
        other.join();
        readSome(*streams.first);
    }
}

TEST(MemoryStream, ClosingLetsTheRestBeReadAndEndsBothDirections)
{
    const auto streams = makeMemoryStreams();
    const auto& one = streams.first;
    const auto& other = streams.second;
    write(*one, "last");
    write(*other, "also");
    one->close();
    EXPECT_EQ(readSome(*other), "last");
    EXPECT_EQ(readSome(*other), "");
    EXPECT_EQ(readSome(*one), "also");
    EXPECT_EQ(readSome(*one), "");
    EXPECT_THAT([&] { write(*one, "x"); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    EXPECT_THAT([&] { write(*other, "x"); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST(MemoryStream, ClosingWakesAReaderAndAWriter)
{
    const auto streams = makeMemoryStreams(1);
    const auto& one = streams.first;
    const auto& other = streams.second;
    std::thread reader([stream = one.get()] { EXPECT_EQ(readSome(*stream), ""); });
    std::thread writer([stream = one.get()] { EXPECT_THROW(write(*stream, "xy"), StreamIOException); });
    other->close();
    reader.join();
    writer.join();
}

TEST(MemoryStream, DestroyingAStreamClosesIt)
{
    auto streams = makeMemoryStreams();
    write(*streams.first, "last");
    streams.first.reset();
    EXPECT_EQ(readSome(*streams.second), "last");
    EXPECT_EQ(readSome(*streams.second), "");
}

TEST(MemoryStream, NeedsRoom)
{
    EXPECT_THAT([] { makeMemoryStreams(0); }, ThrowsMessage<std::invalid_argument>(StrEq("capacity")));
}

} // namespace

} // namespace qel::test
