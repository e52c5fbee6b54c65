#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "base/DescriptorOutput.hpp"
#include "base/TerminalMode.hpp"
#include "support/Pty.hpp"
#include "support/TemporaryDirectory.hpp"

#include <array>
#include <csignal>
#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <sstream>
#include <string>
#include <thread>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::DescriptorOutput;
using tool::TerminalMode;

/// A pipe with room for so many bytes.
struct Pipe {
    explicit Pipe(int room = 4096)
    {
        std::array<int, 2> ends{};
        if (::pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
        readEnd = UniqueFd(ends[0]);
        writeEnd = UniqueFd(ends[1]);
        if (::fcntl(ends[1], F_SETPIPE_SZ, room) < room) throw std::runtime_error("F_SETPIPE_SZ");
    }

    std::string read(std::size_t atMost) const
    {
        std::string text(atMost, '\0');
        const ssize_t count = ::read(readEnd.get(), text.data(), text.size());
        text.resize(count < 0 ? 0 : static_cast<std::size_t>(count));
        return text;
    }

    UniqueFd readEnd;
    UniqueFd writeEnd;
};

/// Text of which every part is different.
std::string numbers(std::size_t length)
{
    std::string text;
    for (unsigned int i = 0; text.size() < length; ++i)
        text += std::to_string(i) + ",";
    return text.substr(0, length);
}

void append(DescriptorOutput& output, const std::string& text) { output.append(text.data(), text.size()); }

TEST(DescriptorOutput, WritesWhatItWasGiven)
{
    const Pipe pipe;
    DescriptorOutput output(pipe.writeEnd.get());
    EXPECT_TRUE(output.isEmpty());
    append(output, "one ");
    append(output, "");
    append(output, "two");
    EXPECT_FALSE(output.isEmpty());
    output.writeSome();
    EXPECT_TRUE(output.isEmpty());
    EXPECT_EQ(pipe.read(100), "one two");
}

TEST(DescriptorOutput, WithoutDataNothingIsWritten)
{
    DescriptorOutput output(-1); // nothing can be written to it
    output.writeSome();
    output.flush();
    EXPECT_TRUE(output.isEmpty());
}

TEST(DescriptorOutput, KeepsWhatAFullPipeDoesNotTake)
{
    const Pipe pipe;
    DescriptorOutput output(pipe.writeEnd.get());
    const std::string text = numbers(100000);
    append(output, text);
    std::string read;
    while (read.size() < text.size()) {
        output.writeSome(); // never waits
        const std::string some = pipe.read(1000);
        ASSERT_FALSE(some.empty());
        read += some;
    }
    EXPECT_EQ(read, text);
    EXPECT_TRUE(output.isEmpty());
}

TEST(DescriptorOutput, IsReadyOnceTheDescriptorIs)
{
    const Pipe pipe;
    DescriptorOutput output(pipe.writeEnd.get());
    append(output, numbers(10000));
    output.writeSome();
    ASSERT_FALSE(output.isEmpty());
    EXPECT_FALSE(PollSet(output.getPollFd()).poll().anyReady());
    EXPECT_EQ(pipe.read(4096).size(), 4096U);
    EXPECT_TRUE(PollSet(output.getPollFd()).poll().anyReady());
}

TEST(DescriptorOutput, HasRoomUpToALimit)
{
    DescriptorOutput output(-1);
    append(output, std::string(DescriptorOutput::kRoom - 1, 'x'));
    EXPECT_TRUE(output.hasRoom());
    append(output, "x");
    EXPECT_FALSE(output.hasRoom());
}

TEST(DescriptorOutput, FlushingWaitsForTheReader)
{
    const Pipe pipe;
    const std::string text = numbers(100000);
    std::string read;
    std::thread reader([&] {
        while (read.size() < text.size())
            read += pipe.read(5000);
    });
    DescriptorOutput output(pipe.writeEnd.get());
    append(output, text);
    output.flush();
    EXPECT_TRUE(output.isEmpty());
    reader.join();
    EXPECT_EQ(read, text);
}

TEST(DescriptorOutput, DroppedOutputIsNotWritten)
{
    const Pipe pipe;
    DescriptorOutput output(pipe.writeEnd.get());
    output.drop();
    EXPECT_TRUE(output.endsLine()) << "nothing was dropped";
    append(output, "line\n");
    output.drop();
    EXPECT_TRUE(output.isEmpty());
    EXPECT_FALSE(output.endsLine()) << "a part of it may have been written";
    append(output, "x");
    output.writeSome();
    EXPECT_EQ(pipe.read(100), "x");
}

TEST(DescriptorOutput, KnowsWhetherALineHasEnded)
{
    DescriptorOutput output(-1);
    EXPECT_TRUE(output.endsLine());
    append(output, "$ ");
    EXPECT_FALSE(output.endsLine());
    append(output, "ls\r\n");
    EXPECT_TRUE(output.endsLine());
    append(output, "");
    EXPECT_TRUE(output.endsLine());
}

TEST(DescriptorOutput, ThrowsWhenTheReaderIsGone)
{
    const auto before = std::signal(SIGPIPE, SIG_IGN);
    Pipe pipe;
    pipe.readEnd.reset();
    DescriptorOutput output(pipe.writeEnd.get());
    append(output, "x");
    EXPECT_THAT([&] { output.writeSome(); },
                ThrowsMessage<PosixError>(StrEq("cannot write to standard output: 32 (Broken pipe)")));
    EXPECT_THAT([&] { output.flush(); },
                ThrowsMessage<PosixError>(StrEq("cannot write to standard output: 32 (Broken pipe)")));
    static_cast<void>(std::signal(SIGPIPE, before));
}

TEST(DescriptorOutput, ThrowsWhenTheDiskIsFull)
{
    const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    ASSERT_GE(full.get(), 0);
    DescriptorOutput output(full.get());
    append(output, "x");
    EXPECT_THAT([&] { output.writeSome(); },
                ThrowsMessage<PosixError>(StrEq("cannot write to standard output: 28 (No space left on device)")));
}

TEST(DescriptorOutput, AFileTakesEverything)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    const std::string text = numbers(100000);
    {
        const UniqueFd file(::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        DescriptorOutput output(file.get());
        append(output, text);
        output.writeSome();
        EXPECT_TRUE(output.isEmpty());
    }
    std::ifstream stream(path);
    std::ostringstream read;
    read << stream.rdbuf();
    EXPECT_EQ(read.str(), text);
}

TEST(DescriptorOutput, DoesNotWaitForAHaltedTerminal)
{
    const Pty pty;
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    DescriptorOutput output(pty.slave());
    const std::string text = numbers(1000000);
    append(output, text);
    output.writeSome();
    ASSERT_FALSE(output.isEmpty()) << "the terminal was meant to be full";
    EXPECT_EQ(::fcntl(pty.slave(), F_GETFL) & O_NONBLOCK, 0) << "other processes share it";

    std::string screen;
    while (screen.size() < text.size()) {
        screen += pty.read(1);
        screen += pty.read(std::min<std::size_t>(100, text.size() - screen.size()));
        output.writeSome();
    }
    EXPECT_EQ(screen, text);
    EXPECT_TRUE(output.isEmpty());
}

TEST(DescriptorOutput, TheMasterOfATerminalIsNotOpenedAgain)
{
    const Pty pty; // of its master there is only one: opening that again makes a new terminal
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    DescriptorOutput output(pty.master());
    append(output, "typed");
    output.writeSome();
    std::string read(5, '\0');
    ASSERT_EQ(::read(pty.slave(), read.data(), read.size()), 5);
    EXPECT_EQ(read, "typed");
}

} // namespace

} // namespace qel::test
