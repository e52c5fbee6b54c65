// The frames of the tester: built and taken apart without the message classes, so they are compared with those here.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "check/Case.hpp"
#include "check/Frame.hpp"
#include "check/Messages.hpp"
#include "support/GoldenFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace qel::test {

namespace {

using namespace tool::check;
using testing::HasSubstr;
using testing::ThrowsMessage;

constexpr std::uint32_t kId = 0x12345678;

/// The frame that the library builds for the same message, with the same caller id.
std::string libraryFrame(const QelMessage& message)
{
    std::string bytes(message.serialize(), message.msgLength());
    return bytes.replace(8, 4, bigEndian32(kId));
}

std::string own(Draft draft) { return draft.callerId(kId).bytes(); }

TEST(CheckDraft, BuildsTheFramesOfTheLibrary)
{
    EXPECT_EQ(own(versionRequest(7, "tool")),
              libraryFrame(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 7, 1, 0, "tool")));
    EXPECT_EQ(own(openSession()), libraryFrame(QelMessageInterfaceCmpOpenKrogSessionReq()));
    EXPECT_EQ(own(closeSession()), libraryFrame(QelMessageInterfaceCmpCloseKrogSessionReq()));
    EXPECT_EQ(own(limitsRequest()), libraryFrame(QelMessageGetInterfaceLimitsReq()));
    EXPECT_EQ(own(timeRequest()), libraryFrame(QelMessageGetQelTodReq()));
    EXPECT_EQ(own(interfaceRequest(kGetMode)), libraryFrame(QelMessageGetGlobalModeAttributeReq()));
    EXPECT_EQ(own(interfaceRequest(kGetMetadata)), libraryFrame(QelMessageGetGlobalSaveAreaMetadataReq()));
    EXPECT_EQ(own(capabilitiesRequest(4, std::string("\x80\0\0\x01", 4))),
              libraryFrame(QelMessageExchIntCapabilitiesReq(QelCapabilities("10000000000000000000000000000001"))));
    EXPECT_EQ(own(setMode(5, "QX")), libraryFrame(QelMessageSetGlobalModeAttributeReq(5, "QX")));
    EXPECT_EQ(own(setMetadata("m")), libraryFrame(QelMessageSetGlobalSaveAreaMetadataReq("m")));
    EXPECT_EQ(own(unicast(9, "other", "hello")), libraryFrame(QelMessageDaxBroadcastReq(1, 5, 9, "other", "hello")));
}

TEST(CheckDraft, BuildsTheSerialFramesOfTheLibrary)
{
    EXPECT_EQ(own(openSerial(3, 2)), libraryFrame(QelMessageVirtualSerialOpenReq(3, 2, false)));
    EXPECT_EQ(own(openSerial(3, 2, 0x8000)), libraryFrame(QelMessageVirtualSerialOpenReq(3, 2, true)));
    EXPECT_EQ(own(closeSerial(3, 2)), libraryFrame(QelMessageVirtualSerialCloseReq(3, 2, false)));
    EXPECT_EQ(own(closeSerial(3, 2, 0xFF)), libraryFrame(QelMessageVirtualSerialCloseReq(3, 2, true)));
    EXPECT_EQ(own(setUpSerial(3, 2)), libraryFrame(QelMessageVirtualSerialSetupSessionReq(3, 2)));
    EXPECT_EQ(own(maxSerial()), libraryFrame(QelMessageVirtualSerialGetMaxSessionsReq()));
    EXPECT_EQ(own(dataToPartition(3, 2, "abc")), libraryFrame(QelMessageVirtualSerialDataToOsAsync(3, 2, 3, "abc")));
}

TEST(CheckDraft, ChangesSingleFields)
{
    const Draft plain = limitsRequest().payload("data");
    EXPECT_EQ(Draft(plain).msgLength(0x01020304).bytes().substr(4, 4), "\x01\x02\x03\x04");
    EXPECT_EQ(Draft(plain).dataLength(0x01020304).bytes().substr(16, 4), "\x01\x02\x03\x04");
    EXPECT_EQ(Draft(plain).flags(0xA5).bytes()[14], '\xA5');
    EXPECT_EQ(Draft(plain).padField(7).bytes().size(), 36U);
    EXPECT_EQ(Draft(plain).padField(7).bytes()[15], '\x07');
    EXPECT_EQ(Draft(plain).pad(2, 'p').bytes().substr(32), "datapp");
    EXPECT_EQ(Draft(plain).pad(2, 'p').bytes().substr(4, 4), std::string("\0\0\0\x26", 4));
    EXPECT_EQ(Draft(plain).byte(31, 0x0B).bytes()[31], '\x0B');
}

TEST(CheckDraft, PadsTheOldHeader)
{
    EXPECT_EQ(limitsRequest().old().bytes().size(), 40U);
    EXPECT_EQ(limitsRequest().old().bytes()[15], 16);
    EXPECT_EQ(limitsRequest().old().payload(std::string(16, 'x')).bytes().size(), 40U);
    EXPECT_EQ(limitsRequest().old().payload(std::string(17, 'x')).bytes().size(), 41U);
    EXPECT_EQ(limitsRequest().old().payload(std::string(17, 'x')).bytes()[15], 0);
}

TEST(CheckFrame, TakesEveryGoldenFrameApartAsTheLibraryDoes)
{
    for (const std::string& name : GoldenFrame::allNames()) {
        SCOPED_TRACE(name);
        const auto golden = GoldenFrame::load(name).bytes();
        const std::string bytes(golden.begin(), golden.end());
        const QelMessage message(bytes.data(), static_cast<unsigned int>(bytes.size()));
        const Frame frame = parseFrame(bytes);
        EXPECT_EQ(frame.callerId, message.getCallerId());
        EXPECT_EQ(frame.function, message.getFunction());
        EXPECT_EQ(frame.operation, message.getOperation());
        EXPECT_EQ(frame.flags, message.getFlags());
        EXPECT_EQ(frame.status, message.getStatus());
        EXPECT_EQ(frame.statusDetail, message.getStatusDetail());
        EXPECT_EQ(frame.payload, std::string(message.dataLength() == 0 ? "" : message.getData(), message.dataLength()));
        EXPECT_EQ(frame.isResponse(), message.getClassification() == QelMessageClassification::Response);
        EXPECT_EQ(frame.isNotice(), message.getClassification() == QelMessageClassification::Async);
    }
}

TEST(CheckFrame, RefusesAMalformedFrame)
{
    const auto parse = [](const Draft& draft) {
        return [bytes = draft.bytes()] { static_cast<void>(parseFrame(bytes)); };
    };
    EXPECT_THAT(parse(timeRequest().byte(1, 0)), ThrowsMessage<Failure>(HasSubstr("its eyecatcher is wrong")));
    EXPECT_THAT(parse(timeRequest().byte(3, 1)), ThrowsMessage<Failure>(HasSubstr("its header version is 0x01")));
    EXPECT_THAT(parse(timeRequest().dataLength(1)), ThrowsMessage<Failure>(HasSubstr("its lengths contradict")));
    EXPECT_THAT(parse(timeRequest().msgLength(33)), ThrowsMessage<Failure>(HasSubstr("its lengths contradict")));
    EXPECT_THAT(parse(timeRequest().old().pad(15)), ThrowsMessage<Failure>(HasSubstr("its pad is too short")));
    EXPECT_THAT([] { static_cast<void>(parseFrame(std::string(23, 'x'))); },
                ThrowsMessage<Failure>(HasSubstr("it is shorter than a header")));
}

TEST(CheckFrame, IntegersBeyondThePayloadAreZero)
{
    Frame frame;
    frame.payload = "\x01\x02\x03";
    EXPECT_EQ(frame.byteAt(2), 3U);
    EXPECT_EQ(frame.byteAt(3), 0U);
    EXPECT_EQ(frame.u16At(1), 0x0203U);
    EXPECT_EQ(frame.u32At(0), 0x01020300U);
}

TEST(CheckFrame, IsDescribedInOneLine)
{
    EXPECT_EQ(describeFrame(timeRequest().callerId(5).bytes()),
              "request 0x6003/0x0107 GetQelTod, id 0x00000005, 32 bytes");
    EXPECT_EQ(describeFrame(Draft::response(0x6003, 0x0102).byte(23, 23).bytes()),
              "response 0x6003/0x0102 OpenKrogSession, id 0x00000000, status 23, 32 bytes");
    EXPECT_EQ(describeFrame(Draft::notice(0x1234, 0x5678).old().bytes()),
              "notice 0x1234/0x5678, id 0x00000000, old header, 40 bytes");
    EXPECT_EQ(describeFrame(timeRequest().flags(0xC0).bytes()),
              "request and response 0x6003/0x0107 GetQelTod, id 0x00000000, 32 bytes");
    EXPECT_EQ(describeFrame(timeRequest().dataLength(9).bytes()),
              "request 0x6003/0x0107 GetQelTod, id 0x00000000, 32 bytes: i_buffer bad MsgLength in header");
    EXPECT_EQ(describeFrame("x"), "1 byte: 78");
    EXPECT_EQ(describeFrame(std::string(17, 'x')), "17 bytes: 78787878787878787878787878787878...");
}

TEST(CheckFrame, NamesAStatus)
{
    EXPECT_EQ(statusText(0), "0 (QelMessageStatusNoError)");
    EXPECT_EQ(statusText(23), "23 (QelMessageStatusKrogSessionAlreadyOpen)");
    EXPECT_EQ(statusText(5), "5 (unknown status code)");
}

} // namespace

} // namespace qel::test
