#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "serve/AccessRules.hpp"

#include <gtest/gtest.h>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using tool::AccessRight;
using tool::AccessRule;
using tool::AccessRules;

const std::string kPrint = "AA:BB";

protocol::PeerIdentity peer(const std::string& name, const std::string& fingerprint = kPrint)
{
    return {name, "CN=" + name, fingerprint};
}

AccessRule rule(std::vector<std::string> names, AccessRight rights, std::vector<AccessRule::Range> partitions = {})
{
    AccessRule made;
    made.names = std::move(names);
    made.rights = rights;
    made.allPartitions = partitions.empty();
    made.partitions = std::move(partitions);
    return made;
}

const QelMessageGetEnclTypeAndInterfaceVersionReq& introduction()
{
    static const QelMessageGetEnclTypeAndInterfaceVersionReq request(1, 1, 1, 0, "tool");
    return request;
}

QelMessageStatusCodes open(const AccessRules& rules, const protocol::PeerIdentity& who, std::uint16_t partition,
                           std::uint16_t connection, bool force = false)
{
    return rules.decide(who, QelMessageVirtualSerialOpenReq(partition, connection, force));
}

QelMessageStatusCodes close(const AccessRules& rules, const protocol::PeerIdentity& who, bool force)
{
    return rules.decide(who, QelMessageVirtualSerialCloseReq(1, 0, force));
}

TEST(AccessRules, WithoutRulesEveryConsoleMayDoAnything)
{
    const AccessRules rules;
    EXPECT_EQ(rules.size(), 0U);
    for (const auto& who : {peer("a"), peer("", ""), peer("")}) {
        EXPECT_EQ(rules.decide(who, introduction()), QelMessageStatusNoError);
        EXPECT_EQ(open(rules, who, 7, 0, true), QelMessageStatusNoError);
        EXPECT_EQ(close(rules, who, true), QelMessageStatusNoError);
        EXPECT_EQ(rules.decide(who, QelMessageSetGlobalModeAttributeReq(1, "x")), QelMessageStatusNoError);
        EXPECT_TRUE(rules.mayOpen(who, 7));
        EXPECT_TRUE(rules.mayUse(who, 7, 0));
    }
}

TEST(AccessRules, AConsoleThatNoRuleIsForMayNotConnect)
{
    const AccessRules rules({rule({"a", "b"}, AccessRight::Type)});
    EXPECT_EQ(rules.decide(peer("a"), introduction()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("b"), introduction()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("c"), introduction()), QelMessageStatusTooManyConnections);
    EXPECT_EQ(rules.decide(peer("A"), introduction()), QelMessageStatusTooManyConnections);
    EXPECT_EQ(open(rules, peer("c"), 1, 0), QelMessageStatusTooManyConnections);
    EXPECT_FALSE(rules.mayOpen(peer("c"), 1));
}

TEST(AccessRules, AConsoleWithoutACertificateMatchesNoRule)
{
    const AccessRules rules({rule({"*", "", "a"}, AccessRight::Type)});
    EXPECT_EQ(rules.decide(peer("a", ""), introduction()), QelMessageStatusTooManyConnections);
}

TEST(AccessRules, AnEmptyNameMatchesNoCertificateWithoutAName)
{
    EXPECT_FALSE(AccessRules({rule({""}, AccessRight::Type)}).mayOpen(peer(""), 1));
    EXPECT_TRUE(AccessRules({rule({"*"}, AccessRight::Type)}).mayOpen(peer(""), 1));
}

TEST(AccessRules, AStarIsForEveryCertificate)
{
    const AccessRules rules({rule({"*"}, AccessRight::Watch)});
    EXPECT_EQ(rules.decide(peer("anyone"), introduction()), QelMessageStatusNoError);
}

TEST(AccessRules, ARuleForNobodyStillRefusesTheOthers)
{
    const AccessRules rules({AccessRule()});
    EXPECT_EQ(rules.decide(peer("a"), introduction()), QelMessageStatusTooManyConnections);
}

TEST(AccessRules, ARuleWithNameAndFingerprintNeedsBoth)
{
    AccessRule both = rule({"a"}, AccessRight::Type);
    both.fingerprints = {kPrint, "11:22"};
    const AccessRules rules({both});
    EXPECT_TRUE(rules.mayOpen(peer("a", kPrint), 1));
    EXPECT_TRUE(rules.mayOpen(peer("a", "11:22"), 1));
    EXPECT_FALSE(rules.mayOpen(peer("a", "33:44"), 1));
    EXPECT_FALSE(rules.mayOpen(peer("b", kPrint), 1));
}

TEST(AccessRules, AFingerprintAloneIsForOneCertificate)
{
    AccessRule one = rule({}, AccessRight::Type);
    one.fingerprints = {kPrint};
    EXPECT_TRUE(AccessRules({one}).mayOpen(peer("whoever", kPrint), 1));
    EXPECT_FALSE(AccessRules({one}).mayOpen(peer("whoever", "33:44"), 1));
}

TEST(AccessRules, APartitionOutsideTheRangesDoesNotExist)
{
    const AccessRules rules({rule({"a"}, AccessRight::Type, {{2, 4}, {7, 7}})});
    for (const std::uint16_t partition : std::vector<std::uint16_t>{2, 3, 4, 7}) {
        SCOPED_TRACE(partition);
        EXPECT_EQ(open(rules, peer("a"), partition, 0), QelMessageStatusNoError);
        EXPECT_TRUE(rules.mayOpen(peer("a"), partition));
    }
    for (const std::uint16_t partition : std::vector<std::uint16_t>{0, 1, 5, 6, 8, 65535}) {
        SCOPED_TRACE(partition);
        EXPECT_EQ(open(rules, peer("a"), partition, 0), QelMessageStatusInvalidLparId);
        EXPECT_FALSE(rules.mayOpen(peer("a"), partition));
    }
}

TEST(AccessRules, AWatcherMayOpenEveryConnectionButTheOneThatTypes)
{
    const AccessRules rules({rule({"a"}, AccessRight::Watch)});
    EXPECT_EQ(open(rules, peer("a"), 1, 0), QelMessageStatusInvalidOperation);
    EXPECT_EQ(open(rules, peer("a"), 1, 1), QelMessageStatusNoError);
    EXPECT_EQ(open(rules, peer("a"), 1, 15), QelMessageStatusNoError);
    EXPECT_TRUE(rules.mayOpen(peer("a"), 1));
    EXPECT_FALSE(rules.mayUse(peer("a"), 1, 0));
    EXPECT_TRUE(rules.mayUse(peer("a"), 1, 15));
}

TEST(AccessRules, WhoMayTypeMayWatch)
{
    const AccessRules rules({rule({"a"}, AccessRight::Type)});
    EXPECT_EQ(open(rules, peer("a"), 1, 0), QelMessageStatusNoError);
    EXPECT_EQ(open(rules, peer("a"), 1, 1), QelMessageStatusNoError);
}

TEST(AccessRules, ForceAloneOpensNothing)
{
    const AccessRules rules({rule({"a"}, AccessRight::Force)});
    EXPECT_EQ(open(rules, peer("a"), 1, 0, true), QelMessageStatusInvalidLparId);
}

TEST(AccessRules, ForceNeedsItsRightOnThatPartition)
{
    const AccessRules rules({rule({"a"}, AccessRight::Type), rule({"a"}, AccessRight::Force, {{2, 2}})});
    EXPECT_EQ(open(rules, peer("a"), 1, 0, true), QelMessageStatusInvalidOperation);
    EXPECT_EQ(open(rules, peer("a"), 2, 0, true), QelMessageStatusNoError);
    EXPECT_EQ(close(rules, peer("a"), true), QelMessageStatusInvalidOperation);
    EXPECT_EQ(close(rules, peer("a"), false), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("a"), QelMessageVirtualSerialCloseReq(2, 0, true)), QelMessageStatusNoError);
}

TEST(AccessRules, BroadcastsAndAttributesNeedTheirRights)
{
    const QelMessageDaxBroadcastReq broadcast(0, 5, 1, "tool", "hello");
    const QelMessageSetGlobalModeAttributeReq mode(1, "x");
    const QelMessageSetGlobalSaveAreaMetadataReq metadata("x");
    struct {
        const char* name;
        AccessRight right;
        QelMessageStatusCodes toBroadcast;
        QelMessageStatusCodes toSet;
    } const rows[] = {
        {"neither", AccessRight::Type, QelMessageStatusInvalidOperation, QelMessageStatusInvalidOperation},
        {"broadcast", AccessRight::Broadcast, QelMessageStatusNoError, QelMessageStatusInvalidOperation},
        {"attributes", AccessRight::Attributes, QelMessageStatusInvalidOperation, QelMessageStatusNoError},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        const AccessRules rules({rule({"a"}, row.right, {{9, 9}})});
        EXPECT_EQ(rules.decide(peer("a"), broadcast), row.toBroadcast);
        EXPECT_EQ(rules.decide(peer("a"), mode), row.toSet);
        EXPECT_EQ(rules.decide(peer("a"), metadata), row.toSet);
    }
}

TEST(AccessRules, WhoMayConnectMayAskForWhatAllConsolesShare)
{
    const AccessRules rules({rule({"a"}, AccessRight::None)});
    EXPECT_EQ(rules.decide(peer("a"), introduction()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("a"), QelMessageInterfaceCmpOpenKrogSessionReq()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("a"), QelMessageGetQelTodReq()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("a"), QelMessageGetGlobalModeAttributeReq()), QelMessageStatusNoError);
    EXPECT_EQ(rules.decide(peer("a"), QelMessageVirtualSerialGetMaxSessionsReq()), QelMessageStatusNoError);
}

TEST(AccessRules, TheRightsOfSeveralRulesAddUp)
{
    const AccessRules rules({rule({"a"}, AccessRight::Watch, {{1, 9}}), rule({"*"}, AccessRight::Type, {{3, 3}})});
    EXPECT_TRUE(rules.mayUse(peer("a"), 3, 0));
    EXPECT_FALSE(rules.mayUse(peer("a"), 4, 0));
    EXPECT_TRUE(rules.mayUse(peer("a"), 4, 1));
    EXPECT_FALSE(rules.mayUse(peer("b"), 4, 1));
}

} // namespace

} // namespace qel::test
