#include "base/ProgressBar.hpp"
#include "support/Pty.hpp"

#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <unistd.h>

namespace qel::test {

namespace {

using tool::ProgressBar;

TEST(ProgressBar, TheLine)
{
    struct Case {
        const char* name;
        double fraction;
        std::size_t columns;
        std::string line;
    };
    const std::vector<Case> cases{
        {"nothing yet", 0, 22, "[...........] 0%  abc"},
        {"half", 0.5, 24, "[######......] 50%  abc"},
        {"all", 1, 24, "[###########] 100%  abc"},
        {"more than all", 1.5, 24, "[###########] 100%  abc"},
        {"less than nothing", -1, 22, "[...........] 0%  abc"},
        {"a wide terminal", 0.25, 200, "[##########..............................] 25%  abc"},
        {"room for a bar of one", 1, 14, "[#] 100%  abc"},
        {"no room for a bar", 1, 13, "100%  abc"},
        {"no room for the remark", 1, 6, "100% "},
        {"no room at all", 1, 1, ""},
        {"a terminal that has no width", 1, 0, ""},
    };
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.name);
        const std::string line = ProgressBar::line(entry.fraction, "abc", entry.columns);
        EXPECT_EQ(line, entry.line);
        EXPECT_LE(line.size(), entry.columns == 0 ? 0 : entry.columns - 1);
    }
}

TEST(ProgressBar, ATerminalShowsOneLineThatIsClearedAtTheEnd)
{
    const Pty terminal;
    winsize size{};
    size.ws_row = 24;
    size.ws_col = 24;
    ASSERT_EQ(::ioctl(terminal.slave(), TIOCSWINSZ, &size), 0);
    {
        ProgressBar bar(terminal.slave());
        EXPECT_TRUE(bar.isShown());
        bar.update(0.5, "abc");
        size.ws_col = 0; // the width is unknown
        ASSERT_EQ(::ioctl(terminal.slave(), TIOCSWINSZ, &size), 0);
        bar.update(1, "abc");
    }
    const std::string expected = "\r\x1B[K[######......] 50%  abc"
                                 "\r\x1B[K[########################################] 100%  abc"
                                 "\r\x1B[K";
    EXPECT_EQ(terminal.read(expected.size()), expected);
}

TEST(ProgressBar, OtherDescriptorsGetNothing)
{
    int ends[2];
    ASSERT_EQ(::pipe(ends), 0);
    {
        ProgressBar bar(ends[1]);
        EXPECT_FALSE(bar.isShown());
        bar.update(0.5, "half");
    }
    ::close(ends[1]);
    char byte = 0;
    EXPECT_EQ(::read(ends[0], &byte, 1), 0);
    ::close(ends[0]);
}

} // namespace

} // namespace qel::test
