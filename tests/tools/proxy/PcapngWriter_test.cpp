#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include "decode/DecodeCommand.hpp"
#include "decode/PcapngReader.hpp"
#include "proxy/PcapngWriter.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"
#include "tools/proxy/FlowKit.hpp"

#include <gmock/gmock.h>
#include <sstream>
#include <sys/stat.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::SizeIs;
using tool::CapturedSides;
using tool::PcapngWriter;
using tool::ProxySide;
using tool::Way;

const std::string kOne = frameOf(1, "one");
const std::string kTwo = frameOf(2, "two");

unsigned int number(const std::string& bytes, std::size_t at, std::size_t width)
{
    unsigned int value = 0;
    for (std::size_t i = 0; i < width; ++i)
        value = value << 8 | static_cast<unsigned char>(bytes.at(at + i));
    return value;
}

/// The sum of 16-bit words that is 0xFFFF when the checksum in it is right (RFC 1071).
unsigned int folded(std::string bytes)
{
    if (bytes.size() % 2 != 0) bytes += '\0';
    unsigned int sum = 0;
    for (std::size_t i = 0; i < bytes.size(); i += 2)
        sum += number(bytes, i, 2);
    while (sum > 0xFFFF)
        sum = (sum & 0xFFFF) + (sum >> 16);
    return sum;
}

std::string big(unsigned int value, unsigned int width)
{
    std::string text;
    for (unsigned int i = width; i > 0; --i)
        text += static_cast<char>(value >> 8 * (i - 1));
    return text;
}

/// "4000>4711 S seq=0 ack=0 len=0", after a check of both checksums.
std::string described(const std::string& packet)
{
    const bool is4 = static_cast<unsigned char>(packet[0]) == 0x45;
    const std::size_t header = is4 ? 20 : 40;
    const std::string tcp = packet.substr(header);
    const std::string addresses = is4 ? packet.substr(12, 8) : packet.substr(8, 32);
    EXPECT_EQ(is4 ? number(packet, 2, 2) : number(packet, 4, 2) + 40, packet.size());
    if (is4) {
        EXPECT_EQ(folded(packet.substr(0, header)), 0xFFFFU);
    }
    EXPECT_EQ(folded(addresses + big(static_cast<unsigned int>(tcp.size()), 4) + big(6, 4) + tcp), 0xFFFFU);
    std::string flags;
    const unsigned int bits = number(tcp, 13, 1);
    for (const auto& [bit, name] :
         {std::pair(2, 'S'), std::pair(8, 'P'), std::pair(1, 'F'), std::pair(4, 'R'), std::pair(16, 'A')})
        if ((bits & static_cast<unsigned int>(bit)) != 0) flags += name;
    return std::to_string(number(tcp, 0, 2)) + ">" + std::to_string(number(tcp, 2, 2)) + " " + flags +
           " seq=" + std::to_string(number(tcp, 4, 4)) + " ack=" + std::to_string(number(tcp, 8, 4)) +
           " len=" + std::to_string(tcp.size() - 20);
}

class PcapngWriterTest : public ::testing::Test {
protected:
    static tool::ProxyAddresses addresses(const std::string& host = "127.0.0.1")
    {
        return {IPEndpoint(host + ":4000"), IPEndpoint(host + ":4001"), IPEndpoint(host + ":4002"),
                IPEndpoint(host + ":4003")};
    }
    std::string file() const { return directory.file("capture.pcapng"); }
    std::vector<std::string> packets() const
    {
        std::istringstream input(Utilities::readFile(file()));
        tool::PcapngReader reader(input);
        std::vector<std::string> all;
        std::uint32_t linkType = 0;
        for (std::string packet; reader.next(linkType, packet);) {
            EXPECT_EQ(linkType, 1U);
            const bool is4 = static_cast<unsigned char>(packet.at(14)) == 0x45;
            EXPECT_EQ(number(packet, 12, 2), is4 ? 0x0800U : 0x86DDU);
            all.push_back(packet.substr(14));
        }
        return all;
    }
    std::vector<std::string> stories() const
    {
        std::vector<std::string> all;
        for (const std::string& packet : packets())
            all.push_back(described(packet));
        return all;
    }

    TemporaryDirectory directory;
    SettableClock clock;
    tool::FaultPlan plan;
    FlowNotes notes;
    tool::FrameFlow toServer{{1, Way::ToServer}, plan, notes};
    tool::FrameFlow toConsole{{1, Way::ToConsole}, plan, notes};
};

TEST_F(PcapngWriterTest, BeginsWithASectionAndItsInterfaces)
{
    {
        PcapngWriter writer(file(), CapturedSides::Both);
    }
    const std::string expected(
        "\x0A\x0D\x0D\x0A\x30\0\0\0\x4D\x3C\x2B\x1A\x01\0\0\0\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"
        "\x04\0\x09\0qel proxy\0\0\0\0\0\0\0\x30\0\0\0"
        "\x01\0\0\0\x2C\0\0\0\x01\0\0\0\0\0\0\0\x02\0\x06\0server\0\0\x09\0\x01\0\x09\0\0\0\0\0\0\0\x2C\0\0\0"
        "\x01\0\0\0\x2C\0\0\0\x01\0\0\0\0\0\0\0\x02\0\x07\0console\0\x09\0\x01\0\x09\0\0\0\0\0\0\0\x2C\0\0\0",
        48 + 44 + 44);
    EXPECT_EQ(Utilities::readFile(file()), expected);
}

TEST_F(PcapngWriterTest, MakesUpAConnectionWithRightNumbersAndChecksums)
{
    {
        PcapngWriter writer(file(), CapturedSides::Server);
        writer.onOpened(1, addresses());
        writer.onBytes(1, ProxySide::Console, Way::ToServer, kOne); // of the other side: not written
        writer.onBytes(1, ProxySide::Server, Way::ToServer, kOne);
        writer.onBytes(1, ProxySide::Server, Way::ToConsole, kTwo + kTwo);
        writer.onEnd({1, Way::ToServer});
        writer.onEnd({1, Way::ToConsole});
        writer.onClosed(1, "both sides have ended it", toServer, toConsole);
    }
    EXPECT_THAT(stories(), ElementsAre("4002>4003 S seq=0 ack=0 len=0", "4003>4002 SA seq=0 ack=1 len=0",
                                       "4002>4003 A seq=1 ack=1 len=0", "4002>4003 PA seq=1 ack=1 len=35",
                                       "4003>4002 PA seq=1 ack=36 len=70", "4002>4003 FA seq=36 ack=71 len=0",
                                       "4003>4002 FA seq=71 ack=37 len=0"));
}

TEST_F(PcapngWriterTest, HoldsBothSidesOnRequest)
{
    {
        PcapngWriter writer(file(), CapturedSides::Both);
        writer.onOpened(1, addresses("[::1]"));
        writer.onBytes(1, ProxySide::Console, Way::ToServer, kOne);
        writer.onBytes(1, ProxySide::Server, Way::ToServer, kTwo);
        writer.onClosed(1, "reset", toServer, toConsole);
    }
    const std::vector<std::string> all = stories();
    ASSERT_THAT(all, SizeIs(10));
    EXPECT_EQ(all[6], "4000>4001 PA seq=1 ack=1 len=35");
    EXPECT_EQ(all[7], "4002>4003 PA seq=1 ack=1 len=35");
    EXPECT_EQ(all[8], "4000>4001 RA seq=36 ack=1 len=0");
    EXPECT_EQ(all[9], "4002>4003 RA seq=36 ack=1 len=0");
}

TEST_F(PcapngWriterTest, DividesWhatDoesNotFitAPacket)
{
    {
        PcapngWriter writer(file(), CapturedSides::Server);
        writer.onOpened(1, addresses());
        writer.onBytes(1, ProxySide::Server, Way::ToServer, std::string(70000, 'x'));
    }
    const std::vector<std::string> all = stories();
    ASSERT_THAT(all, SizeIs(6));
    EXPECT_EQ(all[3], "4002>4003 PA seq=1 ack=1 len=32768");
    EXPECT_EQ(all[4], "4002>4003 PA seq=32769 ack=1 len=32768");
    EXPECT_EQ(all[5], "4002>4003 PA seq=65537 ack=1 len=4464");
}

TEST_F(PcapngWriterTest, AFaultIsACommentOnTheNextPacketOfItsConnection)
{
    {
        PcapngWriter writer(file(), CapturedSides::Server);
        writer.onOpened(1, addresses());
        writer.onOpened(2, addresses());
        writer.onFault({1, Way::ToServer}, 3, rulesOf({"drop"}).front(), "dropped");
        writer.onBytes(2, ProxySide::Server, Way::ToServer, kOne);
        writer.onBytes(1, ProxySide::Server, Way::ToServer, kTwo);
    }
    const std::string bytes = Utilities::readFile(file());
    const std::size_t comment = bytes.find("to-server frame 3: dropped (drop)");
    ASSERT_NE(comment, std::string::npos);
    EXPECT_GT(comment, bytes.find("two"));
    EXPECT_THAT(packets(), SizeIs(8));
}

TEST_F(PcapngWriterTest, QelDecodeReadsIt)
{
    {
        PcapngWriter writer(file(), CapturedSides::Server);
        writer.onOpened(1, addresses());
        writer.onBytes(1, ProxySide::Server, Way::ToServer, kOne.substr(0, 7));
        writer.onBytes(1, ProxySide::Server, Way::ToServer, kOne.substr(7) + kTwo);
    }
    std::istringstream input(Utilities::readFile(file()));
    std::ostringstream output;
    std::ostringstream errors;
    tool::decodeFrames(input, tool::FrameNotation::Guess, false, output, errors);
    EXPECT_THAT(output.str(), HasSubstr("frame at offset 0 of 127.0.0.1:4002 > 127.0.0.1:4003, 35 bytes\n"));
    EXPECT_THAT(output.str(), HasSubstr("frame at offset 35 of 127.0.0.1:4002 > 127.0.0.1:4003, 35 bytes\n"));
}

TEST_F(PcapngWriterTest, OnlyTheOwnerMayReadTheFile)
{
    const PcapngWriter writer(file(), CapturedSides::Server);
    struct stat status {};
    ASSERT_EQ(::stat(file().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(PcapngWriterTest, AFullDiskEndsTheCaptureAndIsToldOnce)
{
    PcapngWriter writer("/dev/full", CapturedSides::Server);
    writer.onIdle();
    EXPECT_EQ(writer.takeFailure(), "cannot write to /dev/full: 28 (No space left on device); the capture ends here");
    writer.onOpened(1, addresses());
    writer.onIdle();
    EXPECT_EQ(writer.takeFailure(), "");
}

TEST_F(PcapngWriterTest, AFileThatCannotBeOpenedIsAnError)
{
    EXPECT_THROW(PcapngWriter(directory.file("none") + "/capture", CapturedSides::Server), FileIOError);
}

} // namespace

} // namespace qel::test
