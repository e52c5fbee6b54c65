// The operations of the user's hypervisor: which request asks for which, and what becomes of what they throw.

#include "protocol/hypervisor/ScriptedMachine.hpp"
#include "support/SettableClock.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::GlobalMode;
using protocol::Hypervisor;
using protocol::HypervisorEngine;
using protocol::MachineInfo;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using ::testing::ThrowsMessage;

constexpr unsigned int kCmdFailed = 6;

using HypervisorOperationsTest = ScriptedMachineFixture;

TEST(HypervisorDefaults, SayWhatTheConstructorWasGiven)
{
    Hypervisor machine(MachineInfo{'Z', 4, 5, "type", "serial"}, QelCapabilities("01"));
    EXPECT_EQ(machine.machine().interfaceFamily, 'Z');
    EXPECT_EQ(machine.machine().majorVersion, 4U);
    EXPECT_EQ(machine.machine().minorVersion, 5U);
    EXPECT_EQ(machine.machine().machineType, "type");
    EXPECT_EQ(machine.machine().serialNumber, "serial");
    EXPECT_EQ(machine.capabilities(), QelCapabilities("01"));
}

TEST(HypervisorDefaults, AreAMachineWithoutCapabilitiesOrAttributes)
{
    const SettableClock clock;
    Hypervisor machine;
    EXPECT_EQ(machine.machine().interfaceFamily, 'Q');
    EXPECT_EQ(machine.machine().majorVersion, 1U);
    EXPECT_EQ(machine.machine().minorVersion, 0U);
    EXPECT_EQ(machine.machine().machineType, "QEL");
    EXPECT_EQ(machine.machine().serialNumber, "0000001");
    EXPECT_EQ(machine.capabilities(), QelCapabilities());
    EXPECT_EQ(machine.currentTime(), TimeProvider::system());
    EXPECT_EQ(machine.getMode().mode, 0U);
    EXPECT_EQ(machine.getMode().mtms, "");
    EXPECT_EQ(machine.getMetadata(), "");
}

TEST(HypervisorDefaults, KeepWhatIsSetAndAllowEverything)
{
    const protocol::Peer nobody;
    Hypervisor machine;
    machine.setMode(nobody, {7, "text"});
    machine.setMetadata(nobody, std::string("a\0b", 3));
    EXPECT_EQ(machine.getMode().mode, 7U);
    EXPECT_EQ(machine.getMode().mtms, "text");
    EXPECT_EQ(machine.getMetadata(), std::string("a\0b", 3));
    EXPECT_EQ(machine.mayRequest(nobody, QelMessageGetQelTodReq()), QelMessageStatusNoError);
    EXPECT_TRUE(machine.mayOpen(nobody, 1));
}

TEST(HypervisorPartitions, AnIdCanBeAddedOnce)
{
    Hypervisor machine;
    machine.addPartition(0, std::make_unique<FakeSerialLine>());
    machine.addPartition(65535, std::make_unique<FakeSerialLine>());
    EXPECT_THAT([&] { machine.addPartition(0, std::make_unique<FakeSerialLine>()); },
                ThrowsMessage<std::invalid_argument>("partition"));
    EXPECT_THAT([&] { machine.addPartition(1, nullptr); }, ThrowsMessage<std::invalid_argument>("line"));
    protocol::PartitionOptions options;
    options.replayBytes = 16 * 1024 * 1024;
    machine.addPartition(2, std::make_unique<FakeSerialLine>(), options);
    ++options.replayBytes;
    EXPECT_THAT([&] { machine.addPartition(3, std::make_unique<FakeSerialLine>(), options); },
                ThrowsMessage<std::invalid_argument>("replayBytes"));
}

TEST(HypervisorPartitions, DoNotChangeWhileAServerServesThem)
{
    const auto add = [](Hypervisor& machine) { machine.addPartition(1, std::make_unique<FakeSerialLine>()); };
    Hypervisor machine;
    {
        const HypervisorEngine engine(machine, 1, [] {});
        EXPECT_THAT([&] { add(machine); }, ThrowsMessage<std::logic_error>("a server serves this hypervisor"));
        EXPECT_THAT([&] { HypervisorEngine(machine, 1, [] {}); },
                    ThrowsMessage<std::logic_error>("a server serves this hypervisor"));
        EXPECT_THAT([&] { add(machine); }, ThrowsMessage<std::logic_error>("a server serves this hypervisor"));
    }
    add(machine);
}

TEST_F(HypervisorOperationsTest, AnEngineTakesItsLinesDownAndAnotherOneCanFollow)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    hypervisor->disconnect(peer.id);
    hypervisor.reset();
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(port2->stopped, 0U); // it was never up
    startEngine(1);
    Peer next;
    setUpSerial(next, "a", 1);
    EXPECT_EQ(port1->started, 2U);
}

TEST_F(HypervisorOperationsTest, TheVersionResponseSaysWhatTheMachineIs)
{
    Peer peer;
    connect(peer);
    receive(peer, versionRequest("a"));
    const auto response = peer.link.take<QelMessageGetEnclTypeAndInterfaceVersionRsp>();
    EXPECT_EQ(response->getInterfaceVersionFamily(), 'Z');
    EXPECT_EQ(response->getSystemMachineType(), "type");
    EXPECT_THAT(user->calls, ElementsAre("mayRequest a", "machine", "onConnected a"));
}

TEST_F(HypervisorOperationsTest, CapabilitiesAndTimeAreThoseOfTheMachine)
{
    Peer peer;
    identify(peer, "a");
    user->calls.clear();
    receive(peer, QelMessageExchIntCapabilitiesReq(QelCapabilities("110")));
    EXPECT_EQ(peer.link.take<QelMessageExchIntCapabilitiesRsp>()->getCapabilities(), QelCapabilities("010"));
    const auto time = ask(peer, QelMessageGetQelTodReq());
    EXPECT_EQ(std::string(time->getData(), time->dataLength()), std::string("\x20\x24\x03\x05\x06\x07\x08\0", 8));
    EXPECT_THAT(user->calls, ElementsAre("mayRequest a", "capabilities", "mayRequest a", "currentTime"));
}

TEST_F(HypervisorOperationsTest, ModeAndMetadataAreKeptByTheMachine)
{
    Peer peer;
    identify(peer, "a");
    user->calls.clear();
    receive(peer, QelMessageGetGlobalModeAttributeReq());
    const auto mode = peer.link.take<QelMessageGetGlobalModeAttributeRsp>();
    EXPECT_EQ(mode->getMode(), 9U);
    EXPECT_EQ(mode->getMTMS(), "mtms");
    receive(peer, QelMessageGetGlobalSaveAreaMetadataReq());
    EXPECT_EQ(peer.link.take<QelMessageGetGlobalSaveAreaMetadataRsp>()->getMetadata(), "kept");
    EXPECT_EQ(statusOf(peer, QelMessageSetGlobalModeAttributeReq(2, "new")), 0U);
    EXPECT_EQ(statusOf(peer, QelMessageSetGlobalSaveAreaMetadataReq("data")), 0U);
    EXPECT_THAT(user->calls, ElementsAre("mayRequest a", "getMode", "mayRequest a", "getMetadata", "mayRequest a",
                                         "setMode a 2 new", "mayRequest a", "setMetadata a data"));
}

// What an operation throws.

struct Row {
    const char* operation;
    QelMessageGeneric request;
};

std::vector<Row> rows()
{
    return {
        {"mayRequest", QelMessageGetInterfaceLimitsReq()},
        {"capabilities", QelMessageExchIntCapabilitiesReq(QelCapabilities("1"))},
        {"currentTime", QelMessageGetQelTodReq()},
        {"setMode", QelMessageSetGlobalModeAttributeReq(1, "m")},
        {"getMode", QelMessageGetGlobalModeAttributeReq()},
        {"setMetadata", QelMessageSetGlobalSaveAreaMetadataReq("m")},
        {"getMetadata", QelMessageGetGlobalSaveAreaMetadataReq()},
        {"mayOpen", QelMessageVirtualSerialOpenReq(1, 0, false)},
    };
}

struct Thrown {
    ScriptedMachine::Failure failure;
    const char* text;
};

constexpr Thrown kThrown[] = {
    {ScriptedMachine::Failure::Standard, ": out of order"},
    {ScriptedMachine::Failure::Other, ": an exception that is not a std::exception"},
};

TEST_F(HypervisorOperationsTest, WhatAnOperationThrowsIsLoggedAndFailsOnlyItsRequest)
{
    for (const Thrown& thrown : kThrown) {
        for (const Row& row : rows()) {
            SCOPED_TRACE(std::string(row.operation) + thrown.text);
            Peer peer;
            openSession(peer, "a");
            log.clear();
            user->failing = row.operation;
            user->failure = thrown.failure;
            const auto response = ask(peer, row.request);
            EXPECT_EQ(response->getStatus(), kCmdFailed);
            EXPECT_EQ(response->dataLength(), 0U);
            EXPECT_THAT(log.lines(),
                        ElementsAre(::testing::AllOf(
                            StartsWith("E: [qel] console " + std::to_string(peer.id) + ": cannot serve [CID: "),
                            EndsWith(thrown.text))));
            user->failing.clear();
            EXPECT_EQ(statusOf(peer, row.request), 0U);
            hypervisor->disconnect(peer.id);
        }
    }
}

TEST_F(HypervisorOperationsTest, AConsoleIsNotIdentifiedByAVersionRequestThatFailed)
{
    for (const Thrown& thrown : kThrown) {
        SCOPED_TRACE(thrown.text);
        log.clear();
        Peer peer;
        connect(peer);
        user->failing = "machine";
        user->failure = thrown.failure;
        EXPECT_EQ(receive(peer, versionRequest("a")), protocol::ConsoleState::Connected);
        EXPECT_EQ(peer.link.take()->getStatus(), kCmdFailed);
        EXPECT_THAT(log.lines(), ElementsAre(EndsWith(thrown.text)));
        user->failing.clear();
        EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
        hypervisor->disconnect(peer.id);
    }
}

TEST_F(HypervisorOperationsTest, WhatAnEventThrowsIsLoggedOnly)
{
    for (const Thrown& thrown : kThrown) {
        SCOPED_TRACE(thrown.text);
        log.clear();
        user->failing = "onConnected";
        user->failure = thrown.failure;
        Peer peer;
        identify(peer, "a");
        const std::string console = "E: [qel] console " + std::to_string(peer.id);
        EXPECT_THAT(log.lines(), ElementsAre(console + thrown.text));
        log.clear();
        user->failing = "onDisconnected";
        hypervisor->disconnect(peer.id);
        EXPECT_THAT(log.lines(), ElementsAre(console + thrown.text));
        EXPECT_EQ(hypervisor->receive(peer.id, QelMessageGetQelTodReq()).state, protocol::ConsoleState::Closing);
    }
}

// What an operation returns that no response can say.

TEST_F(HypervisorOperationsTest, AMachineThatDoesNotFitTheVersionResponseFailsTheRequest)
{
    Peer peer;
    connect(peer);
    user->info.machineType = std::string(17, 'x');
    EXPECT_EQ(statusOf(peer, versionRequest("a")), kCmdFailed);
    user->info.machineType.pop_back();
    user->info.serialNumber = std::string(17, 'x');
    EXPECT_EQ(statusOf(peer, versionRequest("a")), kCmdFailed);
    EXPECT_THAT(log.lines(), ElementsAre(EndsWith(": System machine type is too large"),
                                         EndsWith(": System serial size is too large")));
    user->info.serialNumber.pop_back();
    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
}

TEST_F(HypervisorOperationsTest, AttributesThatDoNotFitAResponseFailTheRequest)
{
    Peer peer;
    identify(peer, "a");
    user->mode.mtms = std::string(16348, 'x');
    user->metadata = std::string(16350, 'x');
    EXPECT_EQ(ask(peer, QelMessageGetGlobalModeAttributeReq())->msgLength(), 16384U);
    EXPECT_EQ(ask(peer, QelMessageGetGlobalSaveAreaMetadataReq())->msgLength(), 16384U);
    EXPECT_THAT(log.lines(), IsEmpty());
    user->mode.mtms += 'x';
    user->metadata += 'x';
    EXPECT_EQ(statusOf(peer, QelMessageGetGlobalModeAttributeReq()), kCmdFailed);
    EXPECT_EQ(statusOf(peer, QelMessageGetGlobalSaveAreaMetadataReq()), kCmdFailed);
    EXPECT_THAT(log.lines(), ElementsAre(EndsWith(": the text of the mode does not fit a response"),
                                         EndsWith(": the metadata do not fit a response")));
}

// The events.

TEST_F(HypervisorOperationsTest, TheMachineHearsOfIdentifiedConsolesOnce)
{
    Peer silent;
    connect(silent);
    hypervisor->disconnect(silent.id);
    EXPECT_THAT(user->takeCalls(), IsEmpty());

    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, QelMessageGetInterfaceLimitsReq()), 0U);
    EXPECT_THAT(user->takeCalls(), ElementsAre("mayRequest a", "machine", "onConnected a", "mayRequest a"));
    hypervisor->disconnect(peer.id);
    hypervisor->disconnect(peer.id);
    EXPECT_THAT(user->takeCalls(), ElementsAre("onDisconnected a"));
}

TEST_F(HypervisorOperationsTest, TheMachineHearsOfTheEndOfAConsoleThatWasClosedFirst)
{
    Peer peer;
    identify(peer, "a");
    hypervisor->shutDown();
    user->calls.clear();
    hypervisor->disconnect(peer.id);
    EXPECT_THAT(user->calls, ElementsAre("onDisconnected a"));
}

} // namespace

} // namespace qel::test
