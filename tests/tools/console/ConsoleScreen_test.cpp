#include <qel/common/util/UniqueFd.hpp>

#include "console/ConsoleScreen.hpp"
#include "support/Pty.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using tool::ConsoleScreen;
using tool::TerminalMode;

void show(ConsoleScreen& screen, const std::string& text) { screen.output().append(text.data(), text.size()); }

void broadcast(ConsoleScreen& screen, std::uint32_t type, const std::string& id, const std::string& text)
{
    screen.showBroadcast(
        QelMessageDaxBroadcastOutboundAsync(static_cast<std::uint16_t>(text.size()), type, id, text.data()));
}

class ConsoleScreenTest : public ::testing::Test {
protected:
    /// Reads the terminal up to this text.
    std::string onTerminal(const std::string& end) const
    {
        std::string screen;
        while (screen.size() < end.size() || screen.compare(screen.size() - end.size(), end.size(), end) != 0)
            screen += pty.read(1);
        return screen;
    }

    const Pty pty;
    TerminalMode mode{pty.slave()};
    std::ostringstream errors;
    ConsoleScreen apart{pty.slave(), errors, false, mode};
    ConsoleScreen together{pty.slave(), errors, true, mode};
};

TEST_F(ConsoleScreenTest, OutputIsKeptUntilItIsWritten)
{
    show(apart, "some");
    show(apart, "thing");
    EXPECT_FALSE(apart.output().isEmpty());
    apart.output().writeSome();
    EXPECT_EQ(pty.read(9), "something");
}

TEST_F(ConsoleScreenTest, AMessageBeginsWithTheNameOfTheProgram)
{
    apart.say("hello");
    EXPECT_EQ(errors.str(), "qel: hello\n");
}

TEST_F(ConsoleScreenTest, OutputBeforeAMessageIsWrittenFirst)
{
    show(apart, "before");
    apart.say("hello");
    EXPECT_TRUE(apart.output().isEmpty());
    EXPECT_EQ(pty.read(6), "before");
}

TEST_F(ConsoleScreenTest, OnASharedTerminalAMessageStartsANewLine)
{
    together.say("first");
    show(together, "$ ");
    together.say("second");
    show(together, "ls\n");
    together.say("third");
    EXPECT_EQ(onTerminal("third\r\n"), "qel: first\r\n$ \r\nqel: second\r\nls\r\nqel: third\r\n");
    EXPECT_EQ(errors.str(), "");
}

TEST_F(ConsoleScreenTest, InRawModeAMessageEndsWithCarriageReturn)
{
    mode.enterRaw();
    EXPECT_STREQ(together.lineEnd(), "\r\n");
    show(together, "$ ");
    together.say("hello");
    EXPECT_EQ(onTerminal("hello\r\n"), "$ \r\nqel: hello\r\n");
    mode.restore();
    EXPECT_STREQ(together.lineEnd(), "\n");
}

TEST_F(ConsoleScreenTest, MessagesOnASharedTerminalKeepTheirPlaceInTheOutput)
{
    mode.enterRaw();
    show(together, "before\r\n");
    together.say("hello");
    show(together, "after\r\n");
    together.output().writeSome();
    EXPECT_EQ(onTerminal("after\r\n"), "before\r\nqel: hello\r\nafter\r\n");
}

TEST_F(ConsoleScreenTest, OnlyATerminalHasABell)
{
    mode.enterRaw();
    apart.sayLoudly("hello");
    EXPECT_EQ(errors.str(), "qel: hello\n");
    together.sayLoudly("hello");
    EXPECT_EQ(onTerminal("\n"), "\aqel: hello\r\n");
}

TEST_F(ConsoleScreenTest, MessagesToAnotherPlaceIgnoreRawMode)
{
    mode.enterRaw();
    show(apart, "$ ");
    apart.say("hello");
    EXPECT_EQ(errors.str(), "qel: hello\n");
}

TEST_F(ConsoleScreenTest, OutputToAnotherPlaceDoesNotAffectMessages)
{
    const TemporaryDirectory directory;
    const UniqueFd file(::open(directory.file("output").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    ConsoleScreen screen(file.get(), errors, true, mode);
    mode.enterRaw();
    show(screen, "$ ");
    screen.say("hello");
    EXPECT_EQ(errors.str(), "qel: hello\r\n");
}

TEST_F(ConsoleScreenTest, ABroadcastNamesItsSender)
{
    broadcast(apart, 4294967295, "them", "hello there");
    EXPECT_EQ(errors.str(), "qel: broadcast from tool type 4294967295, \"them\": hello there\n");
}

TEST_F(ConsoleScreenTest, ABroadcastMayBeEmpty)
{
    broadcast(apart, 0, "", "");
    EXPECT_EQ(errors.str(), "qel: broadcast from tool type 0, \"\": \n");
}

TEST_F(ConsoleScreenTest, ABroadcastIsEscaped)
{
    broadcast(apart, 1, "a\", \x1B", std::string("\x1B[2J\r\nqel: \0\xFF", 13));
    EXPECT_EQ(errors.str(), "qel: broadcast from tool type 1, \"a\\\", \\x1b\": \\x1b[2J\\x0d\\x0aqel: \\x00\\xff\n");
}

} // namespace

} // namespace qel::test
