#include <qel/common/util/PosixError.hpp>

#include "base/TerminalMode.hpp"
#include "support/Pty.hpp"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <stdexcept>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::TerminalMode;

TEST(TerminalMode, ConstructionChangesNothing)
{
    const Pty pty;
    const termios before = pty.attributes();
    {
        const TerminalMode mode(pty.slave());
        EXPECT_TRUE(mode.isTerminal());
        EXPECT_FALSE(mode.isRaw());
        EXPECT_TRUE(pty.attributes() == before);
    }
    EXPECT_TRUE(pty.attributes() == before);
}

TEST(TerminalMode, InRawModeEveryKeyIsDelivered)
{
    const Pty pty;
    TerminalMode mode(pty.slave());
    ASSERT_FALSE(isRaw(pty.attributes()));
    mode.enterRaw();
    EXPECT_TRUE(mode.isRaw());
    EXPECT_TRUE(isRaw(pty.attributes()));
    EXPECT_EQ(pty.attributes().c_cc[VMIN], 1);
    EXPECT_EQ(pty.attributes().c_cc[VTIME], 0);

    const std::string keys("\x03\x04\x11\x13\x1A\x1C\r\n\x7F\xFF", 10);
    pty.type(keys);
    std::string read(keys.size(), '\0');
    EXPECT_EQ(::read(pty.slave(), read.data(), read.size()), static_cast<ssize_t>(keys.size()));
    EXPECT_EQ(read, keys);
    ASSERT_EQ(::write(pty.slave(), "a\nb\r\n", 5), 5);
    EXPECT_EQ(pty.read(5), "a\nb\r\n"); // neither echo nor anything done to line ends
}

TEST(TerminalMode, RestoreSetsTheSavedMode)
{
    const Pty pty;
    termios special = pty.attributes();
    special.c_cc[VINTR] = 'k';
    special.c_lflag &= ~static_cast<tcflag_t>(ECHOE);
    pty.setAttributes(special);
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    mode.restore();
    EXPECT_FALSE(mode.isRaw());
    EXPECT_TRUE(pty.attributes() == special);
}

TEST(TerminalMode, DestructionRestores)
{
    const Pty pty;
    const termios before = pty.attributes();
    {
        TerminalMode mode(pty.slave());
        mode.enterRaw();
    }
    EXPECT_TRUE(pty.attributes() == before);
}

TEST(TerminalMode, AnExceptionRestores)
{
    const Pty pty;
    const termios before = pty.attributes();
    try {
        TerminalMode mode(pty.slave());
        mode.enterRaw();
        throw std::runtime_error("on the way");
    } catch (const std::runtime_error&) {
        EXPECT_TRUE(pty.attributes() == before);
    }
}

TEST(TerminalMode, RawModeCanBeEnteredAgain)
{
    const Pty pty;
    const termios before = pty.attributes();
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    termios other = before; // a shell has put its own mode while this process was stopped
    other.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    pty.setAttributes(other);
    mode.enterRaw();
    EXPECT_TRUE(isRaw(pty.attributes()));
    mode.restore();
    EXPECT_TRUE(pty.attributes() == before) << "goes back to what was found first";
}

TEST(TerminalMode, RestoringTwiceChangesNothingMore)
{
    const Pty pty;
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    mode.restore();
    termios other = pty.attributes();
    other.c_cc[VINTR] = 'k';
    pty.setAttributes(other);
    mode.restore();
    EXPECT_TRUE(pty.attributes() == other);
}

TEST(TerminalMode, OtherDescriptorsAreNotChanged)
{
    const int null = ::open("/dev/null", O_RDWR | O_CLOEXEC);
    for (const int descriptor : {null, -1}) {
        TerminalMode mode(descriptor);
        EXPECT_FALSE(mode.isTerminal());
        mode.enterRaw();
        EXPECT_FALSE(mode.isRaw());
        mode.restore();
    }
    ::close(null);
}

TEST(TerminalMode, ThrowsWhenTheTerminalHungUp)
{
    Pty pty;
    TerminalMode mode(pty.slave());
    pty.hangUp();
    EXPECT_THAT([&] { mode.enterRaw(); },
                ThrowsMessage<PosixError>(StrEq("cannot read the mode of the terminal: 5 (Input/output error)")));
    EXPECT_FALSE(mode.isRaw());
}

TEST(TerminalMode, RestoreIgnoresAHungUpTerminal)
{
    Pty pty;
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    pty.hangUp();
    EXPECT_THAT([&] { mode.enterRaw(); },
                ThrowsMessage<PosixError>(StrEq("cannot change the mode of the terminal: 5 (Input/output error)")));
    mode.restore();
    EXPECT_FALSE(mode.isRaw());
}

TEST(LineEnd, IsCarriageReturnAndLineFeedOnARawTerminal)
{
    const Pty pty;
    EXPECT_STREQ(tool::lineEndOf(pty.slave()), "\n");
    TerminalMode mode(pty.slave());
    mode.enterRaw();
    EXPECT_STREQ(tool::lineEndOf(pty.slave()), "\r\n");
    mode.restore();
    EXPECT_STREQ(tool::lineEndOf(pty.slave()), "\n");
}

TEST(LineEnd, IsALineFeedElsewhere)
{
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    EXPECT_STREQ(tool::lineEndOf(ends[1]), "\n");
    ::close(ends[0]);
    ::close(ends[1]);
    EXPECT_STREQ(tool::lineEndOf(-1), "\n");
}

} // namespace

} // namespace qel::test
