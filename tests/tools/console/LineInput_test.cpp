#include "console/LineInput.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

using tool::LineInput;
using State = LineInput::State;

TEST(LineInput, TakesALineAndLeavesTheRest)
{
    LineInput line;
    std::string typed = "na";
    EXPECT_EQ(line.take(typed), "na");
    EXPECT_EQ(line.state(), State::Open);
    typed = "me\rmore";
    EXPECT_EQ(line.take(typed), "me\r\n");
    EXPECT_EQ(line.state(), State::Done);
    EXPECT_EQ(line.text(), "name");
    EXPECT_EQ(typed, "more");
}

TEST(LineInput, MistakesCanBeCorrected)
{
    LineInput line;
    std::string typed = "ab\x7F\x08\x08xy\x15z\x01\r";
    EXPECT_EQ(line.take(typed), "ab\b \b\b \b\axy\b \b\b \bz\a\r\n");
    EXPECT_EQ(line.text(), "z");
}

TEST(LineInput, CanBeCancelled)
{
    for (const char key : {'\x03', '\x1B'}) {
        LineInput line;
        std::string typed = std::string("a") + key + "b";
        EXPECT_EQ(line.take(typed), "a\r\n");
        EXPECT_EQ(line.state(), State::Cancelled);
        EXPECT_EQ(typed, "b");
    }
}

} // namespace

} // namespace qel::test
