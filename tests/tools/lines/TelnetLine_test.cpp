// A telnet line over a connection that the test plays.

#include "lines/TelnetLine.hpp"
#include "support/CapturedLog.hpp"
#include "support/SettableClock.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>

namespace qel::test {

namespace {

using protocol::SerialLine;
using protocol::SerialSettings;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using LineState = SerialLine::LineState;

/// What the far side of the connection has sent and received, and what the connection is like.
struct Wire {
    bool isUp = false;
    bool canConnect = true;
    bool hasEnded = false;
    std::size_t room = 1U << 20; ///< bytes that the connection takes
    std::string toRead;
    std::string written;
    unsigned starts = 0;
    unsigned stops = 0;
    std::string failure; ///< that advance() throws
};

class WireLine final : public SerialLine {
public:
    explicit WireLine(Wire& wire) : mWire(wire) {}

    void start(std::uint16_t) override
    {
        ++mWire.starts;
        mWire.hasEnded = false;
    }
    void stop() override
    {
        ++mWire.stops;
        mWire.isUp = false;
    }
    bool advance() override
    {
        if (!mWire.failure.empty()) throw std::runtime_error(mWire.failure);
        mWire.isUp = mWire.isUp || mWire.canConnect;
        return mWire.isUp;
    }
    bool wantsToWrite() const override { return !mWire.isUp; }
    ReadResult read(char* buffer, std::size_t length) override
    {
        if (mWire.toRead.empty()) return {mWire.hasEnded ? LineState::Ended : LineState::Idle, 0};
        const std::size_t count = mWire.toRead.copy(buffer, length);
        mWire.toRead.erase(0, count);
        return {LineState::Data, count};
    }
    std::size_t write(const char* data, std::size_t length) override
    {
        const std::size_t count = std::min(length, mWire.room);
        mWire.room -= count;
        mWire.written.append(data, count);
        return count;
    }
    int descriptor() const override { return mWire.isUp ? 42 : -1; }
    bool hasHungUp() const override { return mWire.hasEnded; }
    std::string endReason() const override { return "the reason of the connection"; }

private:
    Wire& mWire;
};

/// RFC 2217 is taken, and so is binary transmission.
const std::string kAgreed = "\xFF\xFD\x2C\xFF\xFD" + std::string(1, '\0') + "\xFF\xFB" + std::string(1, '\0');

class TelnetLineTest : public ::testing::Test {
protected:
    std::string readAll()
    {
        std::string all;
        std::array<char, 100> buffer;
        while (!wire.toRead.empty()) {
            const auto result = line->read(buffer.data(), buffer.size());
            all.append(buffer.data(), result.length);
            if (result.state == LineState::Ended) break;
        }
        return all;
    }

    void bringUp(const std::string& fromPeer = kAgreed)
    {
        line->start(7);
        ASSERT_TRUE(line->advance());
        wire.toRead += fromPeer;
        ASSERT_EQ(readAll(), "");
        wire.written.clear();
    }

    SettableClock clock;
    Wire wire;
    const std::unique_ptr<SerialLine> line = tool::telnetLine(std::make_unique<WireLine>(wire), std::nullopt);
};

TEST_F(TelnetLineTest, ComesUpWithItsConnectionAndThenAsks)
{
    wire.canConnect = false;
    line->start(7);
    EXPECT_FALSE(line->advance());
    EXPECT_TRUE(line->wantsToWrite()) << "as the connection does";
    EXPECT_EQ(wire.written, "");
    wire.canConnect = true;
    EXPECT_TRUE(line->advance());
    EXPECT_FALSE(line->wantsToWrite());
    EXPECT_EQ(wire.written.size(), 15U);
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written.size(), 15U) << "once";
}

TEST_F(TelnetLineTest, AFailureOfTheConnectionPasses)
{
    wire.failure = "cannot connect to x: Connection refused";
    line->start(7);
    EXPECT_THAT([&] { line->advance(); }, ThrowsMessage<std::runtime_error>(StrEq(wire.failure)));
    EXPECT_EQ(line->endReason(), "the reason of the connection");
}

TEST_F(TelnetLineTest, DataPassBothWaysWithDoubledIac)
{
    bringUp();
    EXPECT_EQ(line->write("a\xFF\r", 3), 3U);
    EXPECT_EQ(wire.written, "a\xFF\xFF\r");
    wire.toRead = "b\xFF\xFF";
    EXPECT_EQ(readAll(), "b\xFF");
}

TEST_F(TelnetLineTest, NegotiationAloneIsIdle)
{
    bringUp();
    wire.toRead = "\xFF\xFB\x01";
    std::array<char, 10> buffer;
    EXPECT_EQ(line->read(buffer.data(), buffer.size()).state, LineState::Idle);
    EXPECT_EQ(wire.written, "\xFF\xFD\x01") << "the answer goes out at once";
    EXPECT_EQ(line->read(buffer.data(), buffer.size()).state, LineState::Idle) << "nothing at all";
}

TEST_F(TelnetLineTest, AFullConnectionTakesNothingMoreUntilAllIsSent)
{
    bringUp();
    wire.room = 3;
    EXPECT_EQ(line->write("\xFF\xFF", 2), 2U); // four bytes
    EXPECT_TRUE(line->wantsToWrite());
    EXPECT_EQ(line->write("x", 1), 0U);
    wire.room = 1;
    EXPECT_TRUE(line->advance());
    EXPECT_FALSE(line->wantsToWrite());
    wire.room = 1;
    EXPECT_EQ(line->write("x", 1), 1U);
    EXPECT_EQ(wire.written, "\xFF\xFF\xFF\xFFx");
}

TEST_F(TelnetLineTest, TakesALongInputInPieces)
{
    bringUp();
    const std::string input(10000, 'x');
    EXPECT_EQ(line->write(input.data(), input.size()), 4096U);
}

TEST_F(TelnetLineTest, ABreakOfRfc2217LastsAQuarterOfASecondAndInputWaitsForItsEnd)
{
    bringUp();
    EXPECT_TRUE(line->sendBreak());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x05\xFF\xF0");
    EXPECT_EQ(line->advanceAt(), PollDeadline(clock.steady() + std::chrono::milliseconds(250)));
    EXPECT_TRUE(line->sendBreak()) << "one is under way";
    const std::string input(5000, 'x');
    EXPECT_EQ(line->write(input.data(), 4095), 4095U);
    EXPECT_EQ(line->write(input.data(), 2), 1U);
    EXPECT_EQ(line->write(input.data(), 1), 0U);
    clock.advance(std::chrono::milliseconds(249));
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x05\xFF\xF0");
    wire.written.clear();
    clock.advance(std::chrono::milliseconds(1));
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x06\xFF\xF0" + std::string(4096, 'x'));
    EXPECT_TRUE(line->advanceAt().isDisabled());
    EXPECT_EQ(line->write("y", 1), 1U);
}

TEST_F(TelnetLineTest, ABreakBehindAFullConnectionLastsAsLongOnceItIsSent)
{
    bringUp();
    wire.room = 3;
    EXPECT_TRUE(line->sendBreak());
    EXPECT_EQ(line->write("held", 4), 4U);
    EXPECT_TRUE(line->sendBreak()) << "one is under way";
    EXPECT_TRUE(line->wantsToWrite());
    EXPECT_TRUE(line->advanceAt().isDisabled());
    clock.advance(std::chrono::seconds(1));
    wire.room = 1000;
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x05\xFF\xF0");
    EXPECT_EQ(line->advanceAt(), PollDeadline(clock.steady() + std::chrono::milliseconds(250)));
    clock.advance(std::chrono::milliseconds(250));
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x05\xFF\xF0\xFF\xFA\x2C\x05\x06\xFF\xF0held");
}

TEST_F(TelnetLineTest, ABreakThatWaitsToBeSentIsDroppedWithTheLine)
{
    bringUp();
    wire.room = 0;
    EXPECT_TRUE(line->sendBreak());
    line->stop();
    wire.room = 1000;
    bringUp();
    EXPECT_TRUE(line->advanceAt().isDisabled());
    EXPECT_EQ(line->write("x", 1), 1U);
    EXPECT_EQ(wire.written, "x");
}

TEST_F(TelnetLineTest, InputThatWaitsForTheEndOfABreakIsDroppedWithTheLine)
{
    bringUp();
    EXPECT_TRUE(line->sendBreak());
    EXPECT_EQ(line->write("old", 3), 3U);
    line->stop();
    bringUp();
    EXPECT_TRUE(line->sendBreak());
    clock.advance(std::chrono::milliseconds(250));
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "\xFF\xFA\x2C\x05\x05\xFF\xF0\xFF\xFA\x2C\x05\x06\xFF\xF0");
}

TEST_F(TelnetLineTest, TelnetsOwnBreakHasNoEnd)
{
    bringUp("");
    EXPECT_TRUE(line->sendBreak());
    EXPECT_EQ(wire.written, "\xFF\xF3");
    EXPECT_TRUE(line->advanceAt().isDisabled());
}

TEST_F(TelnetLineTest, APeerThatDoesNotAgreeToTheSettingsIsWarnedAboutAfterFiveSeconds)
{
    const CapturedLog log(LogLevel::Warn);
    const auto withSettings = tool::telnetLine(std::make_unique<WireLine>(wire), SerialSettings::parse("9600n8"));
    withSettings->start(7);
    EXPECT_TRUE(withSettings->advance());
    EXPECT_EQ(withSettings->advanceAt(), PollDeadline(clock.steady() + std::chrono::seconds(5)));
    clock.advance(std::chrono::milliseconds(4999));
    EXPECT_TRUE(withSettings->advance());
    EXPECT_THAT(log.lines(), IsEmpty());
    clock.advance(std::chrono::milliseconds(1));
    EXPECT_TRUE(withSettings->advance());
    EXPECT_THAT(log.lines(),
                ElementsAre(HasSubstr("partition 7: the peer does not take 9600n8: it does not speak RFC 2217")));
    EXPECT_TRUE(withSettings->advanceAt().isDisabled());
}

TEST_F(TelnetLineTest, ANewConnectionHasItsOwnTimeToAgree)
{
    const CapturedLog log(LogLevel::Warn);
    const auto withSettings = tool::telnetLine(std::make_unique<WireLine>(wire), SerialSettings::parse("9600n8"));
    withSettings->start(7);
    EXPECT_TRUE(withSettings->advance());
    clock.advance(std::chrono::seconds(3));
    withSettings->stop();
    EXPECT_TRUE(withSettings->advanceAt().isDisabled());
    withSettings->start(7);
    EXPECT_TRUE(withSettings->advance());
    EXPECT_EQ(withSettings->advanceAt(), PollDeadline(clock.steady() + std::chrono::seconds(5)));
    clock.advance(std::chrono::seconds(3)); // after the first one's time
    EXPECT_TRUE(withSettings->advance());
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(TelnetLineTest, APeerThatDoesNotAgreeIsNotWarnedAboutAtEachConnection)
{
    const CapturedLog log(LogLevel::Warn);
    const auto withSettings = tool::telnetLine(std::make_unique<WireLine>(wire), SerialSettings::parse("9600n8"));
    for (const std::string& answer : {std::string(), std::string(), kAgreed, std::string()}) {
        withSettings->start(7);
        EXPECT_TRUE(withSettings->advance());
        wire.toRead = answer;
        std::array<char, 100> buffer;
        withSettings->read(buffer.data(), buffer.size());
        clock.advance(std::chrono::seconds(5));
        EXPECT_TRUE(withSettings->advance());
        withSettings->stop();
    }
    EXPECT_EQ(log.lines().size(), 2U); // the first one, and the one after the peer that agreed
}

TEST_F(TelnetLineTest, APeerThatBreaksTheProtocolEndsTheLine)
{
    bringUp();
    wire.toRead = "\xFF\xFA\x56\xFF\xF0";
    std::array<char, 10> buffer;
    EXPECT_EQ(line->read(buffer.data(), buffer.size()).state, LineState::Ended);
    EXPECT_EQ(line->endReason(), "the peer compresses its data without agreement");
    line->start(7);
    EXPECT_EQ(wire.stops, 1U) << "the connection is given up";
    EXPECT_EQ(wire.starts, 2U);
    EXPECT_TRUE(line->advance());
    wire.toRead = "new";
    EXPECT_EQ(readAll(), "new");
}

TEST_F(TelnetLineTest, WhatCameBeforeABreachOfTheProtocolIsRead)
{
    bringUp();
    wire.toRead = "last words\xFF\xFA\x56\xFF\xF0lost";
    std::array<char, 100> buffer;
    const auto result = line->read(buffer.data(), buffer.size());
    EXPECT_EQ(result.state, LineState::Data);
    EXPECT_EQ(std::string(buffer.data(), result.length), "last words");
    EXPECT_TRUE(line->advanceAt().isExpired(clock.steady())) << "nothing else would make anybody call the line again";
    const std::string reason = "the peer compresses its data without agreement";
    EXPECT_THAT([&] { line->advance(); }, ThrowsMessage<std::runtime_error>(StrEq(reason)));
    EXPECT_EQ(line->read(buffer.data(), buffer.size()).state, LineState::Ended);
    EXPECT_EQ(line->endReason(), reason);
    line->start(7);
    EXPECT_TRUE(line->advance());
    EXPECT_TRUE(line->advanceAt().isDisabled());
    wire.toRead = "new";
    EXPECT_EQ(readAll(), "new");
}

TEST_F(TelnetLineTest, TheEndOfTheConnectionInTheMiddleOfACommandIsTheEnd)
{
    bringUp();
    wire.toRead = "x\xFF";
    wire.hasEnded = true;
    EXPECT_EQ(readAll(), "x");
    std::array<char, 10> buffer;
    EXPECT_EQ(line->read(buffer.data(), buffer.size()).state, LineState::Ended);
    EXPECT_EQ(line->endReason(), "the reason of the connection");
    line->start(7);
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written.size(), 15U) << "a new connection begins anew";
    wire.toRead = std::string("\xFB\x01", 2);
    EXPECT_EQ(readAll(), "\xFB\x01") << "nothing is left of the old one";
}

TEST_F(TelnetLineTest, StartingALineThatIsUpChangesNothing)
{
    bringUp();
    line->start(7);
    EXPECT_EQ(wire.stops, 0U);
    EXPECT_TRUE(line->advance());
    EXPECT_EQ(wire.written, "");
}

TEST_F(TelnetLineTest, TheDescriptorAndTheHangUpAreThoseOfTheConnection)
{
    EXPECT_EQ(line->descriptor(), -1);
    bringUp();
    EXPECT_EQ(line->descriptor(), 42);
    EXPECT_FALSE(line->hasHungUp());
    wire.hasEnded = true;
    EXPECT_TRUE(line->hasHungUp());
    line->stop();
    EXPECT_EQ(line->descriptor(), -1);
}

} // namespace

} // namespace qel::test
