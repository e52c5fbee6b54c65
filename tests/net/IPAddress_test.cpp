#include <qel/common/net/IPAddress.hpp>

#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel {
namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;

const IPv4Address kIPv4{10, 1, 2, 3};
const IPv6Address kIPv6{0xFE, 0x80, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1};

TEST(IPAddress, DefaultIsTheZeroAddressOfIPv4)
{
    const IPAddress address;
    EXPECT_EQ(address.getFamily(), IPFamily::IPv4);
    EXPECT_EQ(address.str(), "0.0.0.0");
    EXPECT_EQ(address, IPAddress(IPv4Address::ZERO));
}

TEST(IPAddress, HoldsAnIPv4Address)
{
    const IPAddress address = kIPv4;
    EXPECT_EQ(address.getFamily(), IPFamily::IPv4);
    EXPECT_EQ(address.getIPv4(), kIPv4);
    EXPECT_EQ(address.size(), 4U);
    EXPECT_EQ(test::hex(address.bytes(), address.size()), "0A010203");
    EXPECT_EQ(address.str(), "10.1.2.3");
}

TEST(IPAddress, HoldsAnIPv6Address)
{
    const IPAddress address = kIPv6;
    EXPECT_EQ(address.getFamily(), IPFamily::IPv6);
    EXPECT_EQ(address.getIPv6(), kIPv6);
    EXPECT_EQ(address.size(), 16U);
    EXPECT_EQ(test::hex(address.bytes(), address.size()), "FE800000000000000000000000000001");
    EXPECT_EQ(address.str(), "fe80::1");
}

TEST(IPAddress, AssignmentChangesTheFamily)
{
    IPAddress address;
    address = kIPv6;
    EXPECT_EQ(address.getFamily(), IPFamily::IPv6);
    EXPECT_EQ(address.getIPv6(), kIPv6);
    address = kIPv4;
    EXPECT_EQ(address.getFamily(), IPFamily::IPv4);
    EXPECT_EQ(address.getIPv4(), kIPv4);
    const IPAddress copy = address;
    EXPECT_EQ(copy, address);
}

TEST(IPAddress, RefusesToReturnTheOtherFamily)
{
    EXPECT_THAT([] { IPAddress(kIPv4).getIPv6(); }, ThrowsMessage<std::invalid_argument>(StrEq("family")));
    EXPECT_THAT([] { IPAddress(kIPv6).getIPv4(); }, ThrowsMessage<std::invalid_argument>(StrEq("family")));
}

TEST(IPAddress, TakesTheBytesOfAFamily)
{
    const auto four = test::heapCopy(test::bytes({10, 1, 2, 3}));
    EXPECT_EQ(IPAddress(IPFamily::IPv4, four.get(), 4), IPAddress(kIPv4));
    const auto sixteen = test::heapCopy(kIPv6.bytes().data(), 16);
    EXPECT_EQ(IPAddress(IPFamily::IPv6, sixteen.get(), 16), IPAddress(kIPv6));
}

TEST(IPAddress, FurtherBytesAreIgnored)
{
    const std::vector<char> memory(17, 1);
    EXPECT_EQ(IPAddress(IPFamily::IPv4, memory.data(), 5).str(), "1.1.1.1");
    EXPECT_EQ(IPAddress(IPFamily::IPv6, memory.data(), 17).str(), "101:101:101:101:101:101:101:101");
}

TEST(IPAddress, TooFewBytesAreRefusedAndNotRead)
{
    const auto three = test::heapCopy(std::vector<char>(3, 1));
    EXPECT_THAT([&] { IPAddress(IPFamily::IPv4, three.get(), 3); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT([&] { IPAddress(IPFamily::IPv4, three.get(), 0); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
    const auto fifteen = test::heapCopy(std::vector<char>(15, 1));
    EXPECT_THAT([&] { IPAddress(IPFamily::IPv6, fifteen.get(), 15); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT([&] { IPAddress(IPFamily::IPv6, fifteen.get(), 4); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
}

TEST(IPAddress, OtherFamiliesAreRefusedBeforeTheLengthIsChecked)
{
    for (const int family : {-1, 0, 2, 5, 7, 10}) {
        SCOPED_TRACE(family);
        EXPECT_THAT([&] { IPAddress(static_cast<IPFamily>(family), nullptr, 0); },
                    ThrowsMessage<std::invalid_argument>(StrEq("family")));
    }
}

TEST(IPAddress, ANullPointerIsRefused)
{
    EXPECT_THAT([] { IPAddress(IPFamily::IPv4, nullptr, 4); }, ThrowsMessage<std::invalid_argument>(StrEq("bytes")));
    EXPECT_THAT([] { IPAddress(IPFamily::IPv6, nullptr, 16); }, ThrowsMessage<std::invalid_argument>(StrEq("bytes")));
}

TEST(IPAddress, OrdersByFamilyThenByAddress)
{
    const IPAddress addresses[] = {
        IPv4Address::ZERO, kIPv4, IPv4Address{255, 255, 255, 255}, IPv6Address::ZERO, IPv6Address{1, 0},
        IPv6Address{1, 1}, kIPv6};
    const std::size_t count = sizeof(addresses) / sizeof(addresses[0]);
    for (std::size_t i = 0; i < count; ++i) {
        for (std::size_t j = 0; j < count; ++j) {
            const IPAddress& a = addresses[i];
            const IPAddress& b = addresses[j];
            SCOPED_TRACE(a.str() + " and " + b.str());
            EXPECT_EQ(a.compare(b), i < j ? -1 : (i > j ? 1 : 0));
            EXPECT_EQ(a == b, i == j);
            EXPECT_EQ(a != b, i != j);
            EXPECT_EQ(a < b, i < j);
            EXPECT_EQ(a > b, i > j);
            EXPECT_EQ(a <= b, i <= j);
            EXPECT_EQ(a >= b, i >= j);
        }
    }
}

TEST(IPAddress, ComparesWithAddressesOfAFixedFamily)
{
    EXPECT_TRUE(IPAddress(kIPv4) == kIPv4);
    EXPECT_TRUE(IPAddress(kIPv6) != kIPv4);
    EXPECT_TRUE(IPAddress(kIPv4) < kIPv6);
}

TEST(IPAddress, PrintsItsText)
{
    std::ostringstream os;
    os << std::hex << IPAddress(kIPv4) << ' ' << IPAddress(kIPv6);
    EXPECT_EQ(os.str(), "10.1.2.3 fe80::1");
}

} // namespace
} // namespace qel
