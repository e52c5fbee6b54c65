#include <qel/common/net/IPEndpoint.hpp>

#include "support/Bytes.hpp"

#include <arpa/inet.h>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <locale>
#include <netinet/in.h>
#include <sstream>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;

static_assert(!std::is_convertible<std::string, IPEndpoint>::value, "a text is an endpoint only when asked");

TEST(IPEndpoint, DefaultIsPortZeroOfTheZeroAddressOfIPv4)
{
    const IPEndpoint endpoint;
    EXPECT_EQ(endpoint.getFamily(), IPFamily::IPv4);
    EXPECT_EQ(endpoint.getAddress(), IPAddress());
    EXPECT_EQ(endpoint.getPort(), 0);
    EXPECT_EQ(endpoint.str(), "0.0.0.0:0");
}

TEST(IPEndpoint, HoldsAnAddressAndAPort)
{
    const IPEndpoint ipv4(IPv4Address{10, 0, 0, 1}, 80);
    EXPECT_EQ(ipv4.getAddress(), (IPv4Address{10, 0, 0, 1}));
    EXPECT_EQ(ipv4.getFamily(), IPFamily::IPv4);
    EXPECT_EQ(ipv4.getPort(), 80);
    const IPEndpoint ipv6(IPv6Address::parse("fe80::1"), 65535);
    EXPECT_EQ(ipv6.getAddress(), IPv6Address::parse("fe80::1"));
    EXPECT_EQ(ipv6.getFamily(), IPFamily::IPv6);
    EXPECT_EQ(ipv6.getPort(), 65535);
}

struct GoodText {
    const char* text;
    const char* address;
    int port;
    const char* printed;
};

TEST(IPEndpoint, ParsesText)
{
    const GoodText rows[] = {
        {"10.0.0.1:80", "10.0.0.1", 80, "10.0.0.1:80"},
        {"[fe80::1]:80", "fe80::1", 80, "[fe80::1]:80"},
        {"1.2.3.4:65535", "1.2.3.4", 65535, "1.2.3.4:65535"},
        {"1.2.3.4:0", "1.2.3.4", 0, "1.2.3.4:0"},
        {"[::1]:80", "::1", 80, "[::1]:80"},
        {"[::]:0", "::", 0, "[::]:0"},
        {"1.2.3.4:007", "1.2.3.4", 7, "1.2.3.4:7"},
        {"1.2.3.4:000000000000000000000000000000080", "1.2.3.4", 80, "1.2.3.4:80"},
        {"[::ffff:127.0.0.1]:443", "::ffff:127.0.0.1", 443, "[::ffff:127.0.0.1]:443"},
        {"[2001:0DB8::0001]:1", "2001:db8::1", 1, "[2001:db8::1]:1"},
    };
    for (const GoodText& row : rows) {
        SCOPED_TRACE(row.text);
        const IPEndpoint endpoint{std::string(row.text)};
        EXPECT_EQ(endpoint.getAddress().str(), row.address);
        EXPECT_EQ(endpoint.getPort(), row.port);
        EXPECT_EQ(endpoint.str(), row.printed);
        EXPECT_EQ(IPEndpoint(endpoint.str()), endpoint) << "the printed form reads back";
    }
}

struct BadText {
    const char* text;
    const char* message;
};

TEST(IPEndpoint, RefusesOtherText)
{
    const BadText rows[] = {
        {"", "No port delimiter"},
        {"1.2.3.4", "No port delimiter"},
        {"localhost", "No port delimiter"},
        {"1.2.3.4:8o", "Invalid character in port"},
        {"1.2.3.4: 80", "Invalid character in port"},
        {"1.2.3.4:80 ", "Invalid character in port"},
        {"1.2.3.4:+80", "Invalid character in port"},
        {"1.2.3.4:-1", "Invalid character in port"},
        {"1.2.3.4:0x50", "Invalid character in port"},
        {"1.2.3.4:\xB2", "Invalid character in port"},
        {"[::1]", "Invalid character in port"},  // the last colon is inside the brackets
        {"foo:8o", "Invalid character in port"}, // the port is checked before the host
        {"::1:80", "IPv6 address is not contained in brackets"},
        {"::1", "IPv6 address is not contained in brackets"},
        {"fe80::1", "IPv6 address is not contained in brackets"},
        {"1:2:3:4:5:6:7:8:80", "IPv6 address is not contained in brackets"},
        {"300.1.1.1:80", "IPv6 address is not contained in brackets"},
        {"localhost:80", "IPv6 address is not contained in brackets"},
        {":80", "IPv6 address is not contained in brackets"},
        {"[:80", "IPv6 address is not contained in brackets"},
        {"]:80", "IPv6 address is not contained in brackets"},
        {"[::1:80", "IPv6 address is not contained in brackets"},
        {"::1]:80", "IPv6 address is not contained in brackets"},
        {"[::1] :80", "IPv6 address is not contained in brackets"},
        {" 1.2.3.4:80", "IPv6 address is not contained in brackets"},
        {"[]:80", "'' is not a valid IPv6 address"},
        {"[1.2.3.4]:80", "'1.2.3.4' is not a valid IPv6 address"},
        {"[[::1]]:80", "'[::1]' is not a valid IPv6 address"},
        {"[fe80::1%lo]:80", "'fe80::1%lo' is not a valid IPv6 address"},
    };
    for (const BadText& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_THAT([&] { IPEndpoint{std::string(row.text)}; },
                    ThrowsMessage<std::invalid_argument>(StrEq(row.message)));
    }
}

TEST(IPEndpoint, RefusesAnEmptyPort)
{
    EXPECT_THROW(IPEndpoint("1.2.3.4:"), std::invalid_argument);
    EXPECT_THROW(IPEndpoint(":"), std::invalid_argument);
    EXPECT_THROW(IPEndpoint("[::1]:"), std::invalid_argument);
}

TEST(IPEndpoint, RefusesAPortAbove65535)
{
    for (const char* text : {"1.2.3.4:65536", "1.2.3.4:4294967296", "1.2.3.4:4294967376",
                             "1.2.3.4:18446744073709551616", "1.2.3.4:99999999999999999999999999", "foo:70000"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { IPEndpoint{std::string(text)}; },
                    ThrowsMessage<std::out_of_range>(StrEq("Port value is too large")));
    }
}

TEST(IPEndpoint, RefusesTextWithANulByte)
{
    EXPECT_THROW(IPEndpoint(std::string("1.2.3.4\0:80", 11)), std::invalid_argument);
    EXPECT_THROW(IPEndpoint(std::string("1.2.3.4:80\0", 11)), std::invalid_argument);
    EXPECT_THROW(IPEndpoint(std::string("[::1\0]:80", 9)), std::invalid_argument);
}

TEST(IPEndpoint, PrintsInDecimalInAnyStateOfTheStream)
{
    std::ostringstream os;
    os << std::hex << std::showbase << IPEndpoint("1.2.3.4:8080") << ' ' << IPEndpoint("[::1]:8080");
    EXPECT_EQ(os.str(), "1.2.3.4:8080 [::1]:8080");
}

TEST(IPEndpoint, PrintsWithoutTheDigitGroupsOfALocale)
{
    struct Grouping : std::numpunct<char> {
        char do_thousands_sep() const override { return ','; }
        std::string do_grouping() const override { return "\3"; }
    };
    std::ostringstream os;
    os.imbue(std::locale(std::locale::classic(), new Grouping));
    os << 8080 << ' ' << IPEndpoint("1.2.3.4:8080");
    EXPECT_EQ(os.str(), "8,080 1.2.3.4:8080");
}

TEST(IPEndpoint, ReturnsAnIPv4SocketAddress)
{
    const sockaddr_storage address = IPEndpoint("10.1.2.3:4660").getSockaddr();
    sockaddr_in expected{};
    expected.sin_family = AF_INET;
    expected.sin_port = htons(4660);
    ASSERT_EQ(inet_pton(AF_INET, "10.1.2.3", &expected.sin_addr), 1);
    sockaddr_storage whole{};
    std::memcpy(&whole, &expected, sizeof(expected));
    EXPECT_EQ(test::hex(&address, sizeof(address)), test::hex(&whole, sizeof(whole)));
    // The port is sent with its high byte first.
    EXPECT_EQ(test::hex(reinterpret_cast<const char*>(&address) + 2, 6), "12340A010203");
}

TEST(IPEndpoint, ReturnsAnIPv6SocketAddressWithoutFlowAndScope)
{
    const sockaddr_storage address = IPEndpoint("[fe80::1]:4660").getSockaddr();
    sockaddr_in6 expected{};
    expected.sin6_family = AF_INET6;
    expected.sin6_port = htons(4660);
    ASSERT_EQ(inet_pton(AF_INET6, "fe80::1", &expected.sin6_addr), 1);
    sockaddr_storage whole{};
    std::memcpy(&whole, &expected, sizeof(expected));
    EXPECT_EQ(test::hex(&address, sizeof(address)), test::hex(&whole, sizeof(whole)));
}

TEST(IPEndpoint, IsRestoredFromItsSocketAddress)
{
    for (const char* text : {"0.0.0.0:0", "10.1.2.3:4660", "255.255.255.255:65535", "[::]:0", "[fe80::1]:4660",
                             "[::ffff:127.0.0.1]:255", "[ffff::ffff]:65535"}) {
        SCOPED_TRACE(text);
        const IPEndpoint endpoint{std::string(text)};
        EXPECT_EQ(IPEndpoint(endpoint.getSockaddr()), endpoint);
    }
}

TEST(IPEndpoint, DropsFlowAndScopeOfASocketAddress)
{
    sockaddr_in6 ipv6{};
    ipv6.sin6_family = AF_INET6;
    ipv6.sin6_port = htons(80);
    ipv6.sin6_addr = in6addr_loopback;
    ipv6.sin6_flowinfo = htonl(5);
    ipv6.sin6_scope_id = 3;
    sockaddr_storage address{};
    std::memcpy(&address, &ipv6, sizeof(ipv6));
    EXPECT_EQ(IPEndpoint(address), IPEndpoint("[::1]:80"));
}

TEST(IPEndpoint, RefusesSocketAddressesOfOtherFamilies)
{
    for (const int family : {AF_UNSPEC, AF_UNIX, AF_NETLINK, AF_PACKET}) {
        SCOPED_TRACE(family);
        sockaddr_storage address{};
        address.ss_family = static_cast<sa_family_t>(family);
        EXPECT_THAT([&] { IPEndpoint{address}; },
                    ThrowsMessage<std::invalid_argument>(StrEq("Not an IP address family")));
    }
}

TEST(IPEndpoint, OrdersByAddressThenByPort)
{
    const char* const texts[] = {"0.0.0.0:65535", "10.0.0.1:1", "10.0.0.1:2", "10.0.0.1:256",
                                 "10.0.0.2:0",    "[::]:0",     "[::1]:1",    "[::1]:65535"};
    const std::size_t count = sizeof(texts) / sizeof(texts[0]);
    for (std::size_t i = 0; i < count; ++i) {
        for (std::size_t j = 0; j < count; ++j) {
            SCOPED_TRACE(std::string(texts[i]) + " and " + texts[j]);
            const IPEndpoint a{std::string(texts[i])};
            const IPEndpoint b{std::string(texts[j])};
            EXPECT_EQ(a == b, i == j);
            EXPECT_EQ(a != b, i != j);
            EXPECT_EQ(a < b, i < j);
        }
    }
}

} // namespace
} // namespace qel
