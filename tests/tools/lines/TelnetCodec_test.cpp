// The telnet protocol, byte by byte.

#include "lines/TelnetCodec.hpp"
#include "support/CapturedLog.hpp"

#include <algorithm>
#include <gmock/gmock.h>
#include <initializer_list>
#include <iterator>
#include <optional>
#include <random>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using protocol::SerialSettings;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using tool::TelnetCodec;

constexpr int kIac = 255;
constexpr int kDont = 254;
constexpr int kDo = 253;
constexpr int kWont = 252;
constexpr int kWill = 251;
constexpr int kSb = 250;
constexpr int kBreak = 243;
constexpr int kSe = 240;
constexpr int kBinary = 0;
constexpr int kEcho = 1;
constexpr int kTerminalType = 24;
constexpr int kComPort = 44;
constexpr int kCompress = 86;

std::string bytes(std::initializer_list<int> values)
{
    std::string text;
    for (const int value : values)
        text.push_back(static_cast<char>(value));
    return text;
}

std::string everyByte()
{
    std::string all;
    for (int value = 0; value < 256; ++value)
        all.push_back(static_cast<char>(value));
    return all;
}

/// All bytes, with IAC doubled.
std::string everyByteSent() { return everyByte() + bytes({kIac}); }

class Telnet : public ::testing::Test {
protected:
    /// Takes bytes of the peer. @return the data in them
    std::string receive(const std::string& sent) { return codec.receive(sent.data(), sent.size()); }

    /// What is sent, since the last call.
    std::string takeOutput() { return std::exchange(codec.output(), std::string()); }

    /// The peer takes binary transmission both ways.
    void agreeOnBinary()
    {
        receive(bytes({kIac, kDo, kBinary, kIac, kWill, kBinary}));
        codec.output().clear();
    }

    /// What it does with the answer of the peer, whose line is warned about.
    std::vector<std::string> warningsFor(const std::string& answer)
    {
        const CapturedLog log(LogLevel::Warn);
        receive(answer);
        return log.lines();
    }

    TelnetCodec codec{SerialSettings::parse("9600e72,rtscts"), "partition 7"};
};

TEST_F(Telnet, AsksForBinaryNoGoAheadAndControlOfThePort)
{
    EXPECT_EQ(takeOutput(),
              bytes({kIac, kWill, kBinary, kIac, kDo, kBinary, kIac, kWill, 3, kIac, kDo, 3, kIac, kWill, kComPort}));
}

TEST_F(Telnet, AllByteValuesPassInBinary)
{
    agreeOnBinary();
    codec.send(everyByte());
    EXPECT_EQ(takeOutput(), everyByteSent());
    EXPECT_EQ(receive(everyByteSent()), everyByte());
}

TEST_F(Telnet, ACutAnywhereChangesNothing)
{
    agreeOnBinary();
    const std::string all = "a" +
                            bytes({kIac, kIac, kIac, kWill, kEcho, kIac, kSb, kComPort, 101, 1, kIac, kIac, 2, 3, kIac,
                                   kSe, 'b', kIac, kIac}) +
                            "c";
    for (std::size_t cut = 0; cut <= all.size(); ++cut) {
        SCOPED_TRACE(cut);
        const std::string first = receive(all.substr(0, cut));
        EXPECT_EQ(first + receive(all.substr(cut)), "a" + bytes({kIac}) + "b" + bytes({kIac}) + "c");
    }
}

TEST_F(Telnet, WithoutBinaryACarriageReturnHasANullCharacterAfterIt)
{
    takeOutput();
    codec.send("a\rb\r\n\r");
    EXPECT_EQ(takeOutput(), std::string("a\r\0b\r\0\n\r\0", 9));
    EXPECT_EQ(receive(std::string("a\r\0b\r\nc\r", 8)), "a\rb\r\nc\r");
    EXPECT_EQ(receive(std::string("\0\0d", 3)), std::string("\0d", 2)) << "across two pieces, and only one";
}

TEST_F(Telnet, BinaryEndsWhenThePeerSaysSo)
{
    agreeOnBinary();
    receive(bytes({kIac, kDont, kBinary, kIac, kWont, kBinary}));
    takeOutput();
    codec.send("\r");
    EXPECT_EQ(takeOutput(), std::string("\r\0", 2));
    EXPECT_EQ(receive(std::string("\r\0", 2)), "\r");
}

TEST_F(Telnet, ThePeerMayEchoAndThisSideDoesNot)
{
    takeOutput();
    receive(bytes({kIac, kWill, kEcho}));
    EXPECT_EQ(takeOutput(), bytes({kIac, kDo, kEcho}));
    receive(bytes({kIac, kDo, kEcho}));
    EXPECT_EQ(takeOutput(), bytes({kIac, kWont, kEcho}));
}

TEST_F(Telnet, EverythingElseIsRefused)
{
    takeOutput();
    receive(
        bytes({kIac, kWill, kTerminalType, kIac, kDo, kTerminalType, kIac, kWill, kCompress, kIac, kWill, kComPort}));
    EXPECT_EQ(takeOutput(), bytes({kIac, kDont, kTerminalType, kIac, kWont, kTerminalType, kIac, kDont, kCompress, kIac,
                                   kDont, kComPort}));
}

TEST_F(Telnet, SetsThePortOnceThePeerTakesControl)
{
    takeOutput();
    receive(bytes({kIac, kDo, kComPort}));
    EXPECT_EQ(takeOutput(), bytes({kIac, kSb, kComPort, 1, 0, 0,    0x25, 0x80, kIac, kSe, // 9600
                                   kIac, kSb, kComPort, 2, 7, kIac, kSe,                   //
                                   kIac, kSb, kComPort, 3, 3, kIac, kSe,                   // even
                                   kIac, kSb, kComPort, 4, 2, kIac, kSe,                   //
                                   kIac, kSb, kComPort, 5, 3, kIac, kSe}));                // hardware flow control
    receive(bytes({kIac, kDont, kComPort, kIac, kDo, kComPort}));
    EXPECT_EQ(takeOutput(), bytes({kIac, kWont, kComPort, kIac, kWill, kComPort})) << "not again";
}

TEST(TelnetSettings, EachParityAndFlowControlHasItsCode)
{
    const struct {
        const char* settings;
        int parity;
        int control;
    } rows[] = {{"9600n8", 1, 1}, {"9600o8", 2, 1}, {"9600e8,rtscts", 3, 3}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.settings);
        TelnetCodec codec(SerialSettings::parse(row.settings), "partition 7");
        const std::string taken = bytes({kIac, kDo, kComPort});
        codec.receive(taken.data(), taken.size());
        EXPECT_THAT(codec.output(), HasSubstr(bytes({kSb, kComPort, 3, row.parity, kIac, kSe})));
        EXPECT_THAT(codec.output(), HasSubstr(bytes({kSb, kComPort, 5, row.control, kIac, kSe})));
    }
}

TEST(TelnetSettings, WithoutThemThePortIsLeftAsItIs)
{
    TelnetCodec codec(std::nullopt, "partition 7");
    codec.output().clear();
    const std::string taken = bytes({kIac, kDo, kComPort});
    codec.receive(taken.data(), taken.size());
    EXPECT_EQ(codec.output(), "");
}

TEST_F(Telnet, APeerThatHasNotTakenControlOfThePortIsWarnedAbout)
{
    const CapturedLog log(LogLevel::Warn);
    receive(bytes({kIac, kDont, kComPort}));
    codec.checkAgreement();
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr(
                                 "partition 7: the peer does not take 9600e72,rtscts: it does not speak RFC 2217")));
}

TEST_F(Telnet, APeerThatHasTakenItOrNeedNotIsNotWarnedAbout)
{
    const CapturedLog log(LogLevel::Warn);
    receive(bytes({kIac, kDo, kComPort}));
    codec.checkAgreement();
    TelnetCodec(std::nullopt, "partition 8").checkAgreement();
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(Telnet, APeerThatSetsAnotherValueIsWarnedAbout)
{
    const std::string start = "partition 7: the peer does not take 9600e72,rtscts: it has set another ";
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 101, 0, 0, 0x25, 0x80, kIac, kSe})), IsEmpty());
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 101, 0, 0, 0x4B, 0, kIac, kSe})),
                ElementsAre(HasSubstr(start + "speed")));
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 102, 8, kIac, kSe})),
                ElementsAre(HasSubstr(start + "data bits")));
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 103, 1, kIac, kSe})), ElementsAre(HasSubstr(start + "parity")));
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 104, 1, kIac, kSe})),
                ElementsAre(HasSubstr(start + "stop bits")));
    EXPECT_THAT(warningsFor(bytes({kIac, kSb, kComPort, 107,  1,   kIac, kSe, kIac, kSb, kComPort, 101,  kIac, kSe,
                                   kIac, kSb, kComPort, kIac, kSe, kIac, kSb, 24,   101, 1,        kIac, kSe})),
                IsEmpty())
        << "notices of the port, and what is too short";
}

TEST_F(Telnet, ABreakIsTelnetsOwnUnlessThePeerTakesControlOfThePort)
{
    takeOutput();
    EXPECT_FALSE(codec.beginBreak());
    EXPECT_EQ(takeOutput(), bytes({kIac, kBreak}));
    receive(bytes({kIac, kDo, kComPort}));
    takeOutput();
    EXPECT_TRUE(codec.beginBreak());
    EXPECT_EQ(takeOutput(), bytes({kIac, kSb, kComPort, 5, 5, kIac, kSe}));
    codec.endBreak();
    EXPECT_EQ(takeOutput(), bytes({kIac, kSb, kComPort, 5, 6, kIac, kSe}));
}

TEST_F(Telnet, ASubnegotiationWithoutEndIsGivenUp)
{
    receive(bytes({kIac, kSb, kComPort}));
    std::size_t sent = 0;
    while (codec.failure().empty() && sent < 1000U * 1000) {
        ASSERT_EQ(receive(std::string(1000, 'x')), "");
        sent += 1000;
    }
    EXPECT_EQ(codec.failure(), "the peer breaks the telnet protocol: subnegotiation buffer size limit reached");
    EXPECT_GE(sent, 16U * 1024) << "shorter ones are accepted";
    EXPECT_LT(sent, 18U * 1024);
    EXPECT_EQ(receive("data"), "") << "nothing is taken any more";
}

TEST_F(Telnet, CompressionIsGivenUp)
{
    EXPECT_EQ(receive(bytes({kIac, kSb, kCompress, kIac, kSe}) + "data"), "");
    EXPECT_EQ(codec.failure(), "the peer compresses its data without agreement");
}

TEST_F(Telnet, APeerThatAsksAndDoesNotReadIsGivenUp)
{
    takeOutput();
    const std::string asks = bytes({kIac, kWill, kEcho, kIac, kWont, kEcho}); // each is answered with three bytes
    std::string many;
    while (many.size() < 4096)
        many += asks;
    std::size_t rounds = 0;
    while (codec.failure().empty() && ++rounds < 1000)
        receive(many);
    EXPECT_EQ(codec.failure(), "the peer asks and does not read the answers");
    EXPECT_GT(codec.output().size(), TelnetCodec::kMaxOutput);
    EXPECT_LT(codec.output().size(), TelnetCodec::kMaxOutput + 2 * 4096);
}

TEST_F(Telnet, NoBytesOfAPeerMakeItFailInAnotherWay)
{
    const unsigned long favourites[] = {kIac, kIac, kSb, kSe, kWill, kDo, kWont, kDont, kComPort,
                                        24,   31,   39,  69,  70,    93,  101,   0,     1};
    std::mt19937 random(2217);
    for (int round = 0; round < 3000; ++round) {
        TelnetCodec peer(SerialSettings(), "partition 7");
        std::string noise;
        for (int i = 0; i < 300; ++i) {
            const bool isFavourite = random() % 4 != 0;
            noise.push_back(static_cast<char>(isFavourite ? favourites[random() % std::size(favourites)] : random()));
        }
        std::size_t at = 0;
        while (at < noise.size()) {
            const std::size_t length = std::min<std::size_t>(1 + random() % 40, noise.size() - at);
            const std::string data = peer.receive(noise.data() + at, length);
            ASSERT_LE(data.size(), length) << "round " << round;
            at += length;
        }
        ASSERT_LT(peer.output().size(), 2 * noise.size() + 100) << "round " << round;
    }
}

} // namespace

} // namespace qel::test
