#include "status/StatusScreen.hpp"

#include <gtest/gtest.h>

namespace qel::test {

namespace {

using tool::fitScreen;

TEST(FitScreen, CutsEachLineToTheWidth)
{
    EXPECT_EQ(fitScreen("abc\nabcd\n\nx", 4, 3), "abc\x1b[K\r\nabc\x1b[K\r\n\x1b[K\r\nx\x1b[K");
}

TEST(FitScreen, SaysHowManyLinesFoundNoRoom)
{
    EXPECT_EQ(fitScreen("1\n2\n3\n", 3, 80), "1\x1b[K\r\n2\x1b[K\r\n3\x1b[K");
    EXPECT_EQ(fitScreen("1\n2\n3\n4\n", 3, 80), "1\x1b[K\r\n2\x1b[K\r\n... 2 more lines\x1b[K");
    EXPECT_EQ(fitScreen("1\n2\n", 1, 5), "... 2\x1b[K");
}

TEST(FitScreen, OfNothingIsNothing) { EXPECT_EQ(fitScreen("", 1, 1), ""); }

} // namespace

} // namespace qel::test
