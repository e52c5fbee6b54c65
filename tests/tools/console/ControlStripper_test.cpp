#include "console/ControlStripper.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

using tool::ControlStripper;

std::string stripped(const std::string& text)
{
    ControlStripper stripper;
    std::string out;
    stripper.append(text.data(), text.size(), out);
    // The same byte by byte: a sequence may be split anywhere.
    ControlStripper again;
    std::string pieces;
    for (const char c : text)
        again.append(&c, 1, pieces);
    EXPECT_EQ(out, pieces);
    return out;
}

TEST(ControlStripper, TextStays)
{
    EXPECT_EQ(stripped("plain ~ text\n\tof lines\n"), "plain ~ text\n\tof lines\n");
    EXPECT_EQ(stripped("gr\xC3\xBC\xC3\x9F"), "gr\xC3\xBC\xC3\x9F");
}

TEST(ControlStripper, ControlCharactersGo)
{
    EXPECT_EQ(stripped(std::string("a\0\r\n\x07\x08\x0E\x0F\x7F"
                                   "b",
                                   10)),
              "a\nb");
}

TEST(ControlStripper, ControlSequencesGo)
{
    EXPECT_EQ(stripped("\x1B[1;31mred\x1B[0m \x1B[?2004h\x1B[2Kx\x1B[10@y"), "red xy");
}

TEST(ControlStripper, EscapeSequencesGo)
{
    EXPECT_EQ(stripped("\x1B(Ba\x1B"
                       "7b\x1B=c\x1B#8d\x1B"
                       "Me"),
              "abcde");
}

TEST(ControlStripper, StringsGoWithTheirContent)
{
    EXPECT_EQ(stripped("\x1B]0;a title\x07text"), "text");
    EXPECT_EQ(stripped("\x1B]8;;http://x\x1B\\link\x1B]8;;\x1B\\"), "link");
    EXPECT_EQ(stripped("\x1BPdevice\x1B\\\x1B_app\x1B\\\x1B^pm\x1B\\\x1BXsos\x1B\\end"), "end");
}

TEST(ControlStripper, ASequenceThatIsInterruptedEnds)
{
    EXPECT_EQ(stripped("\x1B[1;\x18text"), "text");
    EXPECT_EQ(stripped("\x1B]0;title\x1Atext"), "text");
    EXPECT_EQ(stripped("\x1B[1\x1B[31mtext"), "text");
    EXPECT_EQ(stripped("\x1B\x1B[31mtext"), "text");
    EXPECT_EQ(stripped("\x1B]0;title\x1B[31mtext"), "text") << "a string that another sequence ends";
}

} // namespace

} // namespace qel::test
