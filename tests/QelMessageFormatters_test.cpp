#include <qel/common/QelMessageFormatters.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/GroupingLocale.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <string>

namespace qel {
namespace {

using test::bytes;
using test::GroupingLocale;
using test::MessageProbe;
using test::RawFrame;
using testing::EndsWith;

/// A message class that prints two payload lines.
class TalkativeMessage : public MessageProbe {
public:
    using MessageProbe::MessageProbe;

protected:
    void pDerivedDebug(std::ostream& os) const override
    {
        os << " length:  " << decFormat(dataLength()) << '\n' << " first:   " << hexFormat(getData()[0]) << '\n';
    }
};

RawFrame request()
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0xABCDEF01).function(0x6003).operation(0x010A).flags(0x80).status(9).statusDetail(0x00FE);
    return frame;
}

// --- one line

TEST(QelMessageIDFormatter, PrintsRawNumbers)
{
    const MessageProbe message(request().payload(std::vector<char>(48, 'x')).bytes());
    EXPECT_EQ(toString(message.getLogID()),
              "[CID: 0xABCDEF01, FN: 0x6003, OP: 0x010A, FL: 0x80, DL: 48, ST: 0x00000009:00FE]");
}

TEST(QelMessageIDFormatter, PrintsADefaultMessage)
{
    EXPECT_EQ(toString(QelMessage().getLogID()),
              "[CID: 0x00000000, FN: 0x0000, OP: 0x0000, FL: 0x00, DL: 0, ST: 0x00000000:0000]");
}

TEST(QelMessageIDFormatter, PrintsNoDetailForAnOldHeader)
{
    const MessageProbe message(RawFrame::oldForm().callerId(5).function(0x6002).operation(0x0402).status(0x13).bytes());
    EXPECT_EQ(toString(message.getLogID()),
              "[CID: 0x00000005, FN: 0x6002, OP: 0x0402, FL: 0x00, DL: 0, ST: 0x00000013]");
}

TEST(QelMessageIDFormatter, PrintsAllFlagBits)
{
    const MessageProbe message(request().flags(0xFF).bytes());
    EXPECT_EQ(toString(message.getLogID()),
              "[CID: 0xABCDEF01, FN: 0x6003, OP: 0x010A, FL: 0xFF, DL: 0, ST: 0x00000009:00FE]");
}

TEST(QelMessageIDFormatter, PrintsTheLengthInDecimalOnAStreamLeftInHexadecimal)
{
    const MessageProbe message(request().payload(std::vector<char>(200, 'x')).bytes());
    std::ostringstream os;
    os << hexFormat(1) << QelMessageIDFormatter(&message);
    EXPECT_EQ(os.str(), "0x00000001[CID: 0xABCDEF01, FN: 0x6003, OP: 0x010A, FL: 0x80, DL: 200, ST: 0x00000009:00FE]");
}

TEST(QelMessageIDFormatter, ReadsTheMessageWhenItIsPrinted)
{
    MessageProbe message;
    const QelMessageIDFormatter formatter = message.getLogID();
    message.pAllocData(7);
    EXPECT_EQ(toString(formatter), "[CID: 0x00000000, FN: 0x0000, OP: 0x0000, FL: 0x00, DL: 7, ST: 0x00000000:0000]");
}

// --- everything

TEST(QelMessageIDFormatter, LeavesTheStreamInUpperCaseHexadecimal)
{
    std::ostringstream os;
    os << QelMessage().getLogID() << ' ' << 0xABC;
    EXPECT_THAT(os.str(), EndsWith("] ABC"));
}

TEST(QelMessageIDFormatter, GroupsDigitsOnAStreamWithAGroupingLocale)
{
    const GroupingLocale grouping;
    std::ostringstream os;
    os << QelMessage(0x12345678, 0x6003, 0x0101, MsgResponseExpected).getLogID();
    EXPECT_EQ(os.str(), "[CID: 0x12.345.678, FN: 0x6.003, OP: 0x0101, FL: 0x80, DL: 0, ST: 0x00000000:0000]");
}

TEST(QelMessageDebugFormatter, PrintsADefaultMessage)
{
    EXPECT_EQ(toString(QelMessage().debug()), "\n"
                                              "EyeCatcher:     0xDECAFF20\n"
                                              "MsgLength:      0x00000020\n"
                                              "CallerId:       0x00000000\n"
                                              "Function:       0x0000 (QelMessageFunctionInvalid)\n"
                                              "Operation:      0x0000 (unknown operation for function 0x0000)\n"
                                              "Flags:          0x00 (no flags set)\n"
                                              "PadByteLen:     0x00\n"
                                              "DataLength:     0x00000000\n"
                                              "Status:         0x00000000 (QelMessageStatusNoError)\n"
                                              "StatusDetail:   0x0000\n"
                                              "\n"
                                              "Additional message details:\n"
                                              "    <no additional details>\n"
                                              "\n"
                                              "Current raw message contents:\n"
                                              " DECA FF20 0000 0020 0000 0000 0000 0000\n"
                                              " 0000 0000 0000 0000 0000 0000 0000 0000\n"
                                              "\n");
}

TEST(QelMessageDebugFormatter, PrintsEveryFieldOfANewHeader)
{
    const MessageProbe message(request().payload(bytes({0xAB, 0xCD, 0xEF, 0x01, 0x02})).pad(2).bytes());
    EXPECT_EQ(toString(message.debug()), "\n"
                                         "EyeCatcher:     0xDECAFF20\n"
                                         "MsgLength:      0x00000027\n"
                                         "CallerId:       0xABCDEF01\n"
                                         "Function:       0x6003 (QelMessageFunctionQelInterfaceCmp)\n"
                                         "Operation:      0x010A (QelMessageOpSetGlobalSaveAreaMetadata)\n"
                                         "Flags:          0x80 (MsgResponseExpected)\n"
                                         "PadByteLen:     0x02\n"
                                         "DataLength:     0x00000005\n"
                                         "Status:         0x00000009 (QelMessageStatusVttyBufferFull)\n"
                                         "StatusDetail:   0x00FE\n"
                                         "\n"
                                         "Additional message details:\n"
                                         "    <no additional details>\n"
                                         "\n"
                                         "Current raw message contents:\n"
                                         " DECA FF20 0000 0027 ABCD EF01 6003 8002\n"
                                         " 0000 0005 010A 0009 00FE 0000 0000 0000\n"
                                         " ABCD EF01 0200 00\n"
                                         "\n");
}

TEST(QelMessageDebugFormatter, PrintsAnOldHeaderWithoutDetail)
{
    const MessageProbe message(
        RawFrame::oldForm().callerId(6).function(0x7000).operation(0x0001).flags(0xC0).status(5).bytes());
    EXPECT_EQ(toString(message.debug()), "\n"
                                         "EyeCatcher:     0xDECAFF00\n"
                                         "MsgLength:      0x00000028\n"
                                         "CallerId:       0x00000006\n"
                                         "Function:       0x7000 (QelMessageFunctionDax)\n"
                                         "Operation:      0x0001 (unknown operation for function 0x7000)\n"
                                         "Flags:          0xC0 (MsgResponse, MsgResponseExpected)\n"
                                         "PadByteLen:     0x10\n"
                                         "DataLength:     0x00000000\n"
                                         "Status:         0x00000005 (unknown status code)\n"
                                         "\n"
                                         "Additional message details:\n"
                                         "    <no additional details>\n"
                                         "\n"
                                         "Current raw message contents:\n"
                                         " DECA FF00 0000 0028 0000 0006 7000 C010\n"
                                         " 0000 0000 0001 0005 0000 0000 0000 0000\n"
                                         " 0000 0000 0000 0000\n"
                                         "\n");
}

TEST(QelMessageDebugFormatter, PrintsThePayloadFieldsOfTheType)
{
    const TalkativeMessage message(RawFrame::newForm().payload(bytes({0x41, 0x42})).bytes());
    EXPECT_EQ(toString(QelMessageDebugFormatter(&message)),
              "\n"
              "EyeCatcher:     0xDECAFF20\n"
              "MsgLength:      0x00000022\n"
              "CallerId:       0x00000000\n"
              "Function:       0x0000 (QelMessageFunctionInvalid)\n"
              "Operation:      0x0000 (unknown operation for function 0x0000)\n"
              "Flags:          0x00 (no flags set)\n"
              "PadByteLen:     0x00\n"
              "DataLength:     0x00000002\n"
              "Status:         0x00000000 (QelMessageStatusNoError)\n"
              "StatusDetail:   0x0000\n"
              "\n"
              "Additional message details:\n"
              " length:  2\n"
              " first:   0x41\n"
              "\n"
              "\n"
              "Current raw message contents:\n"
              " DECA FF20 0000 0022 0000 0000 0000 0000\n"
              " 0000 0002 0000 0000 0000 0000 0000 0000\n"
              " 4142\n"
              "\n");
}

TEST(QelMessageDebugFormatter, PrintsTheSameTwice)
{
    const MessageProbe message(request().payload(bytes({1, 2, 3})).bytes());
    std::ostringstream os;
    os << message.debug();
    const std::string once = os.str();
    os << message.debug();
    EXPECT_EQ(os.str(), once + once) << "the text must not depend on stream state or addresses";
}

} // namespace
} // namespace qel
