#include "decode/DecodeCommand.hpp"
#include "decode/PcapngReader.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"
#include "tools/decode/Capture.hpp"

#include <gmock/gmock.h>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using tool::ExitStatus;

/// Builds pcapng files block by block.
class Blocks {
public:
    explicit Blocks(bool bigEndian = false) : mBig(bigEndian) { section(); }

    void section() { add(0x0A0D0D0A, number(0x1A2B3C4D) + number(1, 2) + number(0, 2) + std::string(8, '\xFF')); }
    void interface(std::uint32_t linkType) { add(1, number(linkType, 2) + number(0, 2) + number(0)); }
    void packet(const std::string& content, std::uint32_t interface = 0, const std::string& options = {})
    {
        const std::string length = number(static_cast<std::uint32_t>(content.size()));
        add(6, number(interface) + number(0) + number(0) + length + length + padded(content) + options);
    }
    void simplePacket(const std::string& content)
    {
        add(3, number(static_cast<std::uint32_t>(content.size())) + padded(content));
    }
    void add(std::uint32_t type, const std::string& body)
    {
        const std::string length = number(static_cast<std::uint32_t>(body.size()) + 12);
        bytes += number(type) + length + body + length;
    }
    std::string number(std::uint32_t value, unsigned int width = 4) const
    {
        const std::string text = Capture::bigEndian(value, width);
        return mBig ? text : std::string(text.rbegin(), text.rend());
    }
    static std::string padded(std::string text)
    {
        text.resize((text.size() + 3) / 4 * 4);
        return text;
    }

    std::string bytes;

private:
    bool mBig;
};

const std::string& frame()
{
    static const std::string bytes = GoldenFrame::load("QelMessageVirtualSerialSessionClosedAsync").bytes();
    return bytes;
}

/// A packet of raw IP with a frame in it.
std::string ipPacket(std::uint32_t sequence = 1)
{
    return Capture::ipv4(Capture::bigEndian(4000, 2) + Capture::bigEndian(4711, 2) + Capture::bigEndian(sequence, 4) +
                         Capture::bigEndian(0, 4) + "\x50\x10" + std::string(6, '\0') + frame());
}

class DecodePcapng : public ::testing::Test {
protected:
    ExitStatus decode(const std::string& bytes)
    {
        std::istringstream input(bytes);
        output.str("");
        errors.str("");
        return tool::decodeFrames(input, tool::FrameNotation::Guess, false, output, errors);
    }

    CapturedLog log{LogLevel::Critical};
    std::ostringstream output;
    std::ostringstream errors;
};

TEST_F(DecodePcapng, ReadsBothByteOrders)
{
    for (const bool big : {false, true}) {
        SCOPED_TRACE(big);
        Blocks blocks(big);
        blocks.interface(101);
        blocks.packet(ipPacket());
        EXPECT_EQ(decode(blocks.bytes), ExitStatus::Done);
        EXPECT_THAT(output.str(), HasSubstr("frame at offset 0 of 127.0.0.1:4000 > 127.0.0.1:4711, 40 bytes\n"));
    }
}

TEST_F(DecodePcapng, ReadsSeveralSectionsInterfacesAndKindsOfBlocks)
{
    Blocks blocks;
    blocks.interface(1);
    blocks.interface(101);
    blocks.add(0xBAD, "skipped!");
    blocks.packet(std::string(12, '\xAA') + Capture::bigEndian(0x0800, 2) + ipPacket(1), 0);
    blocks.packet(ipPacket(41), 1,
                  blocks.number(1, 2) + blocks.number(3, 2) + Blocks::padded("abc") + blocks.number(0));
    blocks.section();
    blocks.interface(228);
    blocks.simplePacket(ipPacket(81));
    EXPECT_EQ(decode(blocks.bytes), ExitStatus::Done);
    for (const char* place : {"offset 0 of", "offset 40 of", "offset 80 of"})
        EXPECT_THAT(output.str(), HasSubstr(place));
}

TEST_F(DecodePcapng, RefusesWhatIsDamaged)
{
    const auto refusal = [this](const std::string& bytes) {
        EXPECT_EQ(decode(bytes), ExitStatus::Refused);
        return errors.str();
    };
    Blocks none;
    none.packet(ipPacket());
    EXPECT_THAT(refusal(none.bytes),
                HasSubstr("the capture is damaged: a packet of an interface that it does not have\n"));
    Blocks longer;
    longer.interface(101);
    longer.add(6, longer.number(0) + longer.number(0) + longer.number(0) + longer.number(9) + longer.number(9) +
                      "12345678");
    EXPECT_THAT(refusal(longer.bytes), HasSubstr("the capture is damaged: a packet is longer than its block\n"));
    Blocks odd;
    odd.bytes += odd.number(5) + odd.number(11);
    EXPECT_THAT(refusal(odd.bytes), HasSubstr("the capture is damaged: a block of 11 bytes\n"));
    std::string order = Blocks().bytes;
    order[8] = 'x';
    EXPECT_THAT(refusal(order), HasSubstr("the capture is damaged: a section without a byte order\n"));
    Blocks link;
    link.interface(9999);
    link.packet(ipPacket());
    EXPECT_THAT(refusal(link.bytes), HasSubstr("the capture has link type 9999"));
}

TEST_F(DecodePcapng, SurvivesEveryTruncation)
{
    Blocks blocks;
    blocks.interface(101);
    const std::size_t begin = blocks.bytes.size();
    blocks.packet(ipPacket());
    for (std::size_t length = 4; length < blocks.bytes.size(); ++length) {
        SCOPED_TRACE(length);
        EXPECT_EQ(decode(blocks.bytes.substr(0, length)), ExitStatus::Refused);
    }
    EXPECT_EQ(decode(blocks.bytes.substr(0, begin)), ExitStatus::Refused);
    EXPECT_EQ(errors.str(), "qel: no frame was found in the capture\n");
}

} // namespace

} // namespace qel::test
