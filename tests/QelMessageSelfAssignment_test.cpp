// A typed message that is assigned to itself loses its payload. Every later use of it must stay within its frame, which
// the address sanitizer checks in these tests.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "support/CatalogFrames.hpp"
#include "support/MessageProbe.hpp"

#include <ctime>
#include <gtest/gtest.h>
#include <memory>
#include <string>

namespace qel {
namespace {

using test::detailsOf;
using test::frameOf;
using test::Payload;
using test::payloadOf;

template <typename T>
void assignToItself(T& message)
{
    const T& itself = message;
    message = itself;
}

/// Assigns the message to itself and checks what all classes have in common.
/// @return a copy of it, for testing its accessors too
template <typename T>
T assignedToItself(T& message)
{
    const std::string zeros(2 * std::size_t{message.dataLength()}, '0');
    const unsigned int length = message.msgLength();
    assignToItself(message);
    EXPECT_EQ(message.msgLength(), length);
    EXPECT_EQ(payloadOf(message), zeros);
    EXPECT_EQ(frameOf(*message.clone()), frameOf(message));
    T target(message);
    target = message;
    EXPECT_EQ(frameOf(target), frameOf(message));
    return message;
}

TEST(SelfAssignment, VersionRequestReadsAsZeros)
{
    const std::string toolId(32, 'x');
    QelMessageGetEnclTypeAndInterfaceVersionReq original(1, 2, 3, 4, toolId);
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getInterfaceVersion(), 0U);
        EXPECT_EQ(message->getToolType(), 0U);
        EXPECT_EQ(message->getMajorVersion(), 0);
        EXPECT_EQ(message->getMinorVersion(), 0);
        EXPECT_EQ(message->getToolId(), "");
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, ShortestReceivedVersionRequestStaysWithinItsFrame)
{
    auto original = test::received<QelMessageGetEnclTypeAndInterfaceVersionReq>(Payload().zeros(16));
    auto copy = assignedToItself(original);
    EXPECT_EQ(original.getToolId(), "");
    EXPECT_EQ(copy.getToolId(), "");
}

TEST(SelfAssignment, VersionResponseReadsAsZeros)
{
    QelMessageGetEnclTypeAndInterfaceVersionRsp original(1, 'A', 2, 3, "machine", "serial");
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getInterfaceVersionFamily(), '\0');
        EXPECT_EQ(message->getEnclosureType(), 0);
        EXPECT_EQ(message->getMajorVersion(), 0);
        EXPECT_EQ(message->getMinorVersion(), 0);
        EXPECT_EQ(message->getSystemMachineType(), "");
        EXPECT_EQ(message->getSystemSerialNum(), "");
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, CapabilitiesReadAsNone)
{
    QelMessageExchIntCapabilitiesRsp original(7, 8, QelCapabilities(std::string(32, '1')));
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getCapabilityLen(), 0U);
        EXPECT_EQ(message->getCapabilities(), QelCapabilities());
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, BroadcastRequestReadsAsEmpty)
{
    QelMessageDaxBroadcastReq original(1, 5, 2, "tool", "hello");
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getBroadcastMode(), 0);
        EXPECT_EQ(message->getToolType(), 0U);
        EXPECT_EQ(message->getToolId(), "");
        EXPECT_EQ(message->getBroadcastMsgLen(), 0);
        EXPECT_EQ(message->getDaxPacket(), message->getData());
        EXPECT_NE(detailsOf(*message), "");
        EXPECT_EQ(QelMessageDaxBroadcastOutboundAsync(*message, "sender", 3).getBroadcastMsgLen(), 0);
    }
}

TEST(SelfAssignment, OutboundBroadcastReadsAsEmpty)
{
    QelMessageDaxBroadcastOutboundAsync original(5, 2, "tool", "hello");
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getSenderToolType(), 0U);
        EXPECT_EQ(message->getSenderToolId(), "");
        EXPECT_EQ(message->getBroadcastMsgLen(), 0);
        EXPECT_EQ(message->getDaxPacket(), message->getData());
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, LimitsLoseTheirValues)
{
    QelMessageGetInterfaceLimitsRsp original(9);
    auto copy = assignedToItself(original);
    EXPECT_EQ(payloadOf(copy), std::string(32, '0'));
    EXPECT_NE(detailsOf(original), "");
}

TEST(SelfAssignment, TimeOfDayPrintsZeros)
{
    QelMessageGetQelTodRsp original(9, std::time_t{1709618828});
    auto copy = assignedToItself(original);
    EXPECT_EQ(detailsOf(original), detailsOf(copy));
    EXPECT_EQ(detailsOf(copy).substr(0, 14), " mYear      0\n");
}

TEST(SelfAssignment, ModeAttributeReadsAsEmpty)
{
    QelMessageGetGlobalModeAttributeRsp original(9, 4, "machine");
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getMode(), 0);
        EXPECT_EQ(message->getMTMSLen(), 0);
        EXPECT_EQ(message->getMTMS(), "");
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, MetadataReadsAsEmpty)
{
    QelMessageGetGlobalSaveAreaMetadataRsp original(9, "metadata");
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getMetadataLen(), 0);
        EXPECT_EQ(message->getMetadata(), "");
        EXPECT_NE(detailsOf(*message), "");
    }
}

/// The address of a virtual serial message reads as zero, in the message and in its copy.
template <typename T>
void expectNoAddress(const T& original, const T& copy)
{
    for (const T* message : {&original, &copy}) {
        EXPECT_EQ(message->getLpId(), 0);
        EXPECT_EQ(message->getVssConnectionNumber(), 0);
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, OpenRequestIsNotForced)
{
    QelMessageVirtualSerialOpenReq original(1, 2, true);
    auto copy = assignedToItself(original);
    expectNoAddress(original, copy);
    EXPECT_FALSE(original.isForceOpen());
    EXPECT_FALSE(copy.isForceOpen());
}

TEST(SelfAssignment, CloseRequestIsNotForced)
{
    QelMessageVirtualSerialCloseReq original(1, 2, true);
    auto copy = assignedToItself(original);
    expectNoAddress(original, copy);
    EXPECT_FALSE(original.isForceClose());
    EXPECT_FALSE(copy.isForceClose());
}

TEST(SelfAssignment, OpenResponseAndSetupRequestLoseTheirAddress)
{
    QelMessageVirtualSerialOpenRsp response(9, 1, 2);
    const auto copiedResponse = assignedToItself(response);
    expectNoAddress(response, copiedResponse);
    QelMessageVirtualSerialSetupSessionReq request(1, 2);
    const auto copiedRequest = assignedToItself(request);
    expectNoAddress(request, copiedRequest);
}

TEST(SelfAssignment, MaxSessionsReadAsZero)
{
    QelMessageVirtualSerialGetMaxSessionsRsp original(9, 3, 4);
    auto copy = assignedToItself(original);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getMaxCec(), 0);
        EXPECT_EQ(message->getMaxLpar(), 0);
        EXPECT_NE(detailsOf(*message), "");
    }
}

TEST(SelfAssignment, SerialDataReadsAsNone)
{
    QelMessageVirtualSerialDataToOsAsync original(1, 2, 5, "hello");
    auto copy = assignedToItself(original);
    expectNoAddress(original, copy);
    for (const auto* message : {&original, &copy}) {
        EXPECT_EQ(message->getSerialDataLength(), 0);
        EXPECT_EQ(message->getSerialData(), nullptr);
    }
}

TEST(SelfAssignment, CloseReasonReadsAsUnknown)
{
    using T = QelMessageVirtualSerialSessionClosedAsync;
    T original(1, 2, T::CloseReasonWriteFailure);
    auto copy = assignedToItself(original);
    expectNoAddress(original, copy);
    EXPECT_EQ(original.getCloseReason(), T::CloseReasonUnknown);
    EXPECT_EQ(copy.getCloseReason(), T::CloseReasonUnknown);
}

TEST(SelfAssignment, MessageWithoutPayloadStaysAHeader)
{
    QelMessageGetQelTodReq original;
    auto copy = assignedToItself(original);
    EXPECT_EQ(copy.getData(), nullptr);
    EXPECT_EQ(detailsOf(original), "    <no additional details>");
}

} // namespace
} // namespace qel
