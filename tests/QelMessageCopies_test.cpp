#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include "support/Bytes.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"
#include "support/ScriptedStream.hpp"

#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <typeinfo>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::frameOf;
using test::heapCopy;
using test::hex;
using test::letters;
using test::MessageProbe;
using test::payloadText;
using test::RawFrame;
using test::ScriptedStream;
using testing::HasSubstr;
using testing::StartsWith;

// --- copying and assigning

TEST(QelMessage, CopiesTheWholeFrame)
{
    const std::vector<char> frame = RawFrame::newForm().callerId(7).payload(letters(12)).pad(3).bytes();
    const MessageProbe original(frame);
    const QelMessage copy(original);
    EXPECT_EQ(frameOf(copy), hex(frame));
    EXPECT_NE(copy.serialize(), original.serialize());
}

TEST(QelMessage, AssignmentReplacesAFrameOfAnySize)
{
    const MessageProbe longer(RawFrame::newForm().callerId(7).payload(letters(100)).bytes());
    const MessageProbe shorter(RawFrame::oldForm().callerId(8).bytes());
    QelMessage target;
    target = longer;
    EXPECT_EQ(frameOf(target), frameOf(longer));
    target = shorter;
    EXPECT_EQ(frameOf(target), frameOf(shorter));
    EXPECT_EQ(&(target = longer), &target);
}

// --- assignment to itself

void assignToItself(QelMessage& message)
{
    const QelMessage& itself = message;
    message = itself;
}

struct SelfAssignedCase {
    const char* name;
    std::vector<char> before;
    std::vector<char> after;
};

RawFrame identified(RawFrame frame)
{
    return frame.callerId(0x01020304).function(0x6003).flags(0xC1).operation(0x0104).status(0x0007);
}

class QelMessageSelfAssigned : public testing::TestWithParam<SelfAssignedCase> {
protected:
    void SetUp() override { assignToItself(mMessage); }

    MessageProbe mMessage{GetParam().before};
    const std::string mExpected = hex(GetParam().after);
};

INSTANTIATE_TEST_SUITE_P(
    , QelMessageSelfAssigned,
    testing::Values(
        SelfAssignedCase{"NewFormWithoutPayload", identified(RawFrame::newForm()).bytes(), RawFrame::newForm().bytes()},
        SelfAssignedCase{
            "NewFormWithPayloadAndPad",
            identified(RawFrame::newForm()).statusDetail(9).reserved2(8).payload(letters(40)).pad(3).bytes(),
            RawFrame::newForm().payload(std::vector<char>(40)).pad(3).bytes()},
        SelfAssignedCase{"OldFormWithoutPayload", identified(RawFrame::oldForm()).bytes(), RawFrame::oldForm().bytes()},
        SelfAssignedCase{"OldFormWithPayload", identified(RawFrame::oldForm()).payload(letters(5)).bytes(),
                         RawFrame::oldForm().payload(std::vector<char>(5)).bytes()},
        SelfAssignedCase{"OldFormWithoutPad", identified(RawFrame::oldForm()).payload(letters(30)).bytes(),
                         RawFrame::oldForm().payload(std::vector<char>(30)).bytes()}),
    [](const auto& row) { return std::string(row.param.name); });

TEST_P(QelMessageSelfAssigned, KeepsFormAndLengthsAndLosesEverythingElse) { EXPECT_EQ(frameOf(mMessage), mExpected); }

TEST_P(QelMessageSelfAssigned, IsAValidFrame)
{
    const std::unique_ptr<char[]> sent = heapCopy(mMessage.serialize(), mMessage.msgLength());
    EXPECT_EQ(frameOf(QelMessage(sent.get(), mMessage.msgLength())), mExpected);
}

TEST_P(QelMessageSelfAssigned, IsReadThroughEveryAccessor)
{
    const QelMessage& message = mMessage;
    EXPECT_EQ(message.getFunction(), QelMessageFunctionInvalid);
    EXPECT_EQ(message.getOperation(), QelMessageOpUnspecified);
    EXPECT_EQ(message.getFlags(), NoFlagSet);
    EXPECT_EQ(message.getClassification(), QelMessageClassification::Async);
    EXPECT_EQ(message.getStatus(), QelMessageStatusNoError);
    EXPECT_EQ(message.getStatusDetail(), 0);
    EXPECT_EQ(message.getCallerId(), 0U);
    EXPECT_NO_THROW(message.checkStatus());
    const unsigned int length = message.dataLength();
    if (length == 0) {
        EXPECT_EQ(message.getData(), nullptr);
    } else {
        EXPECT_EQ(hex(message.getData(), length), std::string(std::size_t{2} * length, '0'));
    }
}

TEST_P(QelMessageSelfAssigned, IsCopiedAndAssignedFrom)
{
    const QelMessage copy(mMessage);
    EXPECT_EQ(frameOf(copy), mExpected);
    EXPECT_EQ(frameOf(QelMessageGeneric(mMessage)), mExpected);
    EXPECT_EQ(frameOf(*static_cast<const QelMessage&>(mMessage).clone()), mExpected);
    QelMessage target;
    target = mMessage;
    EXPECT_EQ(frameOf(target), mExpected);
}

TEST_P(QelMessageSelfAssigned, IsPrinted)
{
    EXPECT_THAT(toString(mMessage.getLogID()), StartsWith("[CID: 0x00000000, FN: 0x0000, OP: 0x0000, FL: 0x00, DL: "));
    const std::string dump = toString(mMessage.debug());
    EXPECT_THAT(dump, HasSubstr("MsgLength:      " + toString(hexFormat(mMessage.msgLength())) + "\n"));
    EXPECT_THAT(dump, HasSubstr("Current raw message contents:\n DECA FF"));
}

TEST_P(QelMessageSelfAssigned, IsSentOverAStream)
{
    ScriptedStream stream;
    QelMessageRegistry registry;
    QelMessageStream(stream, registry).write(mMessage);
    EXPECT_EQ(hex(stream.written()), mExpected);
}

TEST_P(QelMessageSelfAssigned, IsResized)
{
    mMessage.pSetData("abc", 3);
    EXPECT_EQ(payloadText(mMessage), "abc");
    EXPECT_NE(mMessage.pAllocData(100), nullptr);
    EXPECT_EQ(payloadText(mMessage), std::string(100, '\0'));
    EXPECT_EQ(mMessage.pAllocData(0), nullptr);
}

TEST_P(QelMessageSelfAssigned, IsAssignedToItselfAgain)
{
    assignToItself(mMessage);
    EXPECT_EQ(frameOf(mMessage), mExpected);
}

TEST(QelMessage, GenericAssignedToItselfKeepsItsLengths)
{
    QelMessageGeneric message(MessageProbe(RawFrame::newForm().callerId(7).payload(letters(20)).bytes()));
    assignToItself(message);
    EXPECT_EQ(frameOf(message), hex(RawFrame::newForm().payload(std::vector<char>(20)).bytes()));
    message.setStatus(QelMessageStatusCmdFailed, 5);
    EXPECT_EQ(message.getStatusDetail(), 5);
}

// --- moving and cloning

TEST(QelMessage, MovingCopiesAndKeepsTheSource)
{
    const std::vector<char> frame = RawFrame::newForm().callerId(9).payload(letters(5)).bytes();
    MessageProbe source(frame);
    const QelMessage constructed(std::move(static_cast<QelMessage&>(source)));
    EXPECT_EQ(frameOf(constructed), hex(frame));
    EXPECT_EQ(frameOf(source), hex(frame));

    QelMessage assigned;
    assigned = std::move(static_cast<QelMessage&>(source));
    EXPECT_EQ(frameOf(assigned), hex(frame));
    EXPECT_EQ(frameOf(source), hex(frame));
}

TEST(QelMessage, CloneIsAPlainMessageWithTheSameFrame)
{
    const std::vector<char> frame = RawFrame::oldForm().callerId(9).payload(letters(5)).bytes();
    const MessageProbe probe(frame);
    const QelMessage message(probe);
    const std::unique_ptr<QelMessage> copy = message.clone();
    const QelMessage& copied = *copy;
    EXPECT_EQ(typeid(copied), typeid(QelMessage));
    EXPECT_NE(copy->serialize(), message.serialize());
    EXPECT_EQ(frameOf(*copy), hex(frame));
}

} // namespace
} // namespace qel
