#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

using test::frameOf;
using test::hex;
using test::letters;
using test::MessageProbe;
using test::payloadText;
using test::RawFrame;
using testing::StrEq;
using testing::ThrowsMessage;

const char* const kDefaultFrame = "DECAFF20" // eyecatcher, version
                                  "00000020" // frame length
                                  "00000000" // caller id
                                  "0000"     // function
                                  "00"       // flags
                                  "00"       // pad length
                                  "00000000" // payload length
                                  "0000"     // operation
                                  "0000"     // status
                                  "0000"     // status detail
                                  "0000"     // reserved
                                  "00000000";

TEST(QelMessage, DefinesTheSizesOfFrames)
{
    EXPECT_EQ(QelMessage::MtuMax, 16384U);
    EXPECT_EQ(QelMessage::Mtu::MtuMax, 16384U);
    EXPECT_EQ(QelMessage::MaxHeaderSize, 32U);
    EXPECT_EQ(QelMessage::MtuWexMax, 4096U);
    EXPECT_EQ(QelMessage::MaxWexPayloadSize, 4064U);
}

// --- building

TEST(QelMessage, BuiltByDefaultIsAHeaderOfZeros) { EXPECT_EQ(frameOf(QelMessage()), kDefaultFrame); }

TEST(QelMessage, BuiltFromArgumentsCarriesThem)
{
    const QelMessage message(0x01020304, 0x6003, 0x010B, MsgResponseExpected);
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000020"
                                "01020304"
                                "6003"
                                "80"
                                "00"
                                "00000000"
                                "010B"
                                "0000"
                                "0000"
                                "0000"
                                "00000000");
    EXPECT_EQ(message.getCallerId(), 0x01020304U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionQelInterfaceCmp);
    EXPECT_EQ(message.getOperation(), QelMessageOpGetGlobalSaveAreaMetadata);
    EXPECT_EQ(message.getFlags(), MsgResponseExpected);
    EXPECT_EQ(message.getStatus(), QelMessageStatusNoError);
    EXPECT_EQ(message.getStatusDetail(), 0);
    EXPECT_EQ(message.msgLength(), 32U);
    EXPECT_EQ(message.dataLength(), 0U);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, BuiltWithAPayloadLengthHasThatManyZeros)
{
    const MessageProbe message(std::uint64_t{5});
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000025"
                                "01020304"
                                "6003"
                                "80"
                                "00"
                                "00000005"
                                "0101"
                                "0000"
                                "0000"
                                "0000"
                                "00000000"
                                "0000000000");
    EXPECT_EQ(message.getData(), message.serialize() + 32);
}

TEST(QelMessage, BuiltWithAPayloadLengthOfZeroHasNoPayload)
{
    const MessageProbe message(std::uint64_t{0});
    EXPECT_EQ(message.msgLength(), 32U);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, IsNotBuiltLongerThanTheLengthFieldHolds)
{
    const std::uint64_t lengths[] = {0xFFFFFFE0, 0xFFFFFFFF, 0x100000000, 0x100000020,
                                     std::numeric_limits<std::uint64_t>::max()};
    for (const std::uint64_t length : lengths) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { MessageProbe message(length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
    }
}

TEST(QelMessage, CanBeLongerThanAStreamAccepts)
{
    const MessageProbe built(std::uint64_t{65581});
    EXPECT_EQ(built.msgLength(), 65613U);
    const std::vector<char> received = RawFrame::newForm().payload(letters(QelMessage::MtuMax)).bytes();
    EXPECT_EQ(MessageProbe(received).msgLength(), 16416U);
}

// --- reading

TEST(QelMessage, ReadsEveryFieldOfANewHeader)
{
    const MessageProbe message(RawFrame::newForm()
                                   .callerId(0xF1E2D3C4)
                                   .function(0x7000)
                                   .operation(0xA005)
                                   .flags(0xFF)
                                   .status(0x8006)
                                   .statusDetail(0x1234)
                                   .payload(letters(4))
                                   .pad(2)
                                   .bytes());
    EXPECT_EQ(message.getCallerId(), 0xF1E2D3C4U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionDax);
    EXPECT_EQ(message.getOperation(), QelMessageOpSendVirtualSerialSessionClosed);
    EXPECT_EQ(message.getFlags(), 0xFF);
    EXPECT_EQ(message.getStatus(), QelMessageStatusHypervisorGenericError);
    EXPECT_EQ(message.getStatusDetail(), 0x1234);
    EXPECT_EQ(message.msgLength(), 38U);
    EXPECT_EQ(message.dataLength(), 4U);
    EXPECT_EQ(payloadText(message), "abcd");
}

TEST(QelMessage, ReadsEveryFieldOfAnOldHeader)
{
    const MessageProbe message(RawFrame::oldForm()
                                   .callerId(0xF1E2D3C4)
                                   .function(0x6002)
                                   .operation(0x0402)
                                   .flags(0x80)
                                   .status(19)
                                   .payload(letters(4))
                                   .bytes());
    EXPECT_EQ(message.getCallerId(), 0xF1E2D3C4U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionVirtualSerial);
    EXPECT_EQ(message.getOperation(), QelMessageOpOpenVirtualSerialSession);
    EXPECT_EQ(message.getFlags(), MsgResponseExpected);
    EXPECT_EQ(message.getStatus(), QelMessageStatusConnectionNotAvailable);
    EXPECT_EQ(message.getStatusDetail(), 0) << "the old form has no such field";
    EXPECT_EQ(message.msgLength(), 40U);
    EXPECT_EQ(message.dataLength(), 4U);
    EXPECT_EQ(payloadText(message), "abcd");
}

TEST(QelMessage, DerivesItsClassificationFromTheFlags)
{
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponseExpected).getClassification(), QelMessageClassification::Request);
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponse).getClassification(), QelMessageClassification::Response);
    EXPECT_EQ(QelMessage(1, 2, 3, NoFlagSet).getClassification(), QelMessageClassification::Async);
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponse | MsgResponseExpected).getClassification(),
              QelMessageClassification::Unknown);
}

TEST(QelMessage, AccessorsReturnTypesThatPrintNames)
{
    const QelMessage message;
    static_assert(std::is_same<decltype(message.getFunction()), QelMessageFunctionCodes>::value, "");
    static_assert(std::is_same<decltype(message.getOperation()), QelMessageOpTypes>::value, "");
    static_assert(std::is_same<decltype(message.getFlags()), QelMessageFlags>::value, "");
    static_assert(std::is_same<decltype(message.getStatus()), QelMessageStatusCodes>::value, "");
    std::ostringstream os;
    os << message.getFunction();
    EXPECT_EQ(os.str(), "0x0000 (QelMessageFunctionInvalid)");
}

TEST(QelMessage, LetsDerivedClassesAccessTheFrameInPlace)
{
    MessageProbe newForm(RawFrame::newForm().payload(letters(4)).bytes());
    EXPECT_EQ(newForm.pGetMessage(), newForm.serialize());
    EXPECT_EQ(static_cast<const void*>(newForm.pGetHeader()), newForm.serialize());
    EXPECT_EQ(static_cast<const void*>(newForm.pGetExtendedHeader()), newForm.serialize() + 24);
    EXPECT_EQ(newForm.pGetData(), newForm.serialize() + 32);
    EXPECT_EQ(static_cast<const void*>(&newForm.pPayload<be_uint32_t>()), newForm.serialize() + 32);
    EXPECT_EQ(newForm.pPayload<be_uint32_t>().value(), 0x61626364U);

    MessageProbe oldForm(RawFrame::oldForm().payload(letters(4)).bytes());
    EXPECT_EQ(oldForm.pGetExtendedHeader(), nullptr);
    EXPECT_EQ(oldForm.pGetData(), oldForm.serialize() + 24);
    EXPECT_EQ(oldForm.pPayload<be_uint32_t>().value(), 0x61626364U);

    const MessageProbe& constant = oldForm;
    EXPECT_EQ(constant.pGetMessage(), oldForm.serialize());
    EXPECT_EQ(static_cast<const void*>(constant.pGetHeader()), oldForm.serialize());
    EXPECT_EQ(constant.pGetExtendedHeader(), nullptr);
    EXPECT_EQ(constant.pGetData(), oldForm.serialize() + 24);
    EXPECT_EQ(constant.pPayload<be_uint32_t>().value(), 0x61626364U);

    const MessageProbe empty;
    EXPECT_EQ(empty.pGetData(), nullptr);
}

TEST(QelMessage, WritesThroughTheHeaderInPlace)
{
    MessageProbe message;
    message.pGetHeader()->mStatus = QelMessageStatusCmdFailed;
    message.pGetExtendedHeader()->mStatusDetail = 0xBEEF;
    EXPECT_EQ(message.getStatus(), QelMessageStatusCmdFailed);
    EXPECT_EQ(message.getStatusDetail(), 0xBEEF);
    EXPECT_EQ(hex(message.serialize() + 22, 4), "0006BEEF");
}

TEST(QelMessage, ThrowsOutOfRangeWhenTheVersionIsChangedToAnInvalidOne)
{
    MessageProbe message(std::uint64_t{4});
    message.pGetHeader()->mHeaderVersion = 0x10;
    EXPECT_THROW(message.pGetHeader()->getHeaderLength(), std::out_of_range);
    EXPECT_THROW(message.getData(), std::out_of_range);
    EXPECT_THROW(message.pAllocData(3), std::out_of_range);
}

// --- status

TEST(QelMessage, PassesTheStatusCheckWithStatus0) { EXPECT_NO_THROW(QelMessage().checkStatus()); }

TEST(QelMessage, FailsTheStatusCheckWithAnyOtherStatus)
{
    for (const unsigned int status : {1U, 5U, 0x8006U, 0xFFFFU}) {
        SCOPED_TRACE(status);
        const MessageProbe message(RawFrame::newForm().status(status).bytes());
        EXPECT_THROW(message.checkStatus(), QelMessageStatusException);
    }
}

TEST(QelMessage, StatusCheckIgnoresTheDetail)
{
    EXPECT_NO_THROW(MessageProbe(RawFrame::newForm().statusDetail(7).bytes()).checkStatus());
}

} // namespace
} // namespace qel
