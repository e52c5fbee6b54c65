#include <qel/common/BCDExtensions.hpp>

#include "support/Bytes.hpp"

#include <climits>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>

namespace qel {
namespace {

using testing::StrEq;
using testing::ThrowsMessage;

constexpr char kTooLarge[] = "type cannot be represented in BCD";

template <typename T>
std::string stored(const bcd_uint<T>& value)
{
    return test::hex(&value, sizeof(value));
}

TEST(BcdUint, HoldsTwoDigitsInEachByte)
{
    EXPECT_EQ(bcd_uint8_t::digits(), 2U);
    EXPECT_EQ(bcd_uint16_t::digits(), 4U);
    EXPECT_EQ(sizeof(bcd_uint8_t), 1U);
    EXPECT_EQ(sizeof(bcd_uint16_t), 2U);
    EXPECT_EQ(alignof(bcd_uint16_t), 1U);
}

TEST(BcdUint, StoresTheMostSignificantDigitFirst)
{
    EXPECT_EQ(stored(bcd_uint8_t(99)), "99");
    EXPECT_EQ(stored(bcd_uint8_t(7)), "07");
    EXPECT_EQ(stored(bcd_uint8_t(0)), "00");
    EXPECT_EQ(stored(bcd_uint16_t(2024)), "2024");
    EXPECT_EQ(stored(bcd_uint16_t(1)), "0001");
    EXPECT_EQ(stored(bcd_uint16_t(9999)), "9999");
}

TEST(BcdUint, RoundTripsEveryRepresentableNumber)
{
    for (unsigned int value = 0; value <= 99; ++value) {
        ASSERT_EQ(bcd_uint8_t(value).value(), value);
    }
    for (unsigned int value = 0; value <= 9999; ++value) {
        ASSERT_EQ(bcd_uint16_t(value).value(), value);
    }
}

TEST(BcdUint, RefusesANumberWithTooManyDigits)
{
    EXPECT_THAT([] { bcd_uint8_t(100); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
    EXPECT_THAT([] { bcd_uint16_t(10000); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
    EXPECT_THAT([] { bcd_uint16_t(UINT_MAX); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
}

TEST(BcdUint, RefusesANumberThatWouldFitIfItWereTruncated)
{
    // 300 is 44 in 8 bits, 65560 is 24 in 16 bits, 2^32 + 5 is 5 in 32 bits
    EXPECT_THAT([] { bcd_uint8_t(300); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
    EXPECT_THAT([] { bcd_uint16_t(65560); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
    EXPECT_THAT([] { bcd_uint8_t(0x100000005ULL); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
    EXPECT_THAT([] { bcd_uint16_t::bcd(0x100000005ULL); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
}

TEST(BcdUint, RefusesANegativeNumber)
{
    const int negative = -1;
    EXPECT_THAT([=] { bcd_uint8_t(static_cast<unsigned int>(negative)); },
                ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
}

TEST(BcdUint, AssignsAndReadsLikeAPlainInteger)
{
    bcd_uint16_t year = 1999;
    year = 2024;
    const unsigned short read = year;
    EXPECT_EQ(read, 2024);
    EXPECT_EQ(stored(year), "2024");
}

TEST(BcdUint, KeepsTheFieldWhenANumberIsRefused)
{
    bcd_uint8_t field(42);
    EXPECT_THROW(field = 100, std::range_error);
    EXPECT_EQ(field.value(), 42);
}

TEST(BcdUint, EncodesAndDecodesInHostOrder)
{
    EXPECT_EQ(bcd_uint16_t::bcd(2024), 0x2024);
    EXPECT_EQ(bcd_uint8_t::bcd(31), 0x31);
    EXPECT_EQ(bcd_uint16_t::debcd(0x2024), 2024);
    EXPECT_EQ(bcd_uint8_t::debcd(0x31), 31);
    EXPECT_THAT([] { bcd_uint8_t::bcd(100); }, ThrowsMessage<std::range_error>(StrEq(kTooLarge)));
}

TEST(BcdUint, DecodesAHalfByteAbove9AsItsValue)
{
    EXPECT_EQ(bcd_uint8_t::debcd(0xA0), 100);
    EXPECT_EQ(bcd_uint8_t::debcd(0x0A), 10);
    EXPECT_EQ(bcd_uint8_t::debcd(0xFF), 165);
    EXPECT_EQ(bcd_uint16_t::debcd(0x0F00), 1500);
    EXPECT_EQ(bcd_uint16_t::debcd(0xFFFF), 16665);
}

TEST(BcdUint, DecodesReceivedBytesAtAnOddAddress)
{
    const std::unique_ptr<char[]> received = test::heapCopy(test::bytes({0x00, 0x20, 0x24, 0x59}));
    EXPECT_EQ(reinterpret_cast<const bcd_uint16_t*>(received.get() + 1)->value(), 2024);
    EXPECT_EQ(reinterpret_cast<const bcd_uint8_t*>(received.get() + 3)->value(), 59);
}

} // namespace
} // namespace qel
