// What the program says to command lines that it refuses.

#include "integration/TestConsole.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using Arguments = std::vector<std::string>;

struct Refusal {
    Arguments arguments;
    std::string reason;
};

std::string joined(const Arguments& arguments)
{
    std::string text = "qel";
    for (const std::string& argument : arguments)
        text += " " + argument.substr(0, 40);
    return text;
}

/// Usage errors are one line on standard error, and exit status 2.
void expectRefused(const Arguments& common, const std::vector<Refusal>& refusals)
{
    for (const Refusal& refusal : refusals) {
        Arguments arguments = common;
        arguments.insert(arguments.end(), refusal.arguments.begin(), refusal.arguments.end());
        SCOPED_TRACE(joined(arguments));
        const auto result = runQel(arguments);
        EXPECT_EQ(result.exitStatus, 2);
        EXPECT_EQ(result.output, "");
        EXPECT_EQ(result.errors, "qel: " + refusal.reason + "\n");
    }
}

const char* const kNoCredentials = "credentials are missing: give --credentials DIR --name NAME, or --cert, --key and "
                                   "--root, or --plain for a loopback address";

TEST(RefusedCommandLine, NamesUnknownSubcommandsAndOptions)
{
    expectRefused({}, {
                          {{},
                           "a subcommand is missing: serve, call, console, list, status, bench, decode, proxy, check, "
                           "ca; see \"qel --help\""},
                          {{"nonsense"}, "unknown subcommand \"nonsense\"; see \"qel --help\""},
                          {{"--nonsense"}, "unknown option \"--nonsense\"; see \"qel --help\""},
                          {{"cosole", "--connect", "x"}, "unknown subcommand \"cosole\"; did you mean \"console\"?"},
                          {{"--connect", "x", "console"},
                           "write --connect after \"console\": it is an option of that subcommand"},
                      });
}

TEST(RefusedCommandLine, NamesWhatServeLacks)
{
    expectRefused({}, {
                          {{"serve", "extra"}, "unexpected argument \"extra\"; see \"qel serve --help\""},
                          {{"serve"}, kNoCredentials},
                      });
}

TEST(RefusedCommandLine, NamesTheEndpointThatServeCannotListenOn)
{
    const Arguments common{"serve", "--plain"};
    expectRefused(
        common,
        {
            {{"--listen", "localhost:0"},
             "--listen: \"localhost:0\" is not an endpoint such as 127.0.0.1:4711 or [::1]:4711: \"localhost\" is not "
             "an IP address (names are not looked up)"},
            {{"--listen", "10.0.0.1"}, "--plain is refused for 10.0.0.1:4717: it is not a loopback address"},
            {{"--listen", "0.0.0.0:0"}, "--plain is refused for 0.0.0.0:0: it is not a loopback address"},
            {{"--listen", "10.0.0.1:0"}, "--plain is refused for 10.0.0.1:0: it is not a loopback address"},
            {{"--listen", "[::]:0"}, "--plain is refused for [::]:0: it is not a loopback address"},
        });
}

TEST(RefusedCommandLine, NamesTheMalformedPartitionOfServe)
{
    const Arguments common{"serve", "--plain"};
    expectRefused(
        common,
        {
            {{"--partition"}, "--partition needs a value: ID=LINE"},
            {{"--partition", "1"}, "--partition: takes ID=LINE"},
            {{"--partition", "=cat"}, "--partition: \"\" is not an integer in [1, 65535]"},
            {{"--partition", "1="}, "--partition: takes ID=LINE"},
            {{"--partition", "0=cat"}, "--partition: \"0\" is not an integer in [1, 65535]"},
            {{"--partition", "65536=cat"}, "--partition: \"65536\" is not an integer in [1, 65535]"},
            {{"--partition", "99999999999999999999=cat"},
             "--partition: \"99999999999999999999\" is not an integer in [1, 65535]"},
            {{"--partition", "-1=cat"}, "--partition: \"-1\" is not an integer in [1, 65535]"},
            {{"--partition", "one=cat"}, "--partition: \"one\" is not an integer in [1, 65535]"},
            {{"--partition", "0x=cat"}, "--partition: \"0x\" is not an integer in [1, 65535]"},
            {{"--partition", "1=unix:"}, "--partition: line \"unix:\": it takes a path, as in unix:/run/vm1.sock"},
            {{"--partition", "1=tcp:host"},
             "--partition: line \"tcp:host\": \"host\" has no port from 1 to 65535 after its last colon"},
            {{"--partition", "1=tty:/dev/ttyS0,9601"},
             "--partition: line \"tty:/dev/ttyS0,9601\": \"9601\" has a speed that serial ports do not have"},
            {{"--partition", "1=cat", "--partition", "1=cat"}, "--partition: partition 1 is given twice"},
            {{"--partition", "1=cat", "--partition", "01=cat"}, "--partition: partition 1 is given twice"},
            {{"--partition", "10=cat", "--partition", "0xA=cat"}, "--partition: partition 10 is given twice"},
        });
}

TEST(RefusedCommandLine, NamesTheOptionOfServeThatIsOutOfRange)
{
    const Arguments common{"serve", "--plain"};
    expectRefused(
        common,
        {
            {{"--max-consoles", "0"}, "--max-consoles: \"0\" is not an integer in [1, 255]"},
            {{"--max-consoles", "256"}, "--max-consoles: \"256\" is not an integer in [1, 255]"},
            {{"--queue-limit", "0"}, "--queue-limit: \"0\" is not an integer in [1, 1073741824]"},
            {{"--queue-limit", "1073741825"}, "--queue-limit: \"1073741825\" is not an integer in [1, 1073741824]"},
            {{"--queue-limit", "x"}, "--queue-limit: \"x\" is not an integer in [1, 1073741824]"},
            {{"--replay", "16777217"}, "--replay: \"16777217\" is not an integer in [0, 16777216]"},
            {{"--line-log", "/dev/null"}, "--line-log: \"/dev/null\" is not a directory"},
            {{"--line-log-size", "4095"}, "--line-log-size: \"4095\" is not an integer in [4096, 1099511627776]"},
            {{"--when-unattended", "drop"}, "--when-unattended: \"drop\" is not keep or wait"},
            {{"--start", "now"}, "--start: \"now\" is not open or boot"},
            {{"--restart", "yes"}, "--restart: \"yes\" is not never, failure or always"},
            {{"--handshake-timeout", "0"}, "--handshake-timeout: \"0\" is not a number in [0.001, 86400]"},
            {{"--system-type", "01234567890123456"}, "--system-type: longer than 16 bytes"},
            {{"--system-serial", "01234567890123456"}, "--system-serial: longer than 16 bytes"},
            {{"--interface-family", "QQ"}, "--interface-family: takes one character"},
            {{"--interface-version", "1"}, "--interface-version: takes MAJOR.MINOR"},
            {{"--interface-version", "1."}, "--interface-version: \"\" is not an integer in [0, 65535]"},
            {{"--interface-version", "1.65536"}, "--interface-version: \"65536\" is not an integer in [0, 65535]"},
            {{"--interface-version", "1.2.3"}, "--interface-version: \"2.3\" is not an integer in [0, 65535]"},
            {{"--capabilities", "012"}, "--capabilities: \"012\" is not a capability set: write each bit as 0 or 1"},
            {{"--capabilities", std::string(33, '0')}, "--capabilities: longer than 32 bits"},
            {{"--log-level", "loud"}, "--log-level: \"loud\" is not a log level: debug, info, warn, error or critical"},
            {{"--log-dir", "/dev/null"}, "--log-dir: \"/dev/null\" is not a directory"},
            {{"--log-size", "4095"}, "--log-size: \"4095\" is not an integer in [4096, 1099511627776]"},
        });
}

TEST(RefusedCommandLine, NamesWhatCallLacks)
{
    expectRefused({}, {
                          {{"call"}, "--connect is required"},
                          {{"call", "time"}, "--connect is required"},
                          {{"call", "--connect", "127.0.0.1:1", "time"}, kNoCredentials},
                          {{"call", "--connect", "10.0.0.1:1", "--plain", "time"},
                           "--plain is refused for 10.0.0.1:1: it is not a loopback address"},
                          {{"call", "--connect", "[fe80::1]:1", "--plain", "time"},
                           "--plain is refused for [fe80::1]:1: it is not a loopback address"},
                      });
}

TEST(RefusedCommandLine, NamesWhatIsWrongWithACall)
{
    const Arguments common{"call", "--connect", "127.0.0.1:1", "--plain"};
    expectRefused(common, {
                              {{},
                               "a subcommand is missing: version, limits, time, max-sessions, get-mode, get-metadata, "
                               "capabilities, set-mode, set-metadata, broadcast; see \"qel call --help\""},
                              {{"nonsense"}, "unknown subcommand \"nonsense\"; see \"qel call --help\""},
                              {{"time", "extra"}, "unexpected argument \"extra\"; see \"qel call time --help\""},
                              {{"time", "limits"}, "unexpected argument \"limits\"; see \"qel call time --help\""},
                              {{"capabilities", "2"}, "bits: \"2\" is not a capability set: write each bit as 0 or 1"},
                              {{"capabilities", std::string(33, '1')}, "bits: longer than 32 bits"},
                              {{"set-mode"}, "mode is required"},
                              {{"set-mode", "256"}, "mode: \"256\" is not an integer in [0, 255]"},
                              {{"set-mode", "-1"}, "mode: \"-1\" is not an integer in [0, 255]"},
                              {{"set-mode", "1", std::string(16349, 'x')}, "mtms: longer than 16348 bytes"},
                              {{"set-metadata"}, "metadata is required"},
                              {{"set-metadata", std::string(16351, 'x')}, "metadata: longer than 16350 bytes"},
                              {{"--json=maybe", "time"}, "--json does not take \"maybe\""},
                              {{"--timeout", "1", "--timeout", "2", "time"}, "--timeout is given more than once"},
                          });
}

TEST(RefusedCommandLine, NamesWhatIsWrongWithABroadcast)
{
    const Arguments common{"call", "--connect", "127.0.0.1:1", "--plain", "broadcast"};
    expectRefused(common, {
                              {{}, "text is required"},
                              {{std::string(16307, 'x')}, "text: longer than 16306 bytes"},
                              {{"--type", "1", "x"}, "--type 1 needs --to-id"},
                              {{"--type", "256", "x"}, "--type: \"256\" is not an integer in [0, 255]"},
                              {{"--to-id", "x", "x"}, "--to-id requires --type"},
                              {{"--type", "1", "--to-id", std::string(33, 'x'), "x"}, "--to-id: longer than 32 bytes"},
                          });
}

TEST(RefusedCommandLine, NamesWhatConsoleLacks)
{
    expectRefused({},
                  {
                      {{"console", "--connect", "127.0.0.1:1", "1"}, kNoCredentials},
                      {{"console", "--connect", "192.0.2.1:1", "--plain", "1"},
                       "--plain is refused for 192.0.2.1:1: it is not a loopback address"},
                      {{"console", "--plain", "1"}, "--connect is required"},
                      {{"console", "--plain", "--connect", "::1", "1"},
                       "--connect: \"::1\": write an IPv6 address in brackets, such as [::1] or [::1]:4717"},
                      {{"console", "--plain", "--connect", "fe80::1:4717", "1"},
                       "--connect: \"fe80::1:4717\": write an IPv6 address in brackets, such as [::1] or [::1]:4717"},
                  });
}

TEST(RefusedCommandLine, NamesTheArgumentOfConsoleThatIsWrong)
{
    const Arguments common{"console", "--connect", "127.0.0.1:1", "--plain"};
    expectRefused(common,
                  {
                      {{}, "partition is required"},
                      {{"1x"}, "partition: \"1x\" is not an integer in [0, 65535]"},
                      {{"-1"}, "partition: \"-1\" is not an integer in [0, 65535]"},
                      {{"65536"}, "partition: \"65536\" is not an integer in [0, 65535]"},
                      {{"1", "2"}, "unexpected argument \"2\"; see \"qel console --help\""},
                      {{"1", "--connection", "65536"}, "--connection: \"65536\" is not an integer in [0, 65535]"},
                      {{"1", "--log", "x", "--record", "x"}, "--log and --record need a file each"},
                      {{"1", "--log-strip", "x", "--log", "x"}, "--log and --log-strip need a file each"},
                      {{"1", "--linger", "-1"}, "--linger: \"-1\" is not a number in [0, 86400]"},
                      {{"1", "--linger", "86401"}, "--linger: \"86401\" is not a number in [0, 86400]"},
                      {{"1", "--timeout", "0"}, "--timeout: \"0\" is not a number in [0.001, 86400]"},
                      {{"1", "--tool-id", std::string(33, 'x')}, "--tool-id: longer than 32 bytes"},
                  });
}

TEST(RefusedCommandLine, NamesTheEscapeCharacterThatCannotBeOne)
{
    const Arguments common{"console", "--connect", "127.0.0.1:1", "--plain", "1", "--escape"};
    expectRefused(
        common,
        {
            {{""}, "--escape: \"\" is not one printable character, ^ and a character from @ to _, or none"},
            {{"ab"}, "--escape: \"ab\" is not one printable character, ^ and a character from @ to _, or none"},
            {{" "}, "--escape: \" \" is not one printable character, ^ and a character from @ to _, or none"},
            {{"."}, "--escape: \".\" is a command after the escape character"},
            {{"?"}, "--escape: \"?\" is a command after the escape character"},
            {{"^Z"}, "--escape: \"^Z\" is a command after the escape character"},
            {{"^M"}, "--escape: \"^M\" is a command after the escape character"},
            {{"^a"}, "--escape: \"^a\" is not one printable character, ^ and a character from @ to _, or none"},
            {{"^?"}, "--escape: \"^?\" is not one printable character, ^ and a character from @ to _, or none"},
            {{"^`"}, "--escape: \"^`\" is not one printable character, ^ and a character from @ to _, or none"},
            {{"\x7F"}, "--escape: \"\\x7f\" is not one printable character, ^ and a character from @ to _, or none"},
        });
}

TEST(RefusedCommandLine, NamesWhatBenchLacks)
{
    expectRefused({}, {
                          {{"bench"}, "--connect is required"},
                          {{"bench", "--connect", "127.0.0.1:1"}, kNoCredentials},
                          {{"bench", "--connect", "10.0.0.1:1", "--plain"},
                           "--plain is refused for 10.0.0.1:1: it is not a loopback address"},
                      });
}

TEST(RefusedCommandLine, NamesTheOptionOfBenchThatIsOutOfRange)
{
    const Arguments common{"bench", "--connect", "127.0.0.1:1", "--plain"};
    expectRefused(
        common,
        {
            {{"extra"}, "unexpected argument \"extra\"; see \"qel bench --help\""},
            {{"--connections", "0"}, "--connections: \"0\" is not an integer in [2, 254]"},
            {{"--connections", "1"}, "--connections: \"1\" is not an integer in [2, 254]"},
            {{"--connections", "3"}, "--connections: \"3\" is not even: a message needs two consoles"},
            {{"--connections", "0x1B"}, "--connections: \"27\" is not even: a message needs two consoles"},
            {{"--connections", "256"}, "--connections: \"256\" is not an integer in [2, 254]"},
            {{"--size", "0"}, "--size: \"0\" is not an integer in [1, 16306]"},
            {{"--size", "16307"}, "--size: \"16307\" is not an integer in [1, 16306]"},
            {{"--rate", "0"}, "--rate: \"0\" is not a number in [0.001, 1000000]"},
            {{"--rate", "1000001"}, "--rate: \"1000001\" is not a number in [0.001, 1000000]"},
            {{"--rate", "nan"}, "--rate: \"nan\" is not a number in [0.001, 1000000]"},
            {{"--count", "0"}, "--count: \"0\" is not an integer in [1, 1000000000000]"},
            {{"--seconds", "0"}, "--seconds: \"0\" is not a number in [0.001, 604800]"},
            {{"--seconds", "604801"}, "--seconds: \"604801\" is not a number in [0.001, 604800]"},
            {{"--seconds", "nan"}, "--seconds: \"nan\" is not a number in [0.001, 604800]"},
            {{"--seconds", "1", "--count", "1"}, "--count and --seconds exclude each other"},
            {{"--tool-id", std::string(29, 'x')}, "--tool-id: longer than 28 bytes: each connection adds its number"},
        });
}

TEST(RefusedCommandLine, NamesWhatIsWrongWithDecode)
{
    const Arguments common{"decode"};
    expectRefused(common, {
                              {{"--raw", "--hex"}, "--raw and --hex exclude each other"},
                              {{"/nowhere/at/all"}, "file: \"/nowhere/at/all\" does not exist"},
                              {{"a", "b"}, "unexpected argument \"b\"; see \"qel decode --help\""},
                              {{"--jsn"}, "unknown option \"--jsn\"; did you mean \"--json\"?"},
                          });
}

TEST(RefusedCommandLine, ServeCountsItsPartitions)
{
    Arguments arguments{"serve", "--plain"};
    for (int id = 1; id <= 256; ++id) {
        arguments.push_back("--partition");
        arguments.push_back(std::to_string(id) + "=cat");
    }
    expectRefused(arguments, {{{}, "more than 255 partitions"}});
}

} // namespace

} // namespace qel::test
