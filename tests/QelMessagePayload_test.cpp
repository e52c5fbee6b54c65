#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <vector>

namespace qel {
namespace {

using test::bytes;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::letters;
using test::MessageProbe;
using test::payloadText;
using test::RawFrame;
using testing::StrEq;
using testing::ThrowsMessage;

TEST(QelMessage, NewPayloadIsZeroAndTheOldOneIsDropped)
{
    MessageProbe message(RawFrame::newForm().payload(letters(8)).bytes());
    char* const data = message.pAllocData(12);
    EXPECT_EQ(data, message.pGetData());
    EXPECT_EQ(hex(message.getData(), message.dataLength()), "000000000000000000000000");
    EXPECT_EQ(message.msgLength(), 44U);
}

TEST(QelMessage, NewPayloadOfZeroBytesIsNull)
{
    MessageProbe message(RawFrame::newForm().payload(letters(8)).bytes());
    EXPECT_EQ(message.pAllocData(0), nullptr);
    EXPECT_EQ(message.getData(), nullptr);
    EXPECT_EQ(message.dataLength(), 0U);
    EXPECT_EQ(message.msgLength(), 32U);
}

TEST(QelMessage, NewPayloadKeepsAllOtherFieldsOfANewHeader)
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0x11223344).function(0x6003).flags(0xC1).operation(0x0104).status(0x0007).statusDetail(0x5566);
    frame.reserved2(0x7788).reserved3(0x99AABBCC);
    MessageProbe message(RawFrame(frame).payload(letters(8)).pad(4).bytes());
    message.pAllocData(3);
    EXPECT_EQ(frameOf(message), hex(RawFrame(frame).payload(bytes({0, 0, 0})).pad(4).bytes()))
        << "a new frame keeps the pad it was received with";
}

TEST(QelMessage, NewPayloadKeepsTheOldFormAndPadsIt)
{
    RawFrame frame = RawFrame::oldForm();
    frame.callerId(0x11223344).function(0x6002).flags(0x40).operation(0x0402).status(0x0009);
    struct {
        unsigned int payload;
        unsigned int pad;
    } const cases[] = {{0, 16}, {1, 15}, {16, 0}, {17, 0}, {40, 0}};
    for (const auto& row : cases) {
        SCOPED_TRACE(row.payload);
        MessageProbe message(RawFrame(frame).payload(letters(3)).pad(20).bytes());
        message.pAllocData(row.payload);
        EXPECT_EQ(frameOf(message),
                  hex(RawFrame(frame).payload(std::vector<char>(row.payload, '\0')).pad(row.pad).bytes()));
    }
}

TEST(QelMessage, NewPayloadThatDoesNotFitChangesNothing)
{
    const std::vector<char> frames[] = {RawFrame::newForm().payload(letters(8)).bytes(),
                                        RawFrame::newForm().payload(letters(8)).pad(32).bytes(),
                                        RawFrame::oldForm().payload(letters(8)).bytes()};
    for (const std::vector<char>& frame : frames) {
        MessageProbe message(frame);
        const char* const before = message.serialize();
        for (const unsigned int length : {0xFFFFFFE8U, 0xFFFFFFFFU}) {
            EXPECT_THAT([&] { message.pAllocData(length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
            EXPECT_THAT([&] { message.pSetData("x", length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
        }
        EXPECT_EQ(message.serialize(), before);
        EXPECT_EQ(frameOf(message), hex(frame));
    }
}

TEST(QelMessage, SetPayloadCopiesTheBytes)
{
    MessageProbe message(std::uint64_t{2});
    const std::vector<char> data = bytes({0x00, 0xFF, 0x0A});
    message.pSetData(heapCopy(data).get(), 3);
    EXPECT_EQ(hex(message.getData(), message.dataLength()), "00FF0A");
    EXPECT_EQ(message.msgLength(), 35U);
    EXPECT_EQ(message.getCallerId(), 0x01020304U);
}

TEST(QelMessage, SetPayloadOfNoBytesClearsIt)
{
    MessageProbe message(std::uint64_t{2});
    message.pSetData(nullptr, 0);
    EXPECT_EQ(message.getData(), nullptr);
    EXPECT_EQ(message.msgLength(), 32U);

    message.pSetData("abc", 3);
    message.pSetData("abc", 0);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, SetPayloadFromNullWithALengthChangesNothing)
{
    const std::vector<char> frame = RawFrame::newForm().payload(letters(8)).bytes();
    MessageProbe message(frame);
    const char* const before = message.serialize();
    for (const unsigned int length : {1U, 100U, 0xFFFFFFFFU}) {
        EXPECT_THAT([&] { message.pSetData(nullptr, length); }, ThrowsMessage<std::invalid_argument>(StrEq("data")));
    }
    EXPECT_EQ(message.serialize(), before);
    EXPECT_EQ(frameOf(message), hex(frame));
}

TEST(QelMessage, SetPayloadCopiesFromItsOwnPayload)
{
    MessageProbe message(RawFrame::newForm().payload(letters(20)).bytes());
    message.pSetData(message.getData() + 5, 6);
    EXPECT_EQ(payloadText(message), "fghijk");
    message.pSetData(message.getData(), 6);
    EXPECT_EQ(payloadText(message), "fghijk");
}

} // namespace
} // namespace qel
