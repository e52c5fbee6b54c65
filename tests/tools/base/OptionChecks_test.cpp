#include <qel/common/net/IPEndpoint.hpp>

#include "base/OptionChecks.hpp"

#include <cstdint>
#include <gtest/gtest.h>
#include <optional>
#include <string>
#include <utility>

namespace qel::test {

namespace {

bool isLoopback(const std::string& endpoint) { return tool::isLoopback(IPEndpoint(endpoint).getAddress()); }

TEST(OptionChecks, LoopbackAddressesAreRecognized)
{
    for (const char* endpoint :
         {"127.0.0.1:1", "127.255.255.255:1", "127.0.0.0:1", "[::1]:1", "[::ffff:127.0.0.1]:1"}) {
        EXPECT_TRUE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(OptionChecks, OtherAddressesAreNotLoopback)
{
    for (const char* endpoint : {"126.255.255.255:1", "128.0.0.1:1", "0.0.0.0:1", "10.0.0.1:1", "[::]:1", "[::2]:1",
                                 "[fe80::1]:1", "[1::1]:1", "[::ffff:10.0.0.1]:1", "[::7f00:1]:1"}) {
        EXPECT_FALSE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(OptionChecks, TheDefaultPortIsAddedWhereThereIsNone)
{
    const CLI::Validator addPort = tool::defaultPort();
    const std::pair<const char*, const char*> rows[] = {{"127.0.0.1", "127.0.0.1:4717"},
                                                        {"[::1]", "[::1]:4717"},
                                                        {"host.example", "host.example:4717"},
                                                        {"127.0.0.1:0", "127.0.0.1:0"},
                                                        {"[::1]:1", "[::1]:1"},
                                                        {"host:1", "host:1"},
                                                        {"::1", "::1"},
                                                        {"host:", "host:"},
                                                        {"host:99999", "host:99999"},
                                                        {"", ""},
                                                        {"a b", "a b"}};
    for (const auto& row : rows) {
        std::string text = row.first;
        EXPECT_EQ(addPort(text), "");
        EXPECT_EQ(text, row.second);
    }
}

TEST(OptionChecks, EndpointIsAnAddressAndAPort)
{
    const CLI::Validator endpoint = tool::endpointValidator();
    for (const char* text : {"127.0.0.1:0", "127.0.0.1:65535", "10.0.0.1:080", "[::1]:4711", "[fe80::1]:1"})
        EXPECT_EQ(endpoint(text), "") << text;
}

TEST(OptionChecks, RefusesAMalformedEndpointWithTheReason)
{
    struct Row {
        const char* text;
        const char* reason;
    };
    const CLI::Validator endpoint = tool::endpointValidator();
    for (const Row& row : {
             Row{"", "the port is missing"},
             Row{"127.0.0.1", "the port is missing"},
             Row{"[]", "the port is missing"},
             Row{"[::1]", "the port is missing"},
             Row{":", "the port after the last ':' is missing"},
             Row{"127.0.0.1:", "the port after the last ':' is missing"},
             Row{"[::1]:", "the port after the last ':' is missing"},
             Row{"127.0.0.1:65536", "\"65536\" is not a port in [0, 65535]"},
             Row{"127.0.0.1:99999999999999999999", "\"99999999999999999999\" is not a port in [0, 65535]"},
             Row{"127.0.0.1:http", "\"http\" is not a port in [0, 65535]"},
             Row{"127.0.0.1:+5", "\"+5\" is not a port in [0, 65535]"},
             Row{"::1:80", "write an IPv6 address in brackets"},
             Row{"localhost:80", "\"localhost\" is not an IP address (names are not looked up)"},
             Row{" 127.0.0.1:80", "\" 127.0.0.1\" is not an IP address (names are not looked up)"},
             Row{"[::g]:80", "\"[::g]\" is not an IP address (names are not looked up)"},
             Row{"[127.0.0.1]:80", "\"[127.0.0.1]\" is not an IP address (names are not looked up)"},
             Row{":80", "\"\" is not an IP address (names are not looked up)"},
         }) {
        EXPECT_EQ(endpoint(row.text), std::string("\"") + row.text +
                                          "\" is not an endpoint such as 127.0.0.1:4711 or [::1]:4711: " + row.reason);
    }
}

TEST(OptionChecks, CapabilitiesAreUpTo32ZerosAndOnes)
{
    const CLI::Validator capabilities = tool::capabilityValidator();
    for (const std::string& text : {std::string(), std::string("0"), std::string("101"), std::string(32, '1')})
        EXPECT_EQ(capabilities(text), "") << text;
    EXPECT_EQ(capabilities(std::string(33, '1')), "longer than 32 bits");
    EXPECT_EQ(capabilities("012"), "\"012\" is not a capability set: write each bit as 0 or 1");
}

TEST(OptionChecks, TextIsLimitedInBytes)
{
    const CLI::Validator text = tool::textUpTo(3);
    for (const char* accepted : {"", "abc"})
        EXPECT_EQ(text(accepted), "") << accepted;
    EXPECT_EQ(text("abcd"), "longer than 3 bytes");
}

TEST(OptionChecks, NumberIsWithinItsLimits)
{
    const CLI::Validator number = tool::numberIn(0.5, 2);
    EXPECT_EQ(number.get_description(), "FLOAT in [0.5, 2]");
    for (const char* text : {"0.5", "1", "2", "2.0", "1e0"})
        EXPECT_EQ(number(text), "") << text;
    for (const std::string text : {"0.4999", "2.0001", "-1", "inf", "-inf", "", "x", "1x", "nan", "-NaN"})
        EXPECT_EQ(number(text), "\"" + text + "\" is not a number in [0.5, 2]");
}

TEST(OptionChecks, LimitsOfANumberReadAsAPersonWritesThem)
{
    EXPECT_EQ(tool::numberIn(0.001, 1e6)("0"), "\"0\" is not a number in [0.001, 1000000]");
    EXPECT_EQ(tool::numberIn(0, 604800)("-1"), "\"-1\" is not a number in [0, 604800]");
}

struct IntegerText {
    const char* text;
    std::optional<std::uint64_t> value; ///< none: it is refused
};

const IntegerText kIntegers[] = {
    {"8", 8},
    {"010", 10},
    {"08", 8},
    {"0000000000000000000000000255", 255},
    {"255", 255},
    {"0xFF", 255},
    {"0x0b", 11},
    {"0X10", 16},
    {"7", 7},
    {"256", 256},
    {"007", 7},
    {"0x100", 256},
    {"18446744073709551615", 18446744073709551615U},
    {"18446744073709551616", std::nullopt},
    {"18446744073709551624", std::nullopt}, // 8 and 2^64
    {"0x10000000000000000", std::nullopt},
    {"-8", std::nullopt},
    {"+8", std::nullopt},
    {"8.0", std::nullopt},
    {"8x", std::nullopt},
    {" 8", std::nullopt},
    {"8 ", std::nullopt},
    {"", std::nullopt},
    {"0x", std::nullopt},
    {"0x-9", std::nullopt},
    {"0x0x8", std::nullopt},
    {"x8", std::nullopt},
    {"FF", std::nullopt},
    {"nan", std::nullopt},
    {"1e1", std::nullopt},
};

TEST(OptionChecks, IntegerIsDecimalOrHexadecimalAfter0xWithAnyLeadingZeros)
{
    for (const IntegerText& row : kIntegers)
        EXPECT_EQ(tool::parseInteger(row.text), row.value) << row.text;
}

TEST(OptionChecks, IntegerIsWithinItsLimitsAndLeftInDecimal)
{
    const CLI::Validator integer = tool::integerIn(8, 255);
    EXPECT_EQ(integer.get_description(), "INT in [8, 255]");
    for (const IntegerText& row : kIntegers) {
        SCOPED_TRACE(row.text);
        std::string text = row.text;
        const std::string failure = integer(text);
        if (row.value && *row.value >= 8 && *row.value <= 255) {
            EXPECT_EQ(failure, "");
            EXPECT_EQ(text, std::to_string(*row.value));
        } else {
            EXPECT_EQ(failure, "\"" + std::string(row.text) + "\" is not an integer in [8, 255]");
            EXPECT_EQ(text, row.text);
        }
    }
}

} // namespace

} // namespace qel::test
