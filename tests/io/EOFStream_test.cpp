#include <qel/common/io/EOFStream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <thread>
#include <type_traits>
#include <vector>

using namespace std::chrono_literals;
using qel::EOFStream;
using qel::StreamIOException;
using testing::StrEq;
using testing::ThrowsMessage;

namespace {

// Called while the static objects of the program are constructed.
EOFStream& streamBeforeMain = EOFStream::get();
const std::size_t readBeforeMain = EOFStream::get().read(nullptr, 0);

TEST(EOFStream, IsAlwaysTheSameObject)
{
    EXPECT_EQ(&EOFStream::get(), &EOFStream::get());
    EXPECT_EQ(&EOFStream::get(), &streamBeforeMain);
    EXPECT_TRUE(noexcept(EOFStream::get()));
}

TEST(EOFStream, IsTheSameObjectInEveryThread)
{
    std::vector<EOFStream*> seen(4);
    std::vector<std::thread> threads;
    for (EOFStream*& one : seen)
        threads.emplace_back([&one] { one = &EOFStream::get(); });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_THAT(seen, testing::Each(&EOFStream::get()));
}

TEST(EOFStream, CannotBeConstructedOrCopied)
{
    EXPECT_FALSE(std::is_default_constructible<EOFStream>::value);
    EXPECT_FALSE(std::is_copy_constructible<EOFStream>::value);
    EXPECT_FALSE(std::is_copy_assignable<EOFStream>::value);
    EXPECT_TRUE(std::is_final<EOFStream>::value);
    EXPECT_TRUE((std::is_base_of<qel::Stream, EOFStream>::value));
}

TEST(EOFStream, ReadsZeroBytesAndLeavesTheBufferUnchanged)
{
    char buffer[4] = {'a', 'b', 'c', 'd'};
    EXPECT_EQ(EOFStream::get().read(buffer, sizeof(buffer)), 0U);
    EXPECT_EQ(EOFStream::get().read(buffer, 1), 0U);
    EXPECT_EQ(EOFStream::get().read(buffer, 0), 0U);
    EXPECT_THAT(buffer, testing::ElementsAre('a', 'b', 'c', 'd'));
}

TEST(EOFStream, ReadsZeroBytesBeforeMainBegins) { EXPECT_EQ(readBeforeMain, 0U); }

TEST(EOFStream, FillThrowsAtOnce)
{
    char buffer[1];
    EXPECT_THAT([&] { EOFStream::get().fill(buffer, 1); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    EXPECT_NO_THROW(EOFStream::get().fill(buffer, 0));
}

TEST(EOFStream, RefusesEveryWrite)
{
    EXPECT_THAT([] { EOFStream::get().write("x", 1); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    EXPECT_THAT([] { EOFStream::get().write("", 0); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST(EOFStream, IgnoresDeadlines)
{
    EOFStream& stream = EOFStream::get();
    for (const auto timeout : {0ms, 1ms, -5ms, std::chrono::milliseconds::max(), std::chrono::milliseconds::min()}) {
        SCOPED_TRACE(timeout.count());
        EXPECT_NO_THROW(stream.setReadDeadline(timeout));
        EXPECT_NO_THROW(stream.setWriteDeadline(timeout));
        EXPECT_EQ(stream.read(nullptr, 0), 0U);
        EXPECT_THAT([&] { stream.write("x", 1); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    }
    EXPECT_NO_THROW(stream.clearReadDeadline());
    EXPECT_NO_THROW(stream.clearWriteDeadline());
}

TEST(EOFStream, CloseHasNoEffect)
{
    EOFStream::get().close();
    EOFStream::get().close();
    EXPECT_EQ(EOFStream::get().read(nullptr, 0), 0U);
    EXPECT_THAT([] { EOFStream::get().write("x", 1); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

} // namespace
