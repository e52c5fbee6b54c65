#include <qel/common/net/MACAddress.hpp>

#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel {
namespace {

using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

std::string print(const MACAddress& address)
{
    std::ostringstream os;
    os << address;
    return os.str();
}

TEST(MACAddress, Constants)
{
    EXPECT_EQ(MACAddress::NUM_BYTES, 6U);
    EXPECT_EQ(MACAddress::MASK, 0xFFFFFFFFFFFFU);
}

TEST(MACAddress, DefaultIsZero) { EXPECT_THAT(MACAddress().bytes(), Each(0)); }

TEST(MACAddress, TheFirstByteIsInTheHighestBitsOfTheInteger)
{
    EXPECT_THAT(MACAddress(0x001122334455U).bytes(), ElementsAre(0x00, 0x11, 0x22, 0x33, 0x44, 0x55));
    EXPECT_THAT(MACAddress(0xAABBCCDDEEFFU).bytes(), ElementsAre(0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF));
}

TEST(MACAddress, BitsAboveTheLow48AreIgnored)
{
    EXPECT_EQ(MACAddress(0xFFFF001122334455U), MACAddress(0x001122334455U));
    EXPECT_EQ(MACAddress(0x0001000000000000U), MACAddress());
}

TEST(MACAddress, RequiresExactlySixBytes)
{
    EXPECT_EQ((MACAddress{0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF}), MACAddress(0xAABBCCDDEEFFU));
    EXPECT_THAT(([] { MACAddress({1, 2, 3, 4, 5}); }), ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT(([] { MACAddress({1, 2, 3, 4, 5, 6, 7}); }), ThrowsMessage<std::invalid_argument>(StrEq("length")));
}

TEST(MACAddress, CopiesSixBytesOfMemory)
{
    const std::vector<char> memory = test::bytes({0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0x01});
    const auto exact = test::heapCopy(memory);
    EXPECT_EQ(MACAddress(exact.get(), 6), MACAddress(0xAABBCCDDEE01U));
    EXPECT_THAT([&] { MACAddress(exact.get(), 5); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT([&] { MACAddress(exact.get(), 7); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT([] { MACAddress(nullptr, 6); }, ThrowsMessage<std::invalid_argument>(StrEq("bytes")));
}

TEST(MACAddress, PrintsUpperCasePairsWithColons)
{
    EXPECT_EQ(print(MACAddress{0xAA, 0xBB, 0xCC, 0x00, 0x11, 0x22}), "AA:BB:CC:00:11:22");
    EXPECT_EQ(print(MACAddress{0x00, 0x01, 0x02, 0x0A, 0x0B, 0x0C}), "00:01:02:0A:0B:0C");
    EXPECT_EQ(print(MACAddress()), "00:00:00:00:00:00");
}

TEST(MACAddress, LeavesTheStreamInUpperCaseHexadecimal)
{
    std::ostringstream os;
    os << std::setfill('*') << MACAddress{0x0A, 0, 1, 2, 3, 4} << ' ' << 0xAB;
    EXPECT_EQ(os.str(), "0A:00:01:02:03:04 AB");
    EXPECT_EQ(os.fill(), '0');
}

TEST(MACAddress, OrdersByBytes)
{
    const MACAddress small{0x00, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
    const MACAddress large{0x01, 0x00, 0x00, 0x00, 0x00, 0x00};
    EXPECT_TRUE(small == small);
    EXPECT_FALSE(small == large);
    EXPECT_TRUE(small != large);
    EXPECT_FALSE(small != small);
    EXPECT_TRUE(small < large);
    EXPECT_FALSE(large < small);
    EXPECT_FALSE(small < small);
    EXPECT_TRUE(large > small);
    EXPECT_FALSE(small > small);
    EXPECT_TRUE(small <= small);
    EXPECT_FALSE(large <= small);
    EXPECT_TRUE(large >= large);
    EXPECT_FALSE(small >= large);
}

} // namespace
} // namespace qel
