#include <qel/common/CappedStringStream.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Allocations.hpp"

#include <gtest/gtest.h>
#include <iomanip>
#include <ios>
#include <ostream>
#include <string>
#include <type_traits>

namespace qel::test {
namespace {

using Traits = std::streambuf::traits_type;

TEST(CappedStringStreambuf, TakesWhatFitsAndReturnsTheCount)
{
    CappedStringStreambuf buffer(5);
    EXPECT_EQ(buffer.sputn("abc", 3), 3);
    EXPECT_EQ(buffer.sputn("defg", 4), 2);
    EXPECT_EQ(buffer.str(), "abcde");
    EXPECT_EQ(buffer.sputn("h", 1), 0);
    EXPECT_EQ(buffer.str(), "abcde");
}

TEST(CappedStringStreambuf, TakesNothingFromAnEmptyText)
{
    CappedStringStreambuf buffer(5);
    EXPECT_EQ(buffer.sputn("abc", 0), 0);
    EXPECT_EQ(buffer.sputn("abc", -1), 0);
    EXPECT_EQ(buffer.str(), "");
}

TEST(CappedStringStreambuf, TakesSingleCharactersUpToTheLimit)
{
    CappedStringStreambuf buffer(2);
    EXPECT_EQ(buffer.sputc('a'), 'a');
    EXPECT_EQ(buffer.sputc('b'), 'b');
    EXPECT_EQ(buffer.sputc('c'), Traits::eof());
    EXPECT_EQ(buffer.str(), "ab");
}

TEST(CappedStringStreambuf, TakesTheByte0xFF)
{
    CappedStringStreambuf buffer(5);
    EXPECT_EQ(buffer.sputc('\xFF'), 0xFF);
    EXPECT_EQ(buffer.str(), "\xFF");
}

class OpenStreambuf : public CappedStringStreambuf {
public:
    using CappedStringStreambuf::CappedStringStreambuf;
    using CappedStringStreambuf::overflow;
};

TEST(CappedStringStreambuf, RefusesEndOfFile)
{
    OpenStreambuf buffer(5);
    EXPECT_EQ(buffer.overflow(Traits::eof()), Traits::eof());
    EXPECT_EQ(buffer.str(), "");
    EXPECT_EQ(buffer.overflow('x'), 'x');
    EXPECT_EQ(buffer.str(), "x");
}

TEST(CappedStringStreambuf, TakesNothingWithALimitOfZero)
{
    OpenStreambuf buffer(0);
    EXPECT_EQ(buffer.sputn("a", 1), 0);
    EXPECT_EQ(buffer.sputc('a'), Traits::eof());
    EXPECT_EQ(buffer.str(), "");
}

TEST(CappedStringStream, IsUsableFromTheFirstInsertion)
{
    CappedStringStream stream(100);
    EXPECT_TRUE(stream.good());
    stream << "text " << 42 << ' ' << hexFormat(static_cast<unsigned short>(0x1F)) << std::endl;
    EXPECT_TRUE(stream.good());
    EXPECT_EQ(stream.str(), "text 42 0x001F\n");
}

TEST(CappedStringStream, StaysGoodWhenTheTextFitsExactly)
{
    CappedStringStream stream(5);
    stream << "abc"
           << "de";
    EXPECT_TRUE(stream.good());
    EXPECT_EQ(stream.str(), "abcde");
}

TEST(CappedStringStream, CutsTheCharacterBeyondTheLimitAndSetsBadbit)
{
    CappedStringStream stream(5);
    stream << "abcdef";
    EXPECT_TRUE(stream.bad());
    EXPECT_EQ(stream.str(), "abcde");
}

TEST(CappedStringStream, RefusesACharacterAfterAFullText)
{
    CappedStringStream stream(5);
    stream << "abcde" << 'f';
    EXPECT_TRUE(stream.bad());
    EXPECT_EQ(stream.str(), "abcde");
}

TEST(CappedStringStream, CutsANumberInTheMiddle)
{
    CappedStringStream stream(5);
    stream << "abc" << 4711;
    EXPECT_TRUE(stream.bad());
    EXPECT_EQ(stream.str(), "abc47");
}

TEST(CappedStringStream, DropsEverythingAfterTheCut)
{
    CappedStringStream stream(5);
    stream << "abcdefgh";
    stream << 'x' << "" << 1;
    stream.write("y", 1).put('z');
    EXPECT_EQ(stream.str(), "abcde");
}

TEST(CappedStringStream, CountsPadding)
{
    CappedStringStream stream(5);
    stream << std::setw(8) << std::setfill('.') << 42;
    EXPECT_TRUE(stream.bad());
    EXPECT_EQ(stream.str(), ".....");
}

TEST(CappedStringStream, KeepsEveryByteValue)
{
    std::string all;
    for (int value = 0; value < 256; ++value)
        all += static_cast<char>(value);
    CappedStringStream stream(512);
    for (const char byte : all)
        stream.put(byte);
    stream << all;
    EXPECT_EQ(stream.str(), all + all);
}

TEST(CappedStringStream, GrowsBeyondItsFirstCapacity)
{
    CappedStringStream stream(100000);
    std::string expected;
    for (int i = 0; i < 5000; ++i) {
        stream << i << ',';
        expected += std::to_string(i) + ',';
    }
    EXPECT_TRUE(stream.good());
    EXPECT_EQ(stream.str(), expected);
}

TEST(CappedStringStream, StrReturnsACopy)
{
    CappedStringStream stream(100);
    stream << "one";
    const std::string& text = stream.str();
    stream << " two";
    EXPECT_EQ(text, "one");
    EXPECT_EQ(stream.str(), "one two");
}

TEST(CappedStringStream, SetsBadbitWithoutMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    CappedStringStream stream(100);
    {
        Allocations allocations;
        allocations.failAll();
        stream << "text";
    }
    EXPECT_TRUE(stream.bad());
    EXPECT_EQ(stream.str(), "");
}

TEST(CappedStringStream, IsAnOutputStreamOverACappedBuffer)
{
    EXPECT_TRUE((std::is_base_of_v<std::ostream, CappedStringStream>));
    CappedStringStream stream(5);
    EXPECT_NE(dynamic_cast<CappedStringStreambuf*>(stream.rdbuf()), nullptr);
}

} // namespace
} // namespace qel::test
