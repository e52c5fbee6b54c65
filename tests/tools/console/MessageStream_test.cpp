#include <qel/common/util/UniqueFd.hpp>

#include "console/MessageStream.hpp"

#include <array>
#include <csignal>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>
#include <unistd.h>

namespace qel::test {

namespace {

using tool::DescriptorOutput;
using tool::MessageStream;

class MessageStreamTest : public ::testing::Test {
protected:
    MessageStreamTest()
    {
        std::array<int, 2> ends{};
        if (::pipe2(ends.data(), O_CLOEXEC | O_NONBLOCK) != 0) throw std::runtime_error("pipe2");
        readEnd = UniqueFd(ends[0]);
        writeEnd = UniqueFd(ends[1]);
    }

    std::string read(std::size_t atMost) const
    {
        std::string text(atMost, '\0');
        const ssize_t count = ::read(readEnd.get(), text.data(), text.size());
        text.resize(count < 0 ? 0 : static_cast<std::size_t>(count));
        return text;
    }
    /// @return the bytes that made it full
    std::size_t fill() const
    {
        std::size_t length = 0;
        while (::write(writeEnd.get(), "-", 1) == 1)
            ++length;
        return length;
    }

    UniqueFd readEnd;
    UniqueFd writeEnd;
};

TEST_F(MessageStreamTest, WritesWhenItIsFlushed)
{
    MessageStream stream(writeEnd.get());
    stream << "one " << 2;
    stream.put('!');
    EXPECT_EQ(read(100), "");
    stream << std::flush;
    EXPECT_EQ(read(100), "one 2!");
}

TEST_F(MessageStreamTest, WhatAFullPipeDoesNotTakeFollowsLater)
{
    MessageStream stream(writeEnd.get());
    const std::size_t filler = fill();
    stream << "first" << std::flush; // does not wait
    EXPECT_EQ(read(filler), std::string(filler, '-'));
    stream << ", second" << std::flush;
    EXPECT_EQ(read(100), "first, second");
}

TEST_F(MessageStreamTest, DropsWhatExceedsItsRoom)
{
    MessageStream stream(writeEnd.get());
    const std::size_t filler = fill();
    stream << std::string(DescriptorOutput::kRoom, 'a') << "dropped" << std::flush;
    EXPECT_EQ(read(filler), std::string(filler, '-'));
    stream << "dropped too" << std::flush;
    EXPECT_EQ(read(filler + 1000), std::string(DescriptorOutput::kRoom, 'a'));
}

TEST_F(MessageStreamTest, AReaderThatIsGoneIsIgnored)
{
    const auto before = std::signal(SIGPIPE, SIG_IGN);
    MessageStream stream(writeEnd.get());
    readEnd.reset();
    stream << "x" << std::flush;
    EXPECT_TRUE(stream.good());
    static_cast<void>(std::signal(SIGPIPE, before));
}

} // namespace

} // namespace qel::test
