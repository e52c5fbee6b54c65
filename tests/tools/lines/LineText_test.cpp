#include "lines/LineText.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>

namespace qel::test {

namespace {

using protocol::SerialLine;
using protocol::SerialSettings;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::makeLine;

/// Takes the place of telnet lines where a test looks at the settings.
std::optional<SerialSettings> sSettings;

std::unique_ptr<SerialLine> recordSettings(std::unique_ptr<SerialLine> connection,
                                           std::optional<SerialSettings> settings)
{
    sSettings = settings;
    return connection;
}

std::unique_ptr<SerialLine> noTelnet(std::unique_ptr<SerialLine>, std::optional<SerialSettings>) { return nullptr; }

void expectRefused(const std::string& text, const std::string& reason)
{
    EXPECT_THAT([&] { makeLine(text, {}, recordSettings); },
                ThrowsMessage<std::invalid_argument>(StrEq("line \"" + text + "\": " + reason)));
}

TEST(LineText, MakesEachKindAndOnlyCommandsEndTheirSession)
{
    const struct {
        const char* text;
        bool keepsSession;
    } rows[] = {
        {"cat", false},
        {"pty:cat", false},
        {"pty:unix:/run/vm1.sock", false},
        {"unix:/run/vm1.sock", true},
        {"tcp:terminals.example:4001", true},
        {"tcp:[::1]:4001", true},
        {"telnet:192.0.2.7:4001", true},
        {"telnet:[::1]:4001,9600e7,rtscts", true},
        {"tty:/dev/ttyS0", true},
        {"tty:/dev/ttyS0,115200n8", true},
        {"tty:/dev/ttyS0,115200n8,rtscts", true},
        {"socat - UNIX:/run/vm1.sock", false},
        {"unixx:/run/vm1.sock", false},
        {"TCP:host:1", false},
        {": unix:/run/vm1.sock", false},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.text);
        const auto made = makeLine(row.text, {}, recordSettings);
        EXPECT_NE(made.line, nullptr);
        EXPECT_EQ(made.options.keepsSession, row.keepsSession);
        EXPECT_EQ(made.line->descriptor(), -1) << "nothing is opened yet";
    }
}

TEST(LineText, TelnetLinesGetTheirSettings)
{
    makeLine("telnet:192.0.2.7:4001,9600e7,rtscts", {}, recordSettings);
    ASSERT_TRUE(sSettings);
    EXPECT_EQ(sSettings->str(), "9600e7,rtscts");
    makeLine("telnet:192.0.2.7:4001", {}, recordSettings);
    EXPECT_FALSE(sSettings);
}

TEST(LineText, WhatIsMissingIsNamed)
{
    expectRefused("", "it takes a command");
    expectRefused("pty:", "it takes a command");
    expectRefused("unix:", "it takes a path, as in unix:/run/vm1.sock");
    expectRefused("tcp:", "it takes HOST:PORT, as in tcp:terminals.example:4001");
    expectRefused("telnet:", "it takes HOST:PORT, as in telnet:terminals.example:4001");
    expectRefused("telnet:,9600", "it takes HOST:PORT, as in telnet:terminals.example:4001");
    expectRefused("tty:", "it takes a device, as in tty:/dev/ttyS0,115200n8");
    expectRefused("tty:,9600", "it takes a device, as in tty:/dev/ttyS0,115200n8");
}

TEST(LineText, WhatIsWrongIsNamed)
{
    expectRefused("tcp:host", "\"host\" has no port from 1 to 65535 after its last colon");
    expectRefused("tcp:host:65536", "\"host:65536\" has no port from 1 to 65535 after its last colon");
    expectRefused("telnet:host", "\"host\" has no port from 1 to 65535 after its last colon");
    expectRefused("tcp:a b:1", "\"a b:1\" does not begin with a host name or an IP address");
    expectRefused("tty:/dev/ttyS0,9601", "\"9601\" has a speed that serial ports do not have");
    expectRefused("telnet:host:1,fast", "\"fast\" is not a speed and a format such as 115200n8, with \",rtscts\" for "
                                        "hardware flow control");
}

TEST(LineText, BothSidesOfTheLimits)
{
    EXPECT_NO_THROW(makeLine("tcp:host:1"));
    EXPECT_NO_THROW(makeLine("tcp:host:65535"));
    EXPECT_NO_THROW(makeLine("unix:" + std::string(107, 'p')));
    expectRefused("unix:" + std::string(108, 'p'), "it is longer than 107 bytes");
}

TEST(LineText, ABuildWithoutTelnetSaysSo)
{
    EXPECT_THAT([] { makeLine("telnet:host:1", {}, noTelnet); },
                ThrowsMessage<std::invalid_argument>(
                    StrEq("line \"telnet:host:1\": this build has no telnet lines (libtelnet was not found)")));
}

} // namespace

} // namespace qel::test
