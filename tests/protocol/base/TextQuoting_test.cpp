#include <qel/protocol/Text.hpp>

#include <gtest/gtest.h>

namespace qel::test {

namespace {

using protocol::printableLines;
using protocol::quoted;

TEST(TextQuoting, QuotesInsideQuotedTextAreEscaped)
{
    EXPECT_EQ(quoted("console-101"), "\"console-101\"");
    EXPECT_EQ(quoted(""), "\"\"");
    EXPECT_EQ(quoted("a\": b"), "\"a\\\": b\"");
    EXPECT_EQ(quoted("\\\""), "\"\\\\\\\"\"");
    EXPECT_EQ(quoted(std::string("\x1B]0;x\x07\0\n", 8)), "\"\\x1b]0;x\\x07\\x00\\x0a\"");
}

TEST(TextQuoting, LinesKeepTheirEnds)
{
    EXPECT_EQ(printableLines("a\nb\n\n"), "a\nb\n\n");
    EXPECT_EQ(printableLines(std::string("\x1B[2J\r\n\t\\\0\xFE", 10)), "\\x1b[2J\\x0d\n\\x09\\\\\\x00\\xfe");
}

} // namespace

} // namespace qel::test
