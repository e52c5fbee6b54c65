#include <qel/common/net/IPv6Address.hpp>
#include <qel/common/net/MACAddress.hpp>

#include <array>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

// Other globals may use these addresses while they are constructed.
constexpr IPv6Address kBuiltByTheCompiler{0x20, 0x01, 0x0D, 0xB8};
static_assert(std::is_trivially_copyable<IPv6Address>::value && sizeof(IPv6Address) == 16, "16 bytes, nothing else");

TEST(IPv6Address, DefaultIsZero)
{
    EXPECT_THAT(IPv6Address().bytes(), Each(0));
    EXPECT_EQ(IPv6Address(), IPv6Address::ZERO);
    EXPECT_EQ(IPv6Address::ZERO.str(), "::");
}

TEST(IPv6Address, ReturnsItsFamily) { EXPECT_EQ(IPv6Address::Family, IPFamily::IPv6); }

TEST(IPv6Address, TakesBytesInNetworkOrder)
{
    const IPv6Address address{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 0xF0};
    EXPECT_THAT(address.bytes(), ElementsAre(1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 0xF0));
    EXPECT_EQ(address.str(), "102:304:506:708:90a:b0c:d0e:ff0");
}

TEST(IPv6Address, MissingTrailingBytesAreZero)
{
    EXPECT_EQ(kBuiltByTheCompiler.str(), "2001:db8::");
    EXPECT_EQ((IPv6Address{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15}).str(),
              "102:304:506:708:90a:b0c:d0e:f00");
    EXPECT_EQ(IPv6Address(std::initializer_list<unsigned char>{}), IPv6Address::ZERO);
}

TEST(IPv6Address, RefusesTooManyBytes)
{
    EXPECT_THAT(([] {
                    IPv6Address({1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16, 17});
                }),
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
}

TEST(IPv6Address, ConvertsToAndFromItsBytes)
{
    const std::array<unsigned char, 16> bytes{{0xFF, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15}};
    const IPv6Address address(bytes);
    EXPECT_EQ((static_cast<std::array<unsigned char, 16>>(address)), bytes);
    EXPECT_EQ(address.bytes(), bytes);
}

TEST(IPv6Address, ParsesTextAndPrintsItsShortestForm)
{
    struct Row {
        const char* text;
        const char* printed;
    };
    const Row rows[] = {
        {"::", "::"},
        {"::1", "::1"},
        {"fe80::1", "fe80::1"},
        {"FE80::ABCD", "fe80::abcd"},
        {"2001:0db8:0000:0000:0000:0000:0000:0001", "2001:db8::1"},
        {"1:2:3:4:5:6:7:8", "1:2:3:4:5:6:7:8"},
        {"1:0:0:4:0:0:0:8", "1:0:0:4::8"},
        {"::ffff:127.0.0.1", "::ffff:127.0.0.1"},
        {"::ffff:7f00:1", "::ffff:127.0.0.1"},
        {"::1.2.3.4", "::1.2.3.4"},
        {"ffff:ffff:ffff:ffff:ffff:ffff:255.255.255.255", "ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(IPv6Address::parse(row.text).str(), row.printed);
    }
    EXPECT_THAT(IPv6Address::parse("fe80::1").bytes(),
                ElementsAre(0xFE, 0x80, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1));
}

TEST(IPv6Address, RefusesOtherText)
{
    for (const char* text :
         {"", " ", ":", ":::", "1", "1:2:3:4:5:6:7", "1:2:3:4:5:6:7:8:9", "1::2::3", "12345::", "g::", " ::1", "::1 ",
          "::1\n", "[::1]", "fe80::1%lo", "fe80::1%1", "127.0.0.1", "::1/64", "::256.0.0.1"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { IPv6Address::parse(text); }, ThrowsMessage<std::invalid_argument>(StrEq(
                                                           std::string("'") + text + "' is not a valid IPv6 address")));
    }
}

TEST(IPv6Address, RefusesTextWithANulByte)
{
    const std::string text("::1\0::", 6);
    EXPECT_THROW(IPv6Address::parse(text), std::invalid_argument);
}

TEST(IPv6Address, OrdersNumerically)
{
    const char* const texts[] = {
        "::", "::1", "::100", "::1:0", "1::", "7fff::", "8000::", "fe80::", "fe80::1", "ffff::"};
    const std::size_t count = sizeof(texts) / sizeof(texts[0]);
    for (std::size_t i = 0; i < count; ++i) {
        for (std::size_t j = 0; j < count; ++j) {
            SCOPED_TRACE(std::string(texts[i]) + " and " + texts[j]);
            const IPv6Address a = IPv6Address::parse(texts[i]);
            const IPv6Address b = IPv6Address::parse(texts[j]);
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

TEST(IPv6Address, MasksBitByBit)
{
    const IPv6Address address = IPv6Address::parse("2001:db8:1234:5678:9abc:def0:1234:5678");
    const IPv6Address mask = IPv6Address::parse("ffff:ffff:ffff:f000::");
    EXPECT_EQ((address & mask).str(), "2001:db8:1234:5000::");
    EXPECT_EQ((address & ~mask).str(), "::678:9abc:def0:1234:5678");
    EXPECT_EQ((address | ~mask).str(), "2001:db8:1234:5fff:ffff:ffff:ffff:ffff");
    EXPECT_EQ((~mask).str(), "::fff:ffff:ffff:ffff:ffff");
    EXPECT_EQ((~IPv6Address::ZERO).str(), "ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff");
    EXPECT_EQ((address & mask) | (address & ~mask), address);
}

TEST(IPv6Address, MaskingInPlaceChangesTheLeftSideAndReturnsIt)
{
    IPv6Address address = IPv6Address::parse("2001:db8::ff");
    EXPECT_EQ(&(address &= IPv6Address::parse("ffff:ffff::f0")), &address);
    EXPECT_EQ(address.str(), "2001:db8::f0");
    EXPECT_EQ(&(address |= IPv6Address::parse("::1")), &address);
    EXPECT_EQ(address.str(), "2001:db8::f1");
}

TEST(IPv6Address, MaskingDoesNotChangeItsOperands)
{
    const IPv6Address a = IPv6Address::parse("2001::1");
    const IPv6Address b = IPv6Address::parse("::f");
    EXPECT_EQ((a & b).str(), "::1");
    EXPECT_EQ((a | b).str(), "2001::f");
    EXPECT_EQ(a.str(), "2001::1");
    EXPECT_EQ(b.str(), "::f");
}

TEST(IPv6Address, PrefixConstants)
{
    EXPECT_EQ(IPv6Address::LINK_LOCAL_PREFIX.str(), "fe80::");
    EXPECT_THAT(IPv6Address::IPV4_MAPPED_PREFIX.bytes(),
                ElementsAre(0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF, 0, 0, 0, 0));
}

TEST(IPv6Address, LinkLocalAddressOfANetworkCard)
{
    const MACAddress mac{0x00, 0x11, 0x22, 0x33, 0x44, 0x55};
    EXPECT_EQ(IPv6Address::linkLocal(mac).str(), "fe80::211:22ff:fe33:4455");
    EXPECT_EQ(IPv6Address::linkLocal(mac), IPv6Address::eui64(IPv6Address::LINK_LOCAL_PREFIX, mac));
}

TEST(IPv6Address, InterfaceAddressInvertsTheUniversalBit)
{
    const MACAddress mac{0xFF, 0xEE, 0xDD, 0xCC, 0xBB, 0xAA};
    const IPv6Address address = IPv6Address::eui64(IPv6Address::ZERO, mac);
    EXPECT_THAT(address.bytes(), ElementsAre(0, 0, 0, 0, 0, 0, 0, 0, 0xFD, 0xEE, 0xDD, 0xFF, 0xFE, 0xCC, 0xBB, 0xAA));
}

TEST(IPv6Address, InterfaceAddressUsesOnlyTheFirstHalfOfThePrefix)
{
    const IPv6Address prefix = IPv6Address::parse("2001:db8:1:2:aaaa:bbbb:cccc:dddd");
    const MACAddress mac{0x02, 0, 0, 0, 0, 0x01};
    EXPECT_EQ(IPv6Address::eui64(prefix, mac).str(), "2001:db8:1:2:0:ff:fe00:1");
}

TEST(IPv6Address, LinkLocalDependsOnTheFirstTenBits)
{
    for (const char* text : {"fe80::", "fe80::1", "fe81::", "febf:ffff::1"}) {
        SCOPED_TRACE(text);
        EXPECT_TRUE(IPv6Address::parse(text).isLinkLocal());
    }
    for (const char* text : {"::", "::1", "fe7f:ffff::", "fec0::", "fe00::", "ff80::", "fd80::", "2001:db8::fe80"}) {
        SCOPED_TRACE(text);
        EXPECT_FALSE(IPv6Address::parse(text).isLinkLocal());
    }
}

TEST(IPv6Address, IPv4MappedDependsOnTheFirstTwelveBytes)
{
    for (const char* text : {"::ffff:0:0", "::ffff:127.0.0.1", "::ffff:255.255.255.255"}) {
        SCOPED_TRACE(text);
        EXPECT_TRUE(IPv6Address::parse(text).isIPv4Mapped());
    }
    for (const char* text : {"::", "::127.0.0.1", "::fffe:127.0.0.1", "::1:ffff:127.0.0.1", "1::ffff:127.0.0.1"}) {
        SCOPED_TRACE(text);
        EXPECT_FALSE(IPv6Address::parse(text).isIPv4Mapped());
    }
}

} // namespace
} // namespace qel
