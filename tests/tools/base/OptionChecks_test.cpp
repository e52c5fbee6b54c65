#include <qel/common/net/IPEndpoint.hpp>

#include "base/OptionChecks.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

bool isLoopback(const std::string& endpoint) { return tool::isLoopback(IPEndpoint(endpoint).getAddress()); }

TEST(OptionChecks, LoopbackAddressesAreKnown)
{
    for (const char* endpoint :
         {"127.0.0.1:1", "127.255.255.255:1", "127.0.0.0:1", "[::1]:1", "[::ffff:127.0.0.1]:1"}) {
        EXPECT_TRUE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(OptionChecks, EverythingElseIsNoLoopbackAddress)
{
    for (const char* endpoint : {"126.255.255.255:1", "128.0.0.1:1", "0.0.0.0:1", "10.0.0.1:1", "[::]:1", "[::2]:1",
                                 "[fe80::1]:1", "[1::1]:1", "[::ffff:10.0.0.1]:1", "[::7f00:1]:1"}) {
        EXPECT_FALSE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(OptionChecks, EndpointsAreAccepted)
{
    const CLI::Validator endpoint = tool::endpointValidator();
    for (const char* text : {"127.0.0.1:0", "127.0.0.1:65535", "10.0.0.1:080", "[::1]:4711", "[fe80::1]:1"})
        EXPECT_EQ(endpoint(text), "") << text;
}

TEST(OptionChecks, WhatIsNoEndpointIsToldWhy)
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
             Row{":", "the port behind the last ':' is missing"},
             Row{"127.0.0.1:", "the port behind the last ':' is missing"},
             Row{"[::1]:", "the port behind the last ':' is missing"},
             Row{"127.0.0.1:65536", "'65536' is no port from 0 to 65535"},
             Row{"127.0.0.1:99999999999999999999", "'99999999999999999999' is no port from 0 to 65535"},
             Row{"127.0.0.1:http", "'http' is no port from 0 to 65535"},
             Row{"127.0.0.1:+5", "'+5' is no port from 0 to 65535"},
             Row{"::1:80", "an IPv6 address stands in brackets"},
             Row{"localhost:80", "'localhost' is no IP address; names are not looked up"},
             Row{" 127.0.0.1:80", "' 127.0.0.1' is no IP address; names are not looked up"},
             Row{"[::g]:80", "'[::g]' is no IP address; names are not looked up"},
             Row{"[127.0.0.1]:80", "'[127.0.0.1]' is no IP address; names are not looked up"},
             Row{":80", "'' is no IP address; names are not looked up"},
         }) {
        EXPECT_EQ(endpoint(row.text), std::string("'") + row.text +
                                          "' is no endpoint, such as 127.0.0.1:4711 or [::1]:4711: " + row.reason);
    }
}

TEST(OptionChecks, CapabilitiesAreUpTo32ZerosAndOnes)
{
    const CLI::Validator capabilities = tool::capabilityValidator();
    for (const std::string& text : {std::string(), std::string("0"), std::string("101"), std::string(32, '1')})
        EXPECT_EQ(capabilities(text), "") << text;
    EXPECT_EQ(capabilities(std::string(33, '1')), "more than 32 capability bits");
    EXPECT_EQ(capabilities("012"), "capability bits are written as 0 and 1");
}

TEST(OptionChecks, ANumberIsBetweenItsLimits)
{
    const CLI::Validator between = tool::numberBetween(0.5, 2);
    for (const char* text : {"0.5", "1", "2", "2.0", "1e0"})
        EXPECT_EQ(between(text), "") << text;
    for (const char* text : {"0.4999", "2.0001", "-1", "inf", "-inf", "", "x", "1x"})
        EXPECT_NE(between(text), "") << text;
}

TEST(OptionChecks, WhatIsNoNumberIsNotBetweenAnyLimits)
{
    const CLI::Validator between = tool::numberBetween(0.5, 2);
    EXPECT_EQ(between("nan"), "'nan' is no number");
    EXPECT_EQ(between("-NaN"), "'-NaN' is no number");
}

struct NumberText {
    const char* text;
    const char* taken; ///< what the parser then gets; null when it is refused
};

TEST(OptionChecks, AWholeNumberIsDecimalWhateverZerosStandInFront)
{
    const NumberText rows[] = {
        {"8", "8"},        {"010", "10"},    {"08", "8"},      {"0000000000000000000000000255", "255"},
        {"255", "255"},    {"0xFF", "255"},  {"0x0b", "11"},   {"0X10", "16"},
        {"7", nullptr},    {"256", nullptr}, {"007", nullptr}, {"0x100", nullptr},
        {"-8", nullptr},   {"+8", nullptr},  {"8.0", nullptr}, {"8x", nullptr},
        {" 8", nullptr},   {"8 ", nullptr},  {"", nullptr},    {"0x", nullptr},
        {"0x-9", nullptr}, {"nan", nullptr}, {"1e1", nullptr}, {"18446744073709551624", nullptr}, // 8 and 2^64
    };
    const CLI::Validator between = tool::wholeNumberBetween(8, 255);
    for (const NumberText& row : rows) {
        SCOPED_TRACE(row.text);
        std::string text = row.text;
        const std::string failure = between(text);
        if (row.taken == nullptr) {
            EXPECT_EQ(failure, "'" + std::string(row.text) + "' is no whole number from 8 to 255");
            EXPECT_EQ(text, row.text);
        } else {
            EXPECT_EQ(failure, "");
            EXPECT_EQ(text, row.taken);
        }
    }
}

} // namespace

} // namespace qel::test
