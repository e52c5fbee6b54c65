// "qel call" as a process, against the real server and against servers that misbehave.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>

#include "integration/TestConsole.hpp"
#include "integration/WrongServer.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <thread>

namespace qel::test {

namespace {

using nlohmann::json;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;

json parse(const Process::Result& result)
{
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    return json::parse(result.output);
}

// What a server answers.

class Call : public ::testing::Test {
protected:
    void expectText(const std::vector<std::string>& arguments, const std::string& output)
    {
        SCOPED_TRACE(arguments.front());
        const auto result = server.call(arguments);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.output, output);
        EXPECT_THAT(result.errors, IsEmpty());
    }

    ServeProcess server{{"--partition", "1=cat", "--partition", "9=cat", "--system-type", "TYPE", "--system-serial",
                         "SERIAL", "--interface-family", "F", "--interface-version", "65535.7", "--capabilities",
                         "0111"}};
};

TEST_F(Call, Version)
{
    expectText({"version"}, "Interface family: F\n"
                            "Major version:    65535\n"
                            "Minor version:    7\n"
                            "Enclosure type:   2\n"
                            "Machine type:     TYPE\n"
                            "Serial number:    SERIAL\n");
    EXPECT_EQ(parse(server.call({"version", "--json"})),
              json::parse(R"({"request": "version", "status": 0, "statusName": "QelMessageStatusNoError",
                              "statusDetail": 0, "family": "F", "majorVersion": 65535, "minorVersion": 7,
                              "enclosureType": 2, "machineType": "TYPE", "serialNumber": "SERIAL"})"));
}

TEST_F(Call, Capabilities)
{
    expectText({"capabilities"}, "Common capabilities: 01110000000000000000000000000000\n");
    expectText({"capabilities", "1100"}, "Common capabilities: 01000000000000000000000000000000\n");
    EXPECT_EQ(parse(server.call({"--json", "capabilities", "001"}))["capabilities"],
              "00100000000000000000000000000000");
}

TEST_F(Call, Limits)
{
    expectText({"limits"}, "Largest command (bytes):            16384\n"
                           "Largest hypervisor command (bytes): 4096\n"
                           "Largest broadcast (bytes):          16306\n"
                           "Consoles supported:                 16\n"
                           "Nonpersistent locks supported:      0\n"
                           "Persistent locks supported:         0\n");
    EXPECT_EQ(parse(server.call({"--json", "limits"}))["maxCommandSize"], 16384);
}

TEST_F(Call, Time)
{
    const auto text = server.call({"time"});
    EXPECT_THAT(
        text.output,
        MatchesRegex("Time of day \\(UTC\\): 20[0-9][0-9]-[01][0-9]-[0-3][0-9]T[0-2][0-9]:[0-5][0-9]:[0-6][0-9]Z\n"));
    EXPECT_TRUE(parse(server.call({"--json", "time"}))["time"].is_string());
}

TEST_F(Call, MaxSessions)
{
    expectText({"max-sessions"}, "Systems:    1\n"
                                 "Partitions: 2\n");
    EXPECT_EQ(parse(server.call({"--json", "max-sessions"}))["maxPartitions"], 2);
}

TEST_F(Call, Mode)
{
    expectText({"get-mode"}, "Mode:                        0\n"
                             "Machine type, model, serial: \n");
    expectText({"set-mode", "255", "TYPE*SERIAL"}, "done\n");
    expectText({"get-mode"}, "Mode:                        255\n"
                             "Machine type, model, serial: TYPE*SERIAL\n");
    expectText({"set-mode", "1"}, "done\n");
    const json mode = parse(server.call({"get-mode", "--json"}));
    EXPECT_EQ(mode["mode"], 1);
    EXPECT_EQ(mode["mtms"], "");
    expectText({"set-mode", "010"}, "done\n"); // ten, whatever C makes of it
    EXPECT_EQ(parse(server.call({"get-mode", "--json"}))["mode"], 10);
}

TEST_F(Call, Metadata)
{
    expectText({"set-metadata", "\x1B[2J \xC3\xA9"}, "done\n");
    expectText({"get-metadata"}, "Metadata: \\x1b[2J \\xc3\\xa9\n");
    const json metadata = parse(server.call({"get-metadata", "--json"}));
    EXPECT_EQ(metadata["metadata"], "\x1B[2J \xC3\xA9");
    EXPECT_EQ(metadata["metadataHex"], "1b5b324a20c3a9");
    const std::string longest(16350, 'm');
    expectText({"set-metadata", longest}, "done\n");
    expectText({"get-metadata"}, "Metadata: " + longest + "\n");
}

TEST_F(Call, Broadcast)
{
    expectText({"broadcast", "to all"}, "done\n");
    TestConsole other(server.endpoint());
    other.introduce("other", 77);
    expectText({"broadcast", "--type", "1", "--to-type", "77", "--to-id", "other", "to you"}, "done\n");
    const auto notice = other.messages().receive<QelMessageDaxBroadcastOutboundAsync>();
    EXPECT_EQ(std::string(notice->getDaxPacket(), notice->getBroadcastMsgLen()), "to you");
}

TEST_F(Call, DoneInJsonIsTheStatusAlone)
{
    EXPECT_EQ(parse(server.call({"--json", "set-mode", "3"})),
              json::parse(R"({"request": "set-mode", "status": 0, "statusName": "QelMessageStatusNoError",
                              "statusDetail": 0})"));
}

TEST_F(Call, ARefusalIsExitStatusOneWithTheReason)
{
    const auto result = server.call({"broadcast", "--type", "1", "--to-id", "nobody", "x"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(result.errors, "qel: no other console has this tool type and id: 0x00000013 "
                             "(QelMessageStatusConnectionNotAvailable)\n");
}

TEST_F(Call, ARefusalInJsonIsADocument)
{
    const auto result = server.call({"--json", "broadcast", "--type", "1", "--to-id", "nobody", "x"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(json::parse(result.output), json::parse(R"({"request": "broadcast", "status": 19,
                              "statusName": "QelMessageStatusConnectionNotAvailable", "statusDetail": 0,
                              "refused": "broadcast"})"));
}

TEST_F(Call, ARefusedEarlierStepIsNamed)
{
    TestConsole other(server.endpoint());
    other.introduce("taken", 1);
    const auto result = server.call({"--json", "--tool-id", "taken", "time"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              "qel: a console with this tool type and id is connected already; choose another --tool-id: "
              "0x00000025 (QelMessageStatusDaxAlreadyConnected)\n");
    const json document = json::parse(result.output);
    EXPECT_EQ(document["request"], "time");
    EXPECT_EQ(document["refused"], "version request");
    EXPECT_EQ(document["status"], 37);
}

TEST_F(Call, OutputThatCannotBeWrittenIsAFailure)
{
    const auto result = run({"/bin/sh", "-c", "exec \"$0\" call --connect \"$1\" --plain limits > /dev/full",
                             QEL_PROGRAM, server.endpoint()});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_EQ(result.errors, "qel: cannot write to standard output\n");
}

TEST_F(Call, WritesALogOnRequest)
{
    const auto result = server.call({"--log-level", "debug", "limits"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.errors, HasSubstr("(D): "));
}

TEST(CallInARow, CallsWithTheSameToolIdFollowEachOther)
{
    const ServeProcess server({"--max-consoles", "1", "--log-level", "warn"});
    for (int i = 0; i < 30; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(server.call({"--tool-id", "always the same", "time"}).exitStatus, 0);
    }
}

// Servers that misbehave.

/// Grants the version request.
void welcome(LoopbackMessages& messages)
{
    const auto request = messages.receive();
    messages.send(QelMessageGetEnclTypeAndInterfaceVersionRsp(request->getCallerId(), 'Q', 1, 0, "t", "s"));
}

QelMessageGeneric emptyResponse(const QelMessage& request)
{
    return QelMessageGeneric(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
}

TEST(CallFaults, ARefusedConnectionIsExitStatusThree)
{
    std::string endpoint;
    {
        const Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        endpoint = listener.getSocketName().str();
    }
    const auto result = runQel({"call", "--connect", endpoint, "--plain", "time"});
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_THAT(result.errors, HasSubstr("qel: cannot connect to " + endpoint + ": "));
    EXPECT_THAT(result.errors, HasSubstr("111 (Connection refused)\n"));
    EXPECT_EQ(result.output, "");
}

TEST(CallFaults, GarbageIsExitStatusFive)
{
    const WrongServer server([](LoopbackMessages& messages) {
        messages.receive();
        messages.sendBytes("HTTP/1.1 400 Bad Request\r\n\r\n");
    });
    const auto result = server.call({"time"});
    EXPECT_EQ(result.exitStatus, 5);
    EXPECT_EQ(result.errors, "qel: the peer broke the protocol: Invalid length\n");
}

TEST(CallFaults, AResponseToAnotherRequestIsExitStatusFive)
{
    const WrongServer server([](LoopbackMessages& messages) {
        welcome(messages);
        messages.receive();
        messages.send(QelMessageGetQelTodRsp(1, 0));
    });
    EXPECT_EQ(server.call({"time"}).exitStatus, 5);
}

TEST(CallFaults, AShortResponseIsExitStatusFive)
{
    for (const char* request : {"version", "capabilities", "limits", "time", "get-mode", "get-metadata"}) {
        SCOPED_TRACE(request);
        const WrongServer server([&](LoopbackMessages& messages) {
            if (std::string(request) != "version") welcome(messages);
            messages.send(emptyResponse(*messages.receive()));
        });
        const auto result = server.call({request});
        EXPECT_EQ(result.exitStatus, 5);
        EXPECT_EQ(result.output, "");
    }
}

TEST(CallFaults, TimeWithDigitsAbove9IsExitStatusFive)
{
    for (const std::vector<std::string>& arguments : {std::vector<std::string>{"time"}, {"--json", "time"}}) {
        SCOPED_TRACE(arguments.front());
        const WrongServer server([](LoopbackMessages& messages) {
            welcome(messages);
            QelMessageGeneric answer = emptyResponse(*messages.receive());
            answer.setData("\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF", 8);
            messages.send(answer);
        });
        const auto result = server.call(arguments);
        EXPECT_EQ(result.exitStatus, 5);
        EXPECT_EQ(result.output, "");
        EXPECT_EQ(result.errors,
                  "qel: the peer broke the protocol: the time of day has digits above 9: ffffffffffffff\n");
    }
}

TEST(CallFaults, NoResponseIsExitStatusSix)
{
    const WrongServer server([](LoopbackMessages& messages) {
        welcome(messages);
        while (true)
            messages.receive();
    });
    const auto result = server.call({"--timeout", "0.1", "time"});
    EXPECT_EQ(result.exitStatus, 6);
}

TEST(CallFaults, AnIncompleteResponseIsExitStatusSix)
{
    const WrongServer server([](LoopbackMessages& messages) {
        messages.receive();
        messages.sendBytes(std::string("\xDE\xCA\xFF\x20\0\0\0\x50", 8));
        messages.receive();
    });
    EXPECT_EQ(server.call({"--timeout", "0.1", "time"}).exitStatus, 6);
}

TEST(CallFaults, NoticesDoNotExtendTheTimeout)
{
    const WrongServer server([](LoopbackMessages& messages) {
        welcome(messages);
        while (true)
            messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "x", "x"));
    });
    EXPECT_EQ(server.call({"--timeout", "0.2", "time"}).exitStatus, 6);
}

TEST(CallFaults, AClosedConnectionIsExitStatusSeven)
{
    const WrongServer server([](LoopbackMessages& messages) { messages.receive(); });
    const auto result = server.call({"time"});
    EXPECT_EQ(result.exitStatus, 7);
}

TEST(CallFaults, AConnectionClosedWithinAResponseIsExitStatusSeven)
{
    const WrongServer server([](LoopbackMessages& messages) {
        messages.receive();
        messages.sendBytes(std::string("\xDE\xCA\xFF\x20\0\0\0\x50", 8));
    });
    EXPECT_EQ(server.call({"time"}).exitStatus, 7);
}

TEST(CallFaults, TheConnectionClosedNoticeIsExitStatusSeven)
{
    const WrongServer server([](LoopbackMessages& messages) {
        welcome(messages);
        messages.receive();
        messages.send(QelMessageKrogConnectionClosedAsync());
    });
    const auto result = server.call({"time"});
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_EQ(result.errors, "qel: the server closed the connection\n");
}

TEST(CallFaults, NoticesBeforeTheResponseAreSkipped)
{
    const WrongServer server([](LoopbackMessages& messages) {
        messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "x", "x"));
        welcome(messages);
        messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "x", "x"));
        messages.send(QelMessageGetQelTodRsp(messages.receive()->getCallerId(), std::time_t{0}));
    });
    const auto result = server.call({"time"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.output, "Time of day (UTC): 1970-01-01T00:00:00Z\n");
}

} // namespace

} // namespace qel::test
