#include <qel/common/net/IPFamily.hpp>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <sstream>
#include <stdexcept>
#include <string>
#include <sys/socket.h>

namespace qel {
namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr IPFamily kNoFamily = static_cast<IPFamily>(5);

IPFamily readFamily(const std::string& text)
{
    std::istringstream is(text);
    IPFamily family = kNoFamily;
    is >> family;
    return family;
}

std::string print(IPFamily family)
{
    std::ostringstream os;
    os << family;
    return os.str();
}

TEST(IPFamily, ValuesAreProtocolVersions)
{
    EXPECT_EQ(static_cast<int>(IPFamily::IPv4), 4);
    EXPECT_EQ(static_cast<int>(IPFamily::IPv6), 6);
}

TEST(IPFamily, ConvertsToTheFamilyOfTheSystem)
{
    EXPECT_EQ(IPFamilyUtils::toUNIXAddressFamily(IPFamily::IPv4), AF_INET);
    EXPECT_EQ(IPFamilyUtils::toUNIXAddressFamily(IPFamily::IPv6), AF_INET6);
}

TEST(IPFamily, RefusesToConvertOtherValues)
{
    for (const int value : {-1, 0, 3, 5, 7, AF_INET, AF_INET6}) {
        SCOPED_TRACE(value);
        EXPECT_THAT([&] { IPFamilyUtils::toUNIXAddressFamily(static_cast<IPFamily>(value)); },
                    ThrowsMessage<std::invalid_argument>(StrEq("Not an IP address family")));
    }
}

TEST(IPFamily, ReadsAnyCase)
{
    for (const char* text : {"ipv4", "IPV4", "IPv4", "iPv4", "  ipv4"}) {
        SCOPED_TRACE(text);
        EXPECT_EQ(readFamily(text), IPFamily::IPv4);
    }
    for (const char* text : {"ipv6", "IPV6", "IPv6", "\tIpV6"}) {
        SCOPED_TRACE(text);
        EXPECT_EQ(readFamily(text), IPFamily::IPv6);
    }
}

TEST(IPFamily, ReadsOneWord)
{
    std::istringstream is("ipv6 ipv4 rest");
    IPFamily first = kNoFamily;
    IPFamily second = kNoFamily;
    std::string rest;
    is >> first >> second >> rest;
    EXPECT_EQ(first, IPFamily::IPv6);
    EXPECT_EQ(second, IPFamily::IPv4);
    EXPECT_EQ(rest, "rest");
}

TEST(IPFamily, RefusesOtherWords)
{
    for (const char* text : {"", "   ", "ipv5", "ip4", "4", "6", "ipv", "ipv4x", "ipv44", "inet", "ipv4,"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { readFamily(text); }, ThrowsMessage<std::invalid_argument>(StrEq("Invalid IPFamily")));
    }
}

TEST(IPFamily, ARefusedWordLeavesTheValueUnchanged)
{
    std::istringstream is("ipv5");
    IPFamily family = IPFamily::IPv6;
    EXPECT_THROW(is >> family, std::invalid_argument);
    EXPECT_EQ(family, IPFamily::IPv6);
}

TEST(IPFamily, PrintsItsNameAndReadsItBack)
{
    EXPECT_EQ(print(IPFamily::IPv4), "IPv4");
    EXPECT_EQ(print(IPFamily::IPv6), "IPv6");
    EXPECT_EQ(readFamily(print(IPFamily::IPv4)), IPFamily::IPv4);
    EXPECT_EQ(readFamily(print(IPFamily::IPv6)), IPFamily::IPv6);
}

TEST(IPFamily, PrintsOtherValuesInDecimalEvenOnAHexadecimalStream)
{
    std::ostringstream os;
    os << std::hex << static_cast<IPFamily>(10);
    EXPECT_EQ(os.str(), "10");
}

} // namespace
} // namespace qel
