#include <qel/common/net/IPv4Address.hpp>

#include <array>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using ::testing::ElementsAre;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

// Other globals may use these addresses while they are constructed.
constexpr IPv4Address kBuiltByTheCompiler{10, 1, 2, 3};
static_assert(std::is_trivially_copyable<IPv4Address>::value && sizeof(IPv4Address) == 4, "four bytes, nothing else");
static_assert(!std::is_convertible<std::uint32_t, IPv4Address>::value, "a number is an address only when asked");

TEST(IPv4Address, DefaultIsZero)
{
    EXPECT_THAT(IPv4Address().bytes(), ElementsAre(0, 0, 0, 0));
    EXPECT_EQ(IPv4Address(), IPv4Address::ZERO);
    EXPECT_EQ(IPv4Address::ZERO.str(), "0.0.0.0");
}

TEST(IPv4Address, ReturnsItsFamily) { EXPECT_EQ(IPv4Address::Family, IPFamily::IPv4); }

TEST(IPv4Address, TakesBytesInNetworkOrder)
{
    EXPECT_THAT((IPv4Address{10, 20, 30, 255}).bytes(), ElementsAre(10, 20, 30, 255));
    EXPECT_EQ((IPv4Address{10, 20, 30, 255}).str(), "10.20.30.255");
    EXPECT_EQ(kBuiltByTheCompiler.str(), "10.1.2.3");
}

TEST(IPv4Address, MissingTrailingBytesAreZero)
{
    EXPECT_EQ((IPv4Address{1}).str(), "1.0.0.0");
    EXPECT_EQ((IPv4Address{1, 2}).str(), "1.2.0.0");
    EXPECT_EQ((IPv4Address{1, 2, 3}).str(), "1.2.3.0");
    EXPECT_EQ(IPv4Address(std::initializer_list<unsigned char>{}), IPv4Address::ZERO);
}

TEST(IPv4Address, RefusesTooManyBytes)
{
    EXPECT_THAT([] { IPv4Address({1, 2, 3, 4, 5}); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
}

TEST(IPv4Address, ConvertsToAndFromAnIntegerInHostByteOrder)
{
    EXPECT_EQ(IPv4Address(0x7F000001U).str(), "127.0.0.1");
    EXPECT_EQ(IPv4Address(1U).str(), "0.0.0.1");
    EXPECT_EQ((IPv4Address{127, 0, 0, 1}).toUint32(), 0x7F000001U);
    EXPECT_EQ((IPv4Address{0xFE, 0xDC, 0xBA, 0x98}).toUint32(), 0xFEDCBA98U);
    EXPECT_EQ(IPv4Address(0xFEDCBA98U), (IPv4Address{0xFE, 0xDC, 0xBA, 0x98}));
}

TEST(IPv4Address, ConvertsToAndFromItsBytes)
{
    const std::array<unsigned char, 4> bytes{{9, 8, 7, 6}};
    const IPv4Address address(bytes);
    EXPECT_EQ(address.str(), "9.8.7.6");
    EXPECT_EQ((static_cast<std::array<unsigned char, 4>>(address)), bytes);
    EXPECT_EQ(address.bytes(), bytes);
}

TEST(IPv4Address, ParsesTheDottedForm)
{
    for (const char* text : {"0.0.0.0", "1.2.3.4", "127.0.0.1", "255.255.255.255", "192.168.0.10"}) {
        SCOPED_TRACE(text);
        EXPECT_EQ(IPv4Address::parse(text).str(), text);
    }
    EXPECT_THAT(IPv4Address::parse("192.168.0.10").bytes(), ElementsAre(192, 168, 0, 10));
}

TEST(IPv4Address, RefusesOtherText)
{
    const char* const texts[] = {"",         " ",         "1",         "127.1",     "1.2.3",    "1.2.3.4.5",
                                 "1.2.3.",   ".1.2.3",    "256.1.1.1", "1.1.1.-1",  "01.2.3.4", "1.2.3.04",
                                 " 1.2.3.4", "1.2.3.4 ",  "1.2.3.4\n", "0x1.2.3.4", "a.b.c.d",  "localhost",
                                 "::1",      "[1.2.3.4]", "1.2.3.4:5", "1..2.3",    "1,2,3,4",  "300.1.1.1"};
    for (const char* text : texts) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { IPv4Address::parse(text); }, ThrowsMessage<std::invalid_argument>(StrEq(
                                                           std::string("'") + text + "' is not a valid IPv4 address")));
    }
}

TEST(IPv4Address, RefusesTextWithANulByte)
{
    const std::string text("1.2.3.4\0.evil", 13);
    EXPECT_THROW(IPv4Address::parse(text), std::invalid_argument);
}

TEST(IPv4Address, OrdersNumerically)
{
    const IPv4Address addresses[] = {IPv4Address::ZERO, {0, 0, 0, 1},   {0, 0, 1, 0},   {9, 255, 255, 255},
                                     {10, 0, 0, 0},     {127, 0, 0, 1}, {128, 0, 0, 0}, {255, 255, 255, 255}};
    const std::size_t count = sizeof(addresses) / sizeof(addresses[0]);
    for (std::size_t i = 0; i < count; ++i) {
        for (std::size_t j = 0; j < count; ++j) {
            const IPv4Address& a = addresses[i];
            const IPv4Address& b = addresses[j];
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

TEST(IPv4Address, ReturnsTheSubnetPrefixOfEveryMask)
{
    for (unsigned prefix = 0; prefix <= 32; ++prefix) {
        SCOPED_TRACE(prefix);
        const std::uint32_t mask = prefix == 0 ? 0 : 0xFFFFFFFFU << (32 - prefix);
        EXPECT_EQ(IPv4Address(mask).subnetPrefix(), prefix);
    }
    EXPECT_EQ(IPv4Address::parse("255.255.255.0").subnetPrefix(), 24U);
    EXPECT_EQ(IPv4Address::parse("0.0.0.0").subnetPrefix(), 0U);
    EXPECT_EQ(IPv4Address::parse("255.255.255.255").subnetPrefix(), 32U);
}

TEST(IPv4Address, RefusesAMaskWithAOneAfterAZero)
{
    for (const char* text : {"255.255.0.255", "0.0.0.1", "127.255.255.255", "255.255.255.253", "255.0.255.0", "1.0.0.0",
                             "10.0.0.1", "254.128.0.0"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { IPv4Address::parse(text).subnetPrefix(); },
                    ThrowsMessage<std::invalid_argument>(StrEq("IP address is not a subnet mask")));
    }
}

} // namespace
} // namespace qel
