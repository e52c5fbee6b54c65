// Who may do what: the decisions of the user's hypervisor.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "protocol/hypervisor/NamedRequests.hpp"
#include "protocol/hypervisor/ScriptedMachine.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <optional>

namespace qel::test {

namespace {

using protocol::ConsoleState;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr unsigned int kInvalidOperation = 1;
constexpr unsigned int kInvalidLparId = 21;
constexpr unsigned int kInvalidConnectionNumber = 16;
constexpr unsigned int kNotAvailable = 19;
constexpr unsigned int kClosureFailure = 20;

class HypervisorDecisionsTest : public ScriptedMachineFixture {
protected:
    /// Connects a console that has a certificate.
    void connectAs(Peer& peer, const std::string& commonName)
    {
        protocol::Peer from;
        from.address = "192.0.2.7:40312";
        from.commonName = commonName;
        from.subject = "CN=" + commonName;
        from.fingerprint = "fingerprint of " + commonName;
        from.isProtected = true;
        peer.id = hypervisor->connect(peer.link, std::move(from));
    }

    /// The same, and opens the hypervisor session.
    void openSessionAs(Peer& peer, const std::string& commonName)
    {
        connectAs(peer, commonName);
        ASSERT_EQ(statusOf(peer, versionRequest(commonName)), 0U);
        ASSERT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
    }

    void refuseAll(QelMessageStatusCodes status)
    {
        user->decide = [status](const protocol::Peer&, const QelMessage&) { return status; };
    }
};

// mayRequest()

TEST_F(HypervisorDecisionsTest, TheConsoleIsKnownForEachRequest)
{
    std::vector<NamedRequest> requests{{"version", versionRequest("tool", 7)}};
    for (const NamedRequest& other : otherRequests())
        requests.push_back(other);
    Peer peer;
    connectAs(peer, "operator");
    for (const NamedRequest& entry : requests) {
        SCOPED_TRACE(entry.name);
        std::optional<protocol::Peer> asked;
        std::string about;
        user->decide = [&](const protocol::Peer& from, const QelMessage& request) {
            EXPECT_FALSE(asked.has_value()) << "asked twice";
            asked = from;
            about = toString(request.getLogID());
            EXPECT_EQ(dynamic_cast<const QelMessageGeneric*>(&request), nullptr) << "not of the request's class";
            EXPECT_NE(typeid(request), typeid(QelMessage)) << "not of the request's class";
            return QelMessageStatusNoError;
        };
        receive(peer, entry.message);
        ASSERT_TRUE(asked.has_value());
        EXPECT_EQ(about, toString(entry.message.getLogID()));
        EXPECT_EQ(asked->id, peer.id);
        EXPECT_EQ(asked->address, "192.0.2.7:40312");
        EXPECT_EQ(asked->commonName, "operator");
        EXPECT_EQ(asked->subject, "CN=operator");
        EXPECT_EQ(asked->fingerprint, "fingerprint of operator");
        EXPECT_TRUE(asked->isProtected);
        EXPECT_EQ(asked->toolType, 7U);
        EXPECT_EQ(asked->toolId, "tool");
        if (entry.message.getOperation() == QelMessageOpCloseKrogSession) { // the later ones need it
            EXPECT_EQ(peer.link.take()->getStatus(), 0U);
            user->decide = nullptr;
            receive(peer, QelMessageInterfaceCmpOpenKrogSessionReq());
        }
        EXPECT_NE(peer.link.take(), nullptr);
    }
}

TEST_F(HypervisorDecisionsTest, ARefusedRequestCarriesTheStatusAndDoesNothing)
{
    for (const QelMessageStatusCodes status : {QelMessageStatusInvalidOperation, QelMessageStatusTooManyConnections,
                                               QelMessageStatusHypervisorGenericError}) {
        Peer peer;
        Peer other;
        openSession(peer, "a");
        identify(other, "b");
        refuseAll(status);
        for (const NamedRequest& entry : otherRequests()) {
            SCOPED_TRACE(std::string(entry.name) + " " + std::to_string(status));
            user->calls.clear();
            const auto response = ask(peer, entry.message);
            EXPECT_EQ(response->getStatus(), status);
            EXPECT_EQ(response->dataLength(), 0U);
            EXPECT_THAT(user->calls, ElementsAre("mayRequest a"));
            EXPECT_FALSE(peer.link.finished);
            EXPECT_EQ(other.link.posted(), 0U);
        }
        EXPECT_EQ(port1->started, 0U);
        user->decide = nullptr;
        EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialGetMaxSessionsReq()), 0U) << "the session was closed";
        hypervisor->disconnect(peer.id);
        hypervisor->disconnect(other.id);
    }
}

TEST_F(HypervisorDecisionsTest, ARefusedVersionRequestMayBeRepeated)
{
    Peer peer;
    connect(peer);
    refuseAll(QelMessageStatusIncompatibleClient);
    EXPECT_EQ(receive(peer, versionRequest("a")), ConsoleState::Connected);
    EXPECT_EQ(peer.link.take()->getStatus(), QelMessageStatusIncompatibleClient);
    EXPECT_FALSE(peer.link.finished);
    user->decide = nullptr;
    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
}

TEST_F(HypervisorDecisionsTest, Status18ForTheVersionRequestClosesTheConnection)
{
    Peer peer;
    connect(peer);
    refuseAll(QelMessageStatusTooManyConnections);
    EXPECT_EQ(receive(peer, versionRequest("a")), ConsoleState::Closing);
    EXPECT_EQ(peer.link.take()->getStatus(), QelMessageStatusTooManyConnections);
    EXPECT_TRUE(peer.link.finished);
}

TEST_F(HypervisorDecisionsTest, AMachineDecidesBeforeTheIdentityIsCompared)
{
    Peer first;
    Peer second;
    identify(first, "a");
    connect(second);
    refuseAll(QelMessageStatusInvalidOperation);
    EXPECT_EQ(statusOf(second, versionRequest("a")), kInvalidOperation);
}

TEST_F(HypervisorDecisionsTest, TheMachineIsNotAskedAboutWhatIsRefusedAnyway)
{
    Peer peer;
    connect(peer);
    for (const NamedRequest& entry : otherRequests())
        ask(peer, entry.message); // not identified
    ask(peer, request(0x6003, 0x0101, "too short"));
    EXPECT_THAT(user->takeCalls(), IsEmpty());

    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
    user->calls.clear();
    ask(peer, versionRequest("a"));                         // a second one
    ask(peer, request(0x1234, 0x0101));                     // unknown function
    ask(peer, request(0x6003, 0x7777));                     // unknown operation
    ask(peer, QelMessageVirtualSerialOpenReq(1, 0, false)); // no session
    EXPECT_THAT(user->takeCalls(), IsEmpty());

    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
    user->calls.clear();
    for (const NamedRequest& entry : unparsableRequests())
        ask(peer, entry.message);
    receive(peer, QelMessageVirtualSerialDataToOsAsync(1, 0, 1, "x"));
    EXPECT_THAT(user->takeCalls(), IsEmpty());
}

TEST_F(HypervisorDecisionsTest, OneConsoleMayWhatAnotherMayNot)
{
    user->decide = [](const protocol::Peer& peer, const QelMessage& request) {
        const auto* mode = dynamic_cast<const QelMessageSetGlobalModeAttributeReq*>(&request);
        if (mode == nullptr || peer.fingerprint == "fingerprint of operator") return QelMessageStatusNoError;
        return mode->getMode() < 2 ? QelMessageStatusNoError : QelMessageStatusInvalidOperation;
    };
    Peer operatorsPeer;
    Peer guest;
    openSessionAs(operatorsPeer, "operator");
    openSessionAs(guest, "guest");
    EXPECT_EQ(statusOf(operatorsPeer, QelMessageSetGlobalModeAttributeReq(2, "")), 0U);
    EXPECT_EQ(statusOf(guest, QelMessageSetGlobalModeAttributeReq(2, "")), kInvalidOperation);
    EXPECT_EQ(statusOf(guest, QelMessageSetGlobalModeAttributeReq(1, "")), 0U);
}

// mayOpen()

TEST_F(HypervisorDecisionsTest, APartitionThatAConsoleMayNotOpenDoesNotExistForIt)
{
    user->decideOpen = [](const protocol::Peer& peer, std::uint16_t partition) {
        return peer.commonName == "operator" || partition == 2;
    };
    Peer holder;
    Peer guest;
    openSessionAs(holder, "operator");
    openSessionAs(guest, "guest");
    EXPECT_EQ(open(holder, 1), 0U);
    for (const std::uint16_t partition : std::vector<std::uint16_t>{1, 99}) {
        SCOPED_TRACE(partition);
        for (const std::uint16_t connection : std::vector<std::uint16_t>{0, 1}) {
            for (const bool force : {false, true}) {
                EXPECT_EQ(open(guest, partition, connection, force), kInvalidLparId);
                EXPECT_EQ(close(guest, partition, connection, force), kInvalidLparId);
            }
            EXPECT_EQ(setUp(guest, partition, connection), kInvalidLparId);
        }
    }
    EXPECT_EQ(holder.link.posted(), 0U);
    EXPECT_EQ(setUp(holder, 1), 0U);
    EXPECT_EQ(open(guest, 2), 0U);
}

TEST_F(HypervisorDecisionsTest, ForAConsoleThatMayOpenAPartitionTheUsualRulesHold)
{
    Peer holder;
    Peer other;
    openSession(holder, "a");
    openSession(other, "b");
    EXPECT_EQ(open(holder, 1), 0U);
    EXPECT_EQ(open(other, 1), kNotAvailable);
    EXPECT_EQ(open(other, 1, 16), kInvalidConnectionNumber);
    EXPECT_EQ(close(other, 1), kClosureFailure);
    EXPECT_EQ(open(other, 1, 0, true), 0U);
}

TEST_F(HypervisorDecisionsTest, AHolderIsAskedAboutWhenItOpensOnly)
{
    Peer peer;
    openSession(peer, "a");
    user->calls.clear();
    EXPECT_EQ(open(peer, 1), 0U);
    EXPECT_THAT(user->takeCalls(), ElementsAre("mayRequest a", "mayOpen a 1"));
    user->decideOpen = [](const protocol::Peer&, std::uint16_t) { return false; };
    EXPECT_EQ(setUp(peer, 1), 0U);
    sendData(peer, 1, "x");
    EXPECT_EQ(port1->input, "x");
    EXPECT_EQ(close(peer, 1), 0U);
    EXPECT_THAT(user->takeCalls(), ElementsAre("mayRequest a", "mayRequest a"));
    EXPECT_EQ(open(peer, 1), kInvalidLparId);
}

TEST_F(HypervisorDecisionsTest, TheMachineIsNotAskedAboutPartitionsThatDoNotExist)
{
    Peer peer;
    openSession(peer, "a");
    user->calls.clear();
    EXPECT_EQ(open(peer, 3), kInvalidLparId);
    EXPECT_THAT(user->takeCalls(), ElementsAre("mayRequest a"));
}

} // namespace

} // namespace qel::test
