#include "base/Failures.hpp"
#include "decode/DecodeCommand.hpp"
#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"

#include <fstream>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::CommandFailure;
using tool::decodeFrames;
using tool::ExitStatus;
using tool::FrameNotation;
using Json = nlohmann::ordered_json;

/// The whole frame of a session-closed notice, and what is printed for it.
const char* const kClosedHex = "DECAFF20 00000028 A0B1C2D3 7000 00 00 00000008 A005 0000 0000 0000 00000000"
                               "1D1E 1F20 00000004";
const char* const kClosedText = "[CID: 0xA0B1C2D3, FN: 0x7000, OP: 0xA005, FL: 0x00, DL: 8, ST: 0x00000000:0000]\n"
                                "\n"
                                "EyeCatcher:     0xDECAFF20\n"
                                "MsgLength:      0x00000028\n"
                                "CallerId:       0xA0B1C2D3\n"
                                "Function:       0x7000 (QelMessageFunctionDax)\n"
                                "Operation:      0xA005 (QelMessageOpSendVirtualSerialSessionClosed)\n"
                                "Flags:          0x00 (no flags set)\n"
                                "PadByteLen:     0x00\n"
                                "DataLength:     0x00000008\n"
                                "Status:         0x00000000 (QelMessageStatusNoError)\n"
                                "StatusDetail:   0x0000\n"
                                "\n"
                                "Additional message details:\n"
                                "  Data:\n"
                                "      LPID:               7454\n"
                                "      VSS connection num: 7968\n"
                                "      Close reason:       4\n"
                                "\n"
                                "\n"
                                "Current raw message contents:\n"
                                " DECA FF20 0000 0028 A0B1 C2D3 7000 0000\n"
                                " 0000 0008 A005 0000 0000 0000 0000 0000\n"
                                " 1D1E 1F20 0000 0004\n"
                                "\n";

std::string closedFrame() { return GoldenFrame::load("QelMessageVirtualSerialSessionClosedAsync").bytes(); }

class DecodeCommandTest : public ::testing::Test {
protected:
    ExitStatus decode(const std::string& text, bool json = false, FrameNotation notation = FrameNotation::Guess)
    {
        std::istringstream input(text);
        output.str("");
        errors.str("");
        return decodeFrames(input, notation, json, output, errors);
    }
    Json decodeToJson(const std::string& text)
    {
        decode(text, true);
        return Json::parse(output.str());
    }

    CapturedLog log{LogLevel::Critical};
    std::ostringstream output;
    std::ostringstream errors;
};

TEST_F(DecodeCommandTest, PrintsOffsetIdAndDumpOfAFrame)
{
    EXPECT_EQ(decode(closedFrame()), ExitStatus::Done);
    EXPECT_EQ(output.str(), std::string("frame at offset 0, 40 bytes\n") + kClosedText);
    EXPECT_EQ(errors.str(), "");
}

TEST_F(DecodeCommandTest, PrintsEveryFrame)
{
    EXPECT_EQ(decode(closedFrame() + closedFrame()), ExitStatus::Done);
    EXPECT_EQ(output.str(), std::string("frame at offset 0, 40 bytes\n") + kClosedText +
                                "frame at offset 40, 40 bytes\n" + kClosedText);
}

TEST_F(DecodeCommandTest, ReadsHexadecimalText)
{
    EXPECT_EQ(decode(kClosedHex), ExitStatus::Done);
    EXPECT_EQ(output.str(), std::string("frame at offset 0, 40 bytes\n") + kClosedText);
}

TEST_F(DecodeCommandTest, OffsetsCountBytesNotDigits)
{
    EXPECT_EQ(decode(std::string("# two of them\n") + kClosedHex + "\n0x28: " + kClosedHex), ExitStatus::Refused);
    EXPECT_EQ(decode(std::string("# two of them\n") + kClosedHex + "\n28: " + kClosedHex), ExitStatus::Done);
    EXPECT_THAT(output.str(), HasSubstr("frame at offset 40, 40 bytes\n"));
}

TEST_F(DecodeCommandTest, EmptyInputIsDone)
{
    for (const FrameNotation notation : {FrameNotation::Guess, FrameNotation::Raw, FrameNotation::Hex}) {
        EXPECT_EQ(decode("", false, notation), ExitStatus::Done);
        EXPECT_EQ(output.str(), "");
        EXPECT_EQ(errors.str(), "");
    }
    EXPECT_EQ(decode("", true), ExitStatus::Done);
    EXPECT_EQ(output.str(), "{\n  \"frames\": [],\n  \"bad\": []\n}\n");
}

TEST_F(DecodeCommandTest, ReportsABadFrameAndPrintsTheNext)
{
    std::string bad = closedFrame();
    bad[3] = '\x21';
    EXPECT_EQ(decode(closedFrame() + bad + closedFrame()), ExitStatus::Refused);
    EXPECT_EQ(output.str(), std::string("frame at offset 0, 40 bytes\n") + kClosedText +
                                "frame at offset 80, 40 bytes\n" + kClosedText);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 40: i_buffer bad header version\n");
}

TEST_F(DecodeCommandTest, ReportsGarbage)
{
    EXPECT_EQ(decode("\x01 is no frame"), ExitStatus::Refused);
    EXPECT_EQ(output.str(), "");
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: i_buffer bad eyecatcher\n");
    EXPECT_EQ(decode("no frame"), ExitStatus::Refused);
    EXPECT_EQ(output.str(), "");
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: line 1: 'n' is not a hexadecimal digit\n");
}

TEST_F(DecodeCommandTest, ReportsATruncatedFrame)
{
    EXPECT_EQ(decode(closedFrame() + closedFrame().substr(0, 5)), ExitStatus::Refused);
    EXPECT_EQ(errors.str(),
              "qel: bad frame at offset 40: the input ends after 5 of 8 bytes that hold the length of a frame\n");
    EXPECT_EQ(decode(closedFrame() + closedFrame().substr(0, 39)), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 40: the input ends after 39 of 40 bytes\n");
}

TEST_F(DecodeCommandTest, PrintsAndReportsAMalformedPayload)
{
    std::string cut = closedFrame(); // one byte of payload less, and lengths to match
    cut.pop_back();
    cut[7] = 39;
    cut[19] = 7;
    EXPECT_EQ(decode(cut), ExitStatus::Refused);
    EXPECT_THAT(output.str(), HasSubstr("frame at offset 0, 39 bytes\n"));
    EXPECT_THAT(output.str(), HasSubstr("    <no additional details>\n"));
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: dataLength shorter than actual data size\n");
}

TEST_F(DecodeCommandTest, ReportsMistakesInTheText)
{
    EXPECT_EQ(decode(std::string(kClosedHex) + "\nDECAFF2g"), ExitStatus::Refused);
    EXPECT_EQ(output.str(), std::string("frame at offset 0, 40 bytes\n") + kClosedText);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 40: line 2: 'g' is not a hexadecimal digit\n");
    EXPECT_EQ(decode("DECAFF20 00000028\nx"), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: line 2: 'x' is not a hexadecimal digit\n");
}

TEST_F(DecodeCommandTest, TheFormCanBeGiven)
{
    EXPECT_EQ(decode(kClosedHex, false, FrameNotation::Hex), ExitStatus::Done);
    EXPECT_EQ(decode(kClosedHex, false, FrameNotation::Raw), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: i_buffer bad eyecatcher\n");
    EXPECT_EQ(decode(closedFrame(), false, FrameNotation::Raw), ExitStatus::Done);
    EXPECT_EQ(decode(closedFrame(), false, FrameNotation::Hex), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: bad frame at offset 0: line 1: '\\xde' is not a hexadecimal digit\n");
}

TEST_F(DecodeCommandTest, EscapesTextsOfAFrame)
{
    std::string frame = GoldenFrame::load("QelMessageSetGlobalSaveAreaMetadataReq").bytes();
    ASSERT_EQ(frame.size(), 43U);
    frame.replace(34, 9, std::string("\x1B[2J\\\r\0\x7F\xFE", 9));
    EXPECT_EQ(decode(frame), ExitStatus::Done);
    EXPECT_THAT(output.str(), HasSubstr(" mMetadata    \\x1b[2J\\\\\\x0d\\x00\\x7f\\xfe\n"));
    for (const char c : output.str())
        EXPECT_TRUE(c == '\n' || (c >= ' ' && c <= '~')) << int{c};
}

TEST_F(DecodeCommandTest, AllGoldenFramesAreGood)
{
    std::string all;
    std::size_t count = 0;
    for (const std::string& name : GoldenFrame::allNames()) {
        all += GoldenFrame::load(name).bytes();
        ++count;
    }
    EXPECT_EQ(decode(all), ExitStatus::Done);
    EXPECT_EQ(errors.str(), "");
    const Json document = decodeToJson(all);
    EXPECT_EQ(document["frames"].size(), count);
    EXPECT_THAT(document["bad"], IsEmpty());
}

TEST_F(DecodeCommandTest, JsonHoldsAllFields)
{
    const Json document = decodeToJson(closedFrame());
    const std::string dump = std::string(kClosedText).substr(std::string(kClosedText).find('\n') + 1);
    const Json frame{
        {"offset", 0},
        {"length", 40},
        {"class", "qel::QelMessageVirtualSerialSessionClosedAsync"},
        {"callerId", 0xA0B1C2D3U},
        {"function", 0x7000},
        {"functionText", "0x7000 (QelMessageFunctionDax)"},
        {"operation", 0xA005},
        {"operationText", "0xA005 (QelMessageOpSendVirtualSerialSessionClosed)"},
        {"classification", "Async"},
        {"flags", 0},
        {"status", 0},
        {"statusName", "QelMessageStatusNoError"},
        {"statusDetail", 0},
        {"payload", "1d1e1f2000000004"},
        {"frame", "decaff2000000028a0b1c2d37000000000000008a005000000000000000000001d1e1f2000000004"},
        {"dump", dump},
    };
    EXPECT_EQ(document.dump(2), (Json{{"frames", Json::array({frame})}, {"bad", Json::array()}}.dump(2)));
    EXPECT_EQ(output.str().back(), '\n');
}

TEST_F(DecodeCommandTest, JsonNamesTheClassification)
{
    const Json request = decodeToJson(GoldenFrame::load("QelMessageVirtualSerialOpenReq").bytes())["frames"][0];
    EXPECT_EQ(request["classification"], "Request");
    EXPECT_EQ(request["flags"], 0x80);
    const Json response = decodeToJson(GoldenFrame::load("QelMessageVirtualSerialOpenRsp-status").bytes())["frames"][0];
    EXPECT_EQ(response["classification"], "Response");
    EXPECT_EQ(response["status"], 0x13);
    EXPECT_EQ(response["statusName"], "QelMessageStatusConnectionNotAvailable");
    EXPECT_EQ(response["statusDetail"], 0x1234);
    std::string neither = closedFrame();
    neither[14] = '\xC0';
    const Json unknown = decodeToJson(neither)["frames"][0];
    EXPECT_EQ(unknown["classification"], "Unknown");
    EXPECT_EQ(unknown["class"], "qel::QelMessage");
}

TEST_F(DecodeCommandTest, JsonOfAFrameWithoutPayload)
{
    const Json frame = decodeToJson(GoldenFrame::load("QelMessageKrogConnectionClosedAsync").bytes())["frames"][0];
    EXPECT_EQ(frame["payload"], "");
    EXPECT_EQ(frame["length"], 32);
}

TEST_F(DecodeCommandTest, JsonListsBadFrames)
{
    std::string bad = closedFrame();
    bad[3] = '\x21';
    EXPECT_EQ(decode(bad + closedFrame() + "x", true), ExitStatus::Refused);
    const Json document = Json::parse(output.str());
    EXPECT_EQ(document["frames"].size(), 1U);
    EXPECT_EQ(document["frames"][0]["offset"], 40);
    EXPECT_EQ(document["bad"].dump(), R"([{"offset":0,"reason":"i_buffer bad header version"},)"
                                      R"({"offset":80,"reason":"i_buffer bad eyecatcher"}])");
}

TEST_F(DecodeCommandTest, JsonIsCompleteAfterAMistakeInTheText)
{
    EXPECT_EQ(decode(std::string(kClosedHex) + " zz", true), ExitStatus::Refused);
    const Json document = Json::parse(output.str());
    EXPECT_THAT(document["frames"], IsEmpty()) << "the line of the mistake is not read";
    EXPECT_EQ(document["bad"].dump(), R"([{"offset":0,"reason":"line 1: 'z' is not a hexadecimal digit"}])");
}

TEST_F(DecodeCommandTest, JsonHoldsBytesThatAreNotText)
{
    std::string frame = GoldenFrame::load("QelMessageSetGlobalSaveAreaMetadataReq").bytes();
    frame.replace(34, 9, std::string("\x1B[2J\xC3(\0\x7F\xFE", 9));
    const Json decoded = decodeToJson(frame)["frames"][0];
    EXPECT_EQ(decoded["payload"], "00091b5b324ac328007ffe");
    for (const char c : output.str())
        EXPECT_FALSE(c != '\n' && c >= 0 && c < ' ') << int{c};
}

TEST_F(DecodeCommandTest, ThrowsWhenTheInputCannotBeRead)
{
    for (const FrameNotation notation : {FrameNotation::Guess, FrameNotation::Raw, FrameNotation::Hex}) {
        std::ifstream directory("/", std::ios::binary);
        ASSERT_TRUE(directory.is_open());
        EXPECT_THAT([&] { decodeFrames(directory, notation, true, output, errors); },
                    ThrowsMessage<CommandFailure>(StrEq("cannot read the input")));
    }
    EXPECT_EQ(output.str(), "") << "half an answer would look like a whole one";
}

} // namespace

} // namespace qel::test
