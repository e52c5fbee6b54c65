#include "base/Failures.hpp"
#include "client/ConnectOptions.hpp"

#include <gmock/gmock.h>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel::test {

namespace {

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

TEST(ConnectOptions, ConnectOptionsAreRead)
{
    const Parsed parsed = parse({"--connect", "[::1]:80", "--plain", "--timeout", "0.25", "--tool-type", "0xFFFFFFFF",
                                 "--tool-id", std::string(32, 'x')});
    EXPECT_EQ(parsed.status, 0);
    EXPECT_EQ(parsed.options.server, "[::1]:80");
    EXPECT_TRUE(parsed.options.transport.plain);
    EXPECT_EQ(parsed.options.timeout(), std::chrono::milliseconds(250));
    EXPECT_EQ(parsed.options.identity.toolType, 0xFFFFFFFFU);
    EXPECT_EQ(parsed.options.identity.toolId, std::string(32, 'x'));
}

TEST(ConnectOptions, TheTimeoutDefaultsToTenSeconds)
{
    EXPECT_EQ(parse({"--connect", "127.0.0.1:80"}).options.timeout(), std::chrono::seconds(10));
}

TEST(ConnectOptions, BadConnectOptionsAreRefused)
{
    const std::vector<std::vector<std::string>> bad{
        {},
        {"--connect"},
        {"--connect", "local host:80"},
        {"--connect", "localhost:0"},
        {"--connect", ":80"},
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

TEST(ConnectConsole, OnlyAPlainConnectionToAnotherMachineIsAMistakeOfTheUser)
{
    tool::ConnectOptions options;
    options.server = "192.0.2.1:80";
    options.transport.plain = true;
    EXPECT_THAT([&] { tool::connectConsole(options); },
                ::testing::ThrowsMessage<tool::CommandFailure>(::testing::HasSubstr("192.0.2.1:80")));
    options.identity.toolId = std::string(33, 'x'); // the parser would have refused it
    EXPECT_THAT([&] { tool::connectConsole(options); }, ::testing::ThrowsMessage<std::invalid_argument>(
                                                            ::testing::StrEq("identity.toolId: longer than 32 bytes")));
}

TEST(ConnectOptions, TheToolTypeMayHaveLeadingZeros)
{
    EXPECT_EQ(parse({"--connect", "127.0.0.1:80", "--tool-type", "010"}).options.identity.toolType, 10U);
}

} // namespace

} // namespace qel::test
