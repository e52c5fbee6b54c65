#include <qel/common/QelMessageGeneric.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::bytes;
using test::CallerIdScope;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::MessageProbe;
using test::RawFrame;
using testing::StrEq;
using testing::ThrowsMessage;

RawFrame anyFrame()
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0x11223344).function(0x1234).operation(0x5678).flags(0xC5).status(4).statusDetail(9);
    frame.payload(bytes({1, 2, 3}));
    return frame;
}

QelMessageGeneric received(const std::vector<char>& frame)
{
    return QelMessageGeneric(heapCopy(frame).get(), static_cast<unsigned int>(frame.size()));
}

TEST(QelMessageGeneric, BuiltByDefaultIsTheDefaultFrameAndDrawsNoCallerId)
{
    CallerIdScope scope(50);
    const QelMessageGeneric message;
    EXPECT_EQ(frameOf(message), frameOf(QelMessage()));
    EXPECT_EQ(scope.last(), 50U);
}

TEST(QelMessageGeneric, BuiltFromArgumentsCarriesThem)
{
    const QelMessageGeneric message(0x01020304, 0x6003, 0x0108, MsgResponse);
    EXPECT_EQ(frameOf(message), frameOf(QelMessage(0x01020304, 0x6003, 0x0108, MsgResponse)));
}

TEST(QelMessageGeneric, ParsesAFrameOfAnyIdentity)
{
    EXPECT_EQ(frameOf(received(anyFrame().bytes())), hex(anyFrame().bytes()));
}

TEST(QelMessageGeneric, ChecksAReceivedFrame)
{
    EXPECT_THAT([] { received(anyFrame().version(0x30).bytes()); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad header version")));
    EXPECT_THAT([] { QelMessageGeneric message(nullptr, 100); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
}

TEST(QelMessageGeneric, CopiesAnyMessage)
{
    const MessageProbe probe(anyFrame().bytes());
    const QelMessage& base = probe;
    const QelMessageGeneric converted = base;
    EXPECT_EQ(frameOf(converted), hex(anyFrame().bytes()));

    const QelMessageGeneric copied(converted);
    EXPECT_EQ(frameOf(copied), hex(anyFrame().bytes()));
    EXPECT_NE(copied.serialize(), converted.serialize());
}

TEST(QelMessageGeneric, AssignsTheFrameOfAnyMessage)
{
    const MessageProbe probe(anyFrame().bytes());
    QelMessageGeneric target;
    EXPECT_EQ(&(target = probe), &target);
    EXPECT_EQ(frameOf(target), hex(anyFrame().bytes()));

    const QelMessageGeneric other(1, 2, 3, MsgResponse);
    EXPECT_EQ(&(target = other), &target);
    EXPECT_EQ(frameOf(target), frameOf(other));
}

TEST(QelMessageGeneric, ClonesAsGeneric)
{
    const QelMessageGeneric message = received(anyFrame().bytes());
    const QelMessage& base = message;
    const std::unique_ptr<QelMessage> copy = base.clone();
    const QelMessage& copied = *copy;
    EXPECT_EQ(typeid(copied), typeid(QelMessageGeneric));
    EXPECT_EQ(frameOf(*copy), hex(anyFrame().bytes()));
    EXPECT_NE(copy->serialize(), message.serialize());
}

TEST(QelMessageGeneric, StatusAndDetailAreSetInANewHeader)
{
    QelMessageGeneric message = received(anyFrame().bytes());
    message.setStatus(QelMessageStatusHypervisorGenericError, 0xABCD);
    EXPECT_EQ(frameOf(message), hex(anyFrame().status(0x8006).statusDetail(0xABCD).bytes()));
    EXPECT_THROW(message.checkStatus(), QelMessageStatusException);
}

TEST(QelMessageGeneric, DetailIsZeroUnlessGiven)
{
    QelMessageGeneric message = received(anyFrame().bytes());
    message.setStatus(QelMessageStatusNoError);
    EXPECT_EQ(frameOf(message), hex(anyFrame().status(0).statusDetail(0).bytes()));
    EXPECT_NO_THROW(message.checkStatus());
}

TEST(QelMessageGeneric, DetailIsDroppedByAnOldHeader)
{
    RawFrame frame = RawFrame::oldForm().callerId(3).payload(bytes({1, 2, 3}));
    QelMessageGeneric message = received(frame.bytes());
    message.setStatus(QelMessageStatusCmdTimeout, 0xABCD);
    EXPECT_EQ(frameOf(message), hex(frame.status(7).bytes()));
    EXPECT_EQ(message.getStatusDetail(), 0);
}

TEST(QelMessageGeneric, PayloadIsReplaced)
{
    QelMessageGeneric message = received(anyFrame().bytes());
    message.setData("wxyz", 4);
    EXPECT_EQ(frameOf(message), hex(anyFrame().payload({'w', 'x', 'y', 'z'}).bytes()));
    message.setData(message.getData() + 1, 2);
    EXPECT_EQ(frameOf(message), hex(anyFrame().payload({'x', 'y'}).bytes()));
    message.setData(nullptr, 0);
    EXPECT_EQ(frameOf(message), hex(anyFrame().payload({}).bytes()));
}

TEST(QelMessageGeneric, KeepsItsFrameWhenThePayloadIsRefused)
{
    QelMessageGeneric message = received(anyFrame().bytes());
    EXPECT_THAT([&] { message.setData(nullptr, 1); }, ThrowsMessage<std::invalid_argument>(StrEq("data")));
    EXPECT_THAT([&] { message.setData("x", 0xFFFFFFFF); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_EQ(frameOf(message), hex(anyFrame().bytes()));
}

TEST(QelMessageGeneric, AddsAStatusToATypedResponse)
{
    const MessageProbe response(anyFrame().status(0).statusDetail(0).bytes());
    QelMessageGeneric refused(response);
    refused.setStatus(QelMessageStatusInvalidData);
    EXPECT_EQ(frameOf(refused), hex(anyFrame().status(3).statusDetail(0).bytes()));
    EXPECT_EQ(response.getStatus(), QelMessageStatusNoError);
}

} // namespace
} // namespace qel
