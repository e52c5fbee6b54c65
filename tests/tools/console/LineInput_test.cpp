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

TEST(LineInput, ACharacterOfSeveralBytesIsErasedAsOne)
{
    LineInput line;
    std::string typed = "a\xC3\xA9\xE2\x82\xAC\x7F";
    EXPECT_EQ(line.take(typed), "a\xC3\xA9\xE2\x82\xAC\b \b");
    EXPECT_EQ(line.text(), "a\xC3\xA9");
    typed = "\x15\xA9\x7F\r";
    EXPECT_EQ(line.take(typed), "\b \b\b \b\xA9\b \b\r\n");
    EXPECT_EQ(line.text(), "");
}

TEST(LineInput, KeysThatSendSequencesOnlyRingTheBell)
{
    for (const char* const key : {"\x1B[A", "\x1B[1;5C", "\x1BOP", "\x1B[3~", "\x1B["}) {
        LineInput line;
        std::string typed = "a" + std::string(key);
        EXPECT_EQ(line.take(typed), "a\a") << key + 1;
        EXPECT_EQ(typed, "");
        typed = "b\r";
        EXPECT_EQ(line.take(typed), "b\r\n");
        EXPECT_EQ(line.text(), "ab");
    }
}

} // namespace

} // namespace qel::test
