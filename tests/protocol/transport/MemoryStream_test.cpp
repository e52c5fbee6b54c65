#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include <array>
#include <gmock/gmock.h>
#include <numeric>
#include <stdexcept>
#include <string>
#include <thread>

namespace qel::test {

namespace {

using protocol::makeMemoryStreams;
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
