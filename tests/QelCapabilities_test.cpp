#include <qel/common/QelCapabilities.hpp>

#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using testing::StrEq;
using testing::ThrowsMessage;

const std::string kAllClear(32, '0');

std::string printed(const QelCapabilities& capabilities)
{
    std::ostringstream os;
    os << capabilities;
    return os.str();
}

TEST(QelCapabilities, AreAllClearWhenDefaultConstructed)
{
    const QelCapabilities capabilities;
    for (std::size_t index = 0; index < 32; ++index) {
        SCOPED_TRACE(index);
        EXPECT_FALSE(capabilities[index]);
    }
}

TEST(QelCapabilities, Are32Bits)
{
    static_assert(QelCapabilities::size() == 32, "a constant expression");
    EXPECT_EQ(printed(QelCapabilities()).size(), 32U);
}

TEST(QelCapabilities, SetSetsOneBit)
{
    for (std::size_t index = 0; index < 32; ++index) {
        SCOPED_TRACE(index);
        QelCapabilities capabilities;
        capabilities.set(index);
        for (std::size_t other = 0; other < 32; ++other) {
            SCOPED_TRACE(other);
            EXPECT_EQ(capabilities[other], other == index);
        }
    }
}

TEST(QelCapabilities, ResetClearsOneBit)
{
    for (std::size_t index = 0; index < 32; ++index) {
        SCOPED_TRACE(index);
        QelCapabilities capabilities(std::string(32, '1'));
        capabilities.reset(index);
        for (std::size_t other = 0; other < 32; ++other) {
            SCOPED_TRACE(other);
            EXPECT_EQ(capabilities[other], other != index);
        }
    }
}

TEST(QelCapabilities, SetAndResetChain)
{
    QelCapabilities capabilities;
    EXPECT_EQ(&capabilities.set(1).set(2).reset(1), &capabilities);
    EXPECT_EQ(capabilities, QelCapabilities().set(2));
}

TEST(QelCapabilities, BitNumber31IsTheLast)
{
    QelCapabilities capabilities;
    EXPECT_NO_THROW(capabilities.set(31));
    EXPECT_TRUE(capabilities[31]);
    EXPECT_NO_THROW(capabilities.reset(31));
    EXPECT_FALSE(capabilities[31]);
}

TEST(QelCapabilities, IndexOf32OrMoreIsOutOfRange)
{
    for (const std::size_t index : {std::size_t{32}, std::size_t{33}, static_cast<std::size_t>(-1)}) {
        SCOPED_TRACE(index);
        QelCapabilities capabilities("01");
        EXPECT_THROW(capabilities.set(index), std::out_of_range);
        EXPECT_THROW(capabilities.reset(index), std::out_of_range);
        EXPECT_THROW(static_cast<void>(capabilities[index]), std::out_of_range);
        EXPECT_EQ(capabilities, QelCapabilities("01"));
    }
}

TEST(QelCapabilities, FirstCharacterIsBit0)
{
    EXPECT_EQ(QelCapabilities("1"), QelCapabilities().set(0));
    EXPECT_EQ(printed(QelCapabilities("1")), "1" + std::string(31, '0'));
    EXPECT_EQ(QelCapabilities(std::string(31, '0') + "1"), QelCapabilities().set(31));
}

TEST(QelCapabilities, CharacterISetsBitI)
{
    for (std::size_t index = 0; index < 32; ++index) {
        SCOPED_TRACE(index);
        std::string text = kAllClear;
        text[index] = '1';
        EXPECT_EQ(QelCapabilities(text), QelCapabilities().set(index));
    }
}

TEST(QelCapabilities, ShortTextLeavesTheRestClear)
{
    EXPECT_EQ(QelCapabilities("0110"), QelCapabilities().set(1).set(2));
}

TEST(QelCapabilities, EmptyTextGivesAnEmptySet) { EXPECT_EQ(QelCapabilities(""), QelCapabilities()); }

TEST(QelCapabilities, CharactersAfterThe32ndAreIgnored)
{
    EXPECT_EQ(QelCapabilities(kAllClear + "x"), QelCapabilities());
    EXPECT_EQ(QelCapabilities(kAllClear + "1"), QelCapabilities());
    EXPECT_EQ(QelCapabilities(std::string(32, '1') + "0x"), QelCapabilities(std::string(32, '1')));
}

TEST(QelCapabilities, OtherCharactersAreRefused)
{
    const std::string texts[] = {
        "2",
        "x",
        " ",
        " 1",
        "1 ",
        "-1",
        "/",                   // the character before '0'
        std::string(1, '\0'),  // a NUL is not special
        std::string("1\0", 2), //
        std::string(1, '\xFF'),
        std::string(31, '1') + "x", // the 32nd is still checked
    };
    for (const std::string& text : texts) {
        SCOPED_TRACE(test::hex(text));
        EXPECT_THAT([&] { QelCapabilities capabilities(text); },
                    ThrowsMessage<std::invalid_argument>(StrEq("invalid string given to capability set")));
    }
}

TEST(QelCapabilities, PrintsBit0First)
{
    EXPECT_EQ(printed(QelCapabilities()), "00000000000000000000000000000000");
    EXPECT_EQ(printed(QelCapabilities().set(0).set(7).set(8).set(31)), "10000001100000000000000000000001");
}

TEST(QelCapabilities, TextIsWhatIsPrinted)
{
    const QelCapabilities capabilities = QelCapabilities().set(0).set(9).set(30);
    EXPECT_EQ(capabilities.to_string(), "10000000010000000000000000000010");
    EXPECT_EQ(capabilities.to_string(), printed(capabilities));
}

TEST(QelCapabilities, TextReadsBack)
{
    for (const char* const text :
         {"00000000000000000000000000000000", "10110000000000000000000000000001", "11111111111111111111111111111111"}) {
        EXPECT_EQ(QelCapabilities(text).to_string(), text);
    }
}

TEST(QelCapabilities, PrintTheSameOnAStreamLeftInHexadecimal)
{
    std::ostringstream os;
    os << std::hex << std::uppercase << std::showbase << QelCapabilities("011") << '.';
    EXPECT_EQ(os.str(), "01100000000000000000000000000000.");
}

TEST(QelCapabilities, Compare)
{
    const QelCapabilities one = QelCapabilities().set(3);
    EXPECT_TRUE(one == QelCapabilities("0001"));
    EXPECT_FALSE(one != QelCapabilities("0001"));
    EXPECT_TRUE(one != QelCapabilities());
    EXPECT_FALSE(one == QelCapabilities());
}

TEST(QelCapabilities, AreAValue)
{
    QelCapabilities one("1");
    const QelCapabilities copy = one;
    one.set(5);
    EXPECT_EQ(copy, QelCapabilities("1"));
    static_assert(!std::is_convertible<std::string, QelCapabilities>::value, "a text must not convert implicitly");
    static_assert(sizeof(QelCapabilities) <= sizeof(unsigned long), "a small value");
}

} // namespace
} // namespace qel
