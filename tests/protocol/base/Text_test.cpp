#include <qel/protocol/Text.hpp>

#include <gtest/gtest.h>

namespace qel::test {

namespace {

using protocol::hexDigits;
using protocol::printable;

TEST(Text, PrintableAsciiStaysAsItIs)
{
    std::string all;
    for (char c = 0x20; c < 0x7F; ++c) {
        if (c != '\\') all += c;
    }
    EXPECT_EQ(printable(all), all);
    EXPECT_EQ(printable(""), "");
}

TEST(Text, EverythingElseIsEscaped)
{
    EXPECT_EQ(printable(std::string("\0\x1B[2J\n\x1F\x7F\x80\xFF", 10)), "\\x00\\x1b[2J\\x0a\\x1f\\x7f\\x80\\xff");
    EXPECT_EQ(printable("a\\x41"), "a\\\\x41");
}

TEST(Text, HexDigitsAreTwoForEachByte)
{
    EXPECT_EQ(hexDigits(std::string("\0\x0F\xF0\xFF", 4)), "000ff0ff");
    EXPECT_EQ(hexDigits(""), "");
}

} // namespace

} // namespace qel::test
