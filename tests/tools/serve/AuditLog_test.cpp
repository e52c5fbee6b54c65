#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "serve/AuditLog.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

using protocol::DisconnectReason;
using tool::auditAnswered;

protocol::Peer alice()
{
    protocol::Peer peer;
    peer.commonName = "alice";
    peer.fingerprint = "AB:CD";
    peer.id = 7;
    peer.address = "192.0.2.7:40312";
    peer.isProtected = true;
    peer.toolType = 5;
    peer.toolId = "ops-1";
    return peer;
}

const std::string kWho = " console=7 name=\"alice\" fingerprint=AB:CD address=192.0.2.7:40312";

TEST(AuditLog, SaysWhoConnectsAndLeaves)
{
    EXPECT_EQ(tool::auditConnected(alice()), "audit: connected" + kWho + " tool=5,\"ops-1\"");
    EXPECT_EQ(tool::auditLeft(alice(), DisconnectReason::Closed), "audit: left" + kWho + " why=closed");
}

TEST(AuditLog, SaysWhyAConsoleHasLeft)
{
    const std::pair<DisconnectReason, std::string> cases[] = {
        {DisconnectReason::Closed, "closed"},     {DisconnectReason::Lost, "lost"},
        {DisconnectReason::Protocol, "protocol"}, {DisconnectReason::Timeout, "timeout"},
        {DisconnectReason::Idle, "idle"},         {DisconnectReason::Shutdown, "shutdown"},
        {DisconnectReason::Failure, "failure"}};
    for (const auto& row : cases)
        EXPECT_EQ(tool::auditLeft(alice(), row.first), "audit: left" + kWho + " why=" + row.second);
}

TEST(AuditLog, AConsoleWithoutACertificateHasNoName)
{
    protocol::Peer peer = alice();
    peer.commonName.clear();
    peer.fingerprint.clear();
    EXPECT_EQ(tool::auditLeft(peer, DisconnectReason::Lost),
              "audit: left console=7 name=\"\" fingerprint=- address=192.0.2.7:40312 why=lost");
}

TEST(AuditLog, StaysOnOneLineWhateverThePeerSaysItIs)
{
    protocol::Peer peer = alice();
    peer.commonName = "a\"\nb=\x1b";
    peer.toolId = "t\r\"";
    EXPECT_EQ(tool::auditConnected(peer), "audit: connected console=7 name=\"a\\\"\\x0ab=\\x1b\" fingerprint=AB:CD "
                                          "address=192.0.2.7:40312 tool=5,\"t\\x0d\\\"\"");
}

TEST(AuditLog, SaysWhoOpensWatchesForcesAndCloses)
{
    using Open = QelMessageVirtualSerialOpenReq;
    using Close = QelMessageVirtualSerialCloseReq;
    const auto line = [](const QelMessage& request) {
        return auditAnswered(alice(), request, QelMessageStatusNoError);
    };
    EXPECT_EQ(line(Open(3, 0, false)), "audit: opened" + kWho + " partition=3 connection=0");
    EXPECT_EQ(line(Open(3, 15, false)), "audit: watched" + kWho + " partition=3 connection=15");
    EXPECT_EQ(line(Open(3, 0, true)), "audit: forced" + kWho + " partition=3 connection=0");
    EXPECT_EQ(line(Open(3, 1, true)), "audit: forced" + kWho + " partition=3 connection=1");
    EXPECT_EQ(line(Close(3, 0, false)), "audit: closed" + kWho + " partition=3 connection=0");
    EXPECT_EQ(line(Close(3, 0, true)), "audit: closed" + kWho + " partition=3 connection=0 force=yes");
}

TEST(AuditLog, SaysWhatIsRefusedAndWhy)
{
    const auto line = [](const QelMessage& request, QelMessageStatusCodes status) {
        return auditAnswered(alice(), request, status);
    };
    EXPECT_EQ(
        line(QelMessageVirtualSerialOpenReq(3, 0, true), QelMessageStatusInvalidLparId),
        "audit: refused" + kWho +
            " partition=3 connection=0 request=\"open serial session\" status=21 why=QelMessageStatusInvalidLparId");
    EXPECT_EQ(line(QelMessageGetQelTodReq(), QelMessageStatusInvalidCmdSequence),
              "audit: refused" + kWho + " request=\"time\" status=4 why=QelMessageStatusInvalidCmdSequence");
    EXPECT_EQ(line(QelMessageGeneric(1, 0x1234, 0x5678, MsgResponseExpected), QelMessageStatusInvalidFunction),
              "audit: refused" + kWho + " request=\"unknown\" status=15 why=QelMessageStatusInvalidFunction");
    EXPECT_EQ(auditAnswered(alice(), QelMessageGetQelTodReq(), QelMessageStatusTooManyConnections, "rules"),
              "audit: refused" + kWho + " request=\"time\" status=18 why=QelMessageStatusTooManyConnections by=rules");
}

TEST(AuditLog, WhatChangesNoSessionHasNoLine)
{
    EXPECT_EQ(auditAnswered(alice(), QelMessageGetQelTodReq(), QelMessageStatusNoError), "");
    EXPECT_EQ(auditAnswered(alice(), QelMessageVirtualSerialSetupSessionReq(3, 0), QelMessageStatusNoError), "");
}

} // namespace

} // namespace qel::test
