#include "decode/DecodeCommand.hpp"
#include "decode/TcpSegment.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"
#include "tools/decode/Capture.hpp"

#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using tool::ExitStatus;
using tool::TcpSegment;
using tool::TcpStream;
using Json = nlohmann::ordered_json;

constexpr const char* kThere = "127.0.0.1:4000 > 127.0.0.1:4711";
constexpr const char* kBack = "127.0.0.1:4711 > 127.0.0.1:4000";

/// 40 bytes.
const std::string& frame()
{
    static const std::string bytes = GoldenFrame::load("QelMessageVirtualSerialSessionClosedAsync").bytes();
    return bytes;
}

class DecodeCapture : public ::testing::Test {
protected:
    ExitStatus decode(const std::string& bytes, bool json = false)
    {
        std::istringstream input(bytes);
        output.str("");
        errors.str("");
        return tool::decodeFrames(input, tool::FrameNotation::Guess, json, output, errors);
    }

    /// The stream and offset of each frame.
    std::vector<std::string> places(const Capture& capture)
    {
        decode(capture.bytes(), true);
        std::vector<std::string> all;
        const Json document = Json::parse(output.str());
        for (const Json& one : document["frames"])
            all.push_back(one["stream"].get<std::string>() + " @" + one["offset"].dump());
        return all;
    }

    CapturedLog log{LogLevel::Critical};
    std::ostringstream output;
    std::ostringstream errors;
};

TEST_F(DecodeCapture, PrintsStreamAndOffsetOfEachFrame)
{
    Capture capture;
    capture.addSegment(1000, frame() + frame());
    capture.addSegment(5000, frame(), true);
    EXPECT_EQ(decode(capture.bytes()), ExitStatus::Done);
    EXPECT_THAT(output.str(),
                HasSubstr(std::string("frame at offset 0 of ") + kThere + ", 40 bytes\n[CID: 0xA0B1C2D3"));
    EXPECT_THAT(output.str(), HasSubstr(std::string("frame at offset 40 of ") + kThere + ", 40 bytes\n"));
    EXPECT_THAT(output.str(), HasSubstr(std::string("frame at offset 0 of ") + kBack + ", 40 bytes\n"));
    EXPECT_EQ(errors.str(), "");
}

TEST_F(DecodeCapture, ReadsBothByteOrdersAndBothResolutions)
{
    for (const auto order : {Capture::Order::Little, Capture::Order::Big}) {
        for (const bool nanoseconds : {false, true}) {
            Capture capture(1, order, nanoseconds);
            capture.addSegment(1, frame());
            EXPECT_THAT(places(capture), ::testing::ElementsAre(std::string(kThere) + " @0"));
        }
    }
}

TEST_F(DecodeCapture, ReadsTheKnownLinkTypes)
{
    for (const unsigned int linkType : {0U, 1U, 12U, 101U, 108U, 113U, 228U, 276U}) {
        SCOPED_TRACE(linkType);
        Capture capture(linkType);
        capture.addSegment(1, frame());
        EXPECT_THAT(places(capture), ::testing::ElementsAre(std::string(kThere) + " @0"));
    }
}

TEST_F(DecodeCapture, ReadsVlanTags)
{
    const std::string tcp = Capture::bigEndian(1, 2) + Capture::bigEndian(2, 2) + Capture::bigEndian(9, 4) +
                            Capture::bigEndian(0, 4) + "\x50\x10" + std::string(6, '\0') + frame();
    Capture capture;
    capture.addPacket(std::string(12, '\0') + Capture::bigEndian(0x88A8, 2) + Capture::bigEndian(7, 2) +
                      Capture::bigEndian(0x8100, 2) + Capture::bigEndian(8, 2) + Capture::bigEndian(0x0800, 2) +
                      Capture::ipv4(tcp));
    EXPECT_THAT(places(capture), ::testing::ElementsAre("127.0.0.1:1 > 127.0.0.1:2 @0"));
}

TEST_F(DecodeCapture, ReadsIPv6WithExtensionHeaders)
{
    const std::string tcp = Capture::bigEndian(1, 2) + Capture::bigEndian(2, 2) + Capture::bigEndian(9, 4) +
                            Capture::bigEndian(0, 4) + "\x50\x10" + std::string(6, '\0') + frame();
    const std::string loopback = std::string(15, '\0') + '\x01';
    const std::string options = std::string("\x06\0", 2) + std::string(6, '\0');
    Capture capture(229);
    capture.addPacket("\x60" + std::string(3, '\0') +
                      Capture::bigEndian(static_cast<std::uint32_t>(options.size() + tcp.size()), 2) +
                      std::string("\0\x40", 2) + loopback + loopback + options + tcp);
    EXPECT_THAT(places(capture), ::testing::ElementsAre("[::1]:1 > [::1]:2 @0"));
}

TEST_F(DecodeCapture, PutsSegmentsInOrder)
{
    const std::string bytes = frame() + frame();
    const std::uint32_t begin = 0xFFFFFFF0; // the numbers wrap around
    Capture capture;
    capture.addSegment(begin - 1, "", false, 0x02);
    capture.addSegment(begin + 50, bytes.substr(50));
    capture.addSegment(begin + 10, bytes.substr(10, 40));
    capture.addSegment(begin, bytes.substr(0, 10));
    capture.addSegment(begin, bytes.substr(0, 30)); // sent again
    EXPECT_THAT(places(capture), ::testing::ElementsAre(std::string(kThere) + " @0", std::string(kThere) + " @40"));
    EXPECT_EQ(errors.str(), "");
}

TEST_F(DecodeCapture, SaysInOneSentenceWhatItSkipped)
{
    Capture capture;
    capture.addSegment(1, frame() + "\x16\x03\x01\x02");
    capture.addSegment(500, "\x17\x03\x03\x99", false);
    capture.addSegment(1, "HTTP/1.1 200 OK", true);
    capture.addPacket(capture.link() + Capture::ipv4("datagram", 17));
    capture.addPacket(capture.link() + Capture::ipv4(frame(), 6, 1));
    capture.addPacket("short");
    EXPECT_EQ(decode(capture.bytes()), ExitStatus::Done);
    EXPECT_EQ(errors.str(),
              "qel: skipped 3 packets without TCP, 1 stream from where TLS begins, 1 stream from where no "
              "frame follows\n");
    decode(capture.bytes(), true);
    EXPECT_EQ(Json::parse(output.str())["skipped"], "skipped 3 packets without TCP, 1 stream from where TLS begins, 1 "
                                                    "stream from where no frame follows");
}

TEST_F(DecodeCapture, RefusesACaptureThatLacksASegment)
{
    Capture capture;
    capture.addSegment(1, frame());
    capture.addSegment(100, frame());
    EXPECT_EQ(decode(capture.bytes()), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), std::string("qel: bad frame at offset 40 of ") + kThere +
                                ": the capture lacks a segment; 40 bytes after it are skipped\n");
}

TEST_F(DecodeCapture, RefusesAFrameThatTheCaptureCuts)
{
    Capture capture;
    capture.addSegment(1, frame() + frame().substr(0, 39));
    EXPECT_EQ(decode(capture.bytes(), true), ExitStatus::Refused);
    EXPECT_EQ(Json::parse(output.str())["bad"],
              (Json::array(
                  {{{"stream", kThere}, {"offset", 40}, {"reason", "the capture ends after 39 bytes of a frame"}}})));
}

TEST_F(DecodeCapture, RefusesAFrameWithAMalformedLength)
{
    Capture capture;
    capture.addSegment(1, std::string("\xDE\xCA\xFF\x20\0\0\0\x08", 8) + frame());
    EXPECT_EQ(decode(capture.bytes()), ExitStatus::Refused);
    EXPECT_THAT(errors.str(),
                HasSubstr(std::string("qel: bad frame at offset 0 of ") + kThere + ": Invalid length 8\n"));
}

TEST_F(DecodeCapture, RefusesACaptureWithoutFrames)
{
    EXPECT_EQ(decode(Capture().bytes()), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: no frame was found in the capture\n");
}

TEST_F(DecodeCapture, RefusesADamagedCapture)
{
    Capture capture;
    capture.addSegment(1, frame());
    const std::string& bytes = capture.bytes();
    struct Row {
        std::string bytes;
        std::string reason;
    };
    for (const Row& row : {
             Row{bytes.substr(0, 23), "qel: the capture ends in its header\n"},
             Row{bytes.substr(0, 24 + 15), "qel: the capture ends in the header of a packet\n"},
             Row{bytes.substr(0, bytes.size() - 1), "qel: the capture ends within a packet\n"},
             Row{bytes + std::string(8, '\0') + "\x01" + std::string(2, '\0') + "\x7F" + std::string(4, '\0'),
                 "qel: the capture is damaged: a packet of 2130706433 bytes\n"},
             Row{Capture(147).bytes(), "qel: the capture has link type 147, which is not supported: capture Ethernet, "
                                       "Linux cooked, raw IP or loopback\n"},
         }) {
        EXPECT_EQ(decode(row.bytes), ExitStatus::Refused);
        EXPECT_THAT(errors.str(), HasSubstr(row.reason));
    }
}

TEST_F(DecodeCapture, SurvivesEveryTruncation)
{
    Capture capture;
    capture.addSegment(1, frame());
    for (std::size_t length = 4; length < capture.bytes().size(); ++length) {
        SCOPED_TRACE(length);
        EXPECT_EQ(decode(capture.bytes().substr(0, length)), ExitStatus::Refused);
    }
    const std::string packet = capture.bytes().substr(24 + 16);
    for (std::size_t length = 0; length < packet.size(); ++length)
        static_cast<void>(tool::tcpSegmentOf(1, packet.substr(0, length)));
}

TEST_F(DecodeCapture, TextThatBeginsLikeTheMagicIsText)
{
    EXPECT_EQ(decode("\n\r\n\r\n"), ExitStatus::Done);
    EXPECT_EQ(decode("\n"), ExitStatus::Done);
}

TEST(TcpStreamLimits, DropsWhatWaitsBeyondItsLimit)
{
    TcpStream stream;
    std::string data;
    TcpSegment segment;
    segment.sequence = 1;
    segment.payload = "a";
    stream.take(segment, data);
    for (std::uint32_t i = 0; i < 40; ++i) {
        segment.sequence = 1000 + i * 65536;
        segment.payload = std::string(65536, 'x');
        stream.take(segment, data);
    }
    EXPECT_EQ(data, "a");
    EXPECT_EQ(stream.waitingBytes(), TcpStream::kMaxWaiting);
}

} // namespace

} // namespace qel::test
