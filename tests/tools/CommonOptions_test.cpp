#include "CommonOptions.hpp"

#include <gtest/gtest.h>
#include <string>
#include <unistd.h>
#include <vector>

namespace qel::test {

namespace {

bool isLoopback(const std::string& endpoint) { return tool::isLoopback(IPEndpoint(endpoint).getAddress()); }

TEST(CommonOptions, LoopbackAddressesAreKnown)
{
    for (const char* endpoint :
         {"127.0.0.1:1", "127.255.255.255:1", "127.0.0.0:1", "[::1]:1", "[::ffff:127.0.0.1]:1"}) {
        EXPECT_TRUE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(CommonOptions, EverythingElseIsNoLoopbackAddress)
{
    for (const char* endpoint : {"126.255.255.255:1", "128.0.0.1:1", "0.0.0.0:1", "10.0.0.1:1", "[::]:1", "[::2]:1",
                                 "[fe80::1]:1", "[1::1]:1", "[::ffff:10.0.0.1]:1", "[::7f00:1]:1"}) {
        EXPECT_FALSE(isLoopback(endpoint)) << endpoint;
    }
}

TEST(CommonOptions, TheIdentityHasADefaultOfItsOwn)
{
    tool::IdentityOptions options;
    EXPECT_EQ(tool::completeIdentity(options).toolId, "qel-" + std::to_string(::getpid()));
    options.toolId = "mine";
    options.toolType = 9;
    EXPECT_EQ(tool::completeIdentity(options).toolId, "mine");
    EXPECT_EQ(tool::completeIdentity(options).toolType, 9U);
}

struct Parsed {
    tool::ConnectOptions options;
    int status = 0;
};

Parsed parse(std::vector<std::string> arguments)
{
    Parsed parsed;
    CLI::App app;
    tool::addConnectOptions(app, parsed.options);
    try {
        app.parse(std::vector<std::string>(arguments.rbegin(), arguments.rend())); // the parser wants them reversed
    } catch (const CLI::ParseError& error) {
        parsed.status = error.get_exit_code();
    }
    return parsed;
}

TEST(CommonOptions, ConnectOptionsAreRead)
{
    const Parsed parsed = parse({"--connect", "[::1]:80", "--plain", "--timeout", "0.25", "--tool-type", "0xFFFFFFFF",
                                 "--tool-id", std::string(32, 'x')});
    EXPECT_EQ(parsed.status, 0);
    EXPECT_EQ(parsed.options.endpoint, "[::1]:80");
    EXPECT_TRUE(parsed.options.transport.plain);
    EXPECT_EQ(parsed.options.timeout(), std::chrono::milliseconds(250));
    EXPECT_EQ(parsed.options.identity.toolType, 0xFFFFFFFFU);
    EXPECT_EQ(parsed.options.identity.toolId, std::string(32, 'x'));
}

TEST(CommonOptions, WithoutATimeoutItIsTenSeconds)
{
    EXPECT_EQ(parse({"--connect", "127.0.0.1:80"}).options.timeout(), std::chrono::seconds(10));
}

TEST(CommonOptions, BadConnectOptionsAreRefused)
{
    const std::vector<std::vector<std::string>> bad{
        {},
        {"--connect"},
        {"--connect", "localhost:80"},
        {"--connect", "127.0.0.1"},
        {"--connect", "127.0.0.1:65536"},
        {"--connect", "::1:80"},
        {"--connect", "127.0.0.1:80", "--timeout", "0"},
        {"--connect", "127.0.0.1:80", "--timeout", "-1"},
        {"--connect", "127.0.0.1:80", "--timeout", "86401"},
        {"--connect", "127.0.0.1:80", "--timeout", "soon"},
        {"--connect", "127.0.0.1:80", "--timeout", "nan"},
        {"--connect", "127.0.0.1:80", "--timeout", "-NAN"},
        {"--connect", "127.0.0.1:80", "--timeout", "inf"},
        {"--connect", "127.0.0.1:80", "--tool-type", "4294967296"},
        {"--connect", "127.0.0.1:80", "--tool-type", "-1"},
        {"--connect", "127.0.0.1:80", "--tool-id", std::string(33, 'x')},
        {"--connect", "127.0.0.1:80", "--nonsense"},
    };
    for (const auto& arguments : bad)
        EXPECT_NE(parse(arguments).status, 0) << CLI::detail::join(arguments, " ");
}

TEST(CommonOptions, EndpointsAreAccepted)
{
    const CLI::Validator endpoint = tool::endpointValidator();
    for (const char* text : {"127.0.0.1:0", "127.0.0.1:65535", "10.0.0.1:080", "[::1]:4711", "[fe80::1]:1"})
        EXPECT_EQ(endpoint(text), "") << text;
}

TEST(CommonOptions, WhatIsNoEndpointIsToldWhy)
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

TEST(CommonOptions, CapabilitiesAreUpTo32ZerosAndOnes)
{
    const CLI::Validator capabilities = tool::capabilityValidator();
    for (const std::string& text : {std::string(), std::string("0"), std::string("101"), std::string(32, '1')})
        EXPECT_EQ(capabilities(text), "") << text;
    EXPECT_EQ(capabilities(std::string(33, '1')), "more than 32 capability bits");
    EXPECT_EQ(capabilities("012"), "capability bits are written as 0 and 1");
}

TEST(CommonOptions, ANumberIsBetweenItsLimits)
{
    const CLI::Validator between = tool::numberBetween(0.5, 2);
    for (const char* text : {"0.5", "1", "2", "2.0", "1e0"})
        EXPECT_EQ(between(text), "") << text;
    for (const char* text : {"0.4999", "2.0001", "-1", "inf", "-inf", "", "x", "1x"})
        EXPECT_NE(between(text), "") << text;
}

TEST(CommonOptions, WhatIsNoNumberIsNotBetweenAnyLimits)
{
    const CLI::Validator between = tool::numberBetween(0.5, 2);
    EXPECT_EQ(between("nan"), "'nan' is no number");
    EXPECT_EQ(between("-NaN"), "'-NaN' is no number");
}

struct NumberText {
    const char* text;
    const char* taken; ///< what the parser then gets; null when it is refused
};

TEST(CommonOptions, AWholeNumberIsDecimalWhateverZerosStandInFront)
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

TEST(CommonOptions, TheToolTypeMayHaveZerosInFront)
{
    EXPECT_EQ(parse({"--connect", "127.0.0.1:80", "--tool-type", "010"}).options.identity.toolType, 10U);
}

} // namespace

} // namespace qel::test
