// Lines that are serial ports. A pseudo-terminal is the port; its master is the far side.

#include "hypervisor/DeviceLine.hpp"
#include "protocol/hypervisor/LineDriver.hpp"
#include "support/CapturedLog.hpp"
#include "support/Pty.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <stdexcept>
#include <string>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <vector>

namespace qel::test {

namespace {

using protocol::DeviceLine;
using protocol::deviceLine;
using protocol::SerialLine;
using protocol::SerialSettings;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using LineState = SerialLine::LineState;

class DeviceLineTest : public ::testing::Test {
protected:
    bool isExclusive() const
    {
        int exclusive = -1;
        EXPECT_EQ(::ioctl(mPty.slave(), TIOCGEXCL, &exclusive), 0);
        return exclusive != 0;
    }

    /// Whether another program could lock the port.
    bool canLock() const
    {
        const bool canLock = ::flock(mPty.slave(), LOCK_EX | LOCK_NB) == 0;
        if (canLock) ::flock(mPty.slave(), LOCK_UN);
        return canLock;
    }

    Pty mPty;
};

TEST_F(DeviceLineTest, IsDownBeforeStartAndAfterStop)
{
    const auto line = deviceLine(mPty.name());
    EXPECT_EQ(line->descriptor(), -1);
    line->stop();
    line->start(7);
    EXPECT_TRUE(line->advance());
    EXPECT_GE(line->descriptor(), 0);
    line->stop();
    EXPECT_EQ(line->descriptor(), -1);
}

TEST_F(DeviceLineTest, CarriesAllByteValuesBothWays)
{
    const auto line = deviceLine(mPty.name());
    LineDriver driver(*line);
    driver.bringUp();
    driver.write(everyByte());
    EXPECT_EQ(mPty.read(256), everyByte());
    mPty.type(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
}

TEST_F(DeviceLineTest, IsIdleWithNothingToRead)
{
    const auto line = deviceLine(mPty.name());
    line->start(7);
    char byte = 0;
    EXPECT_EQ(line->read(&byte, 1).state, LineState::Idle);
    EXPECT_FALSE(line->hasHungUp());
}

TEST_F(DeviceLineTest, SetsTheSpeedAndRawModeAndIgnoresModemLines)
{
    const auto line = deviceLine(mPty.name(), SerialSettings::parse("9600n82"));
    line->start(7);
    const termios attributes = mPty.attributes();
    EXPECT_TRUE(isRaw(attributes));
    EXPECT_EQ(::cfgetispeed(&attributes), speed_t(B9600));
    EXPECT_EQ(::cfgetospeed(&attributes), speed_t(B9600));
    EXPECT_EQ(attributes.c_cflag & (CSIZE | CSTOPB | CLOCAL | CREAD), tcflag_t(CS8 | CSTOPB | CLOCAL | CREAD));
    EXPECT_EQ(attributes.c_iflag & (IXON | IXOFF | INPCK), tcflag_t(0));
}

TEST_F(DeviceLineTest, HardwareFlowControlIsOnlyOnWhenAskedFor)
{
    const auto with = deviceLine(mPty.name(), SerialSettings::parse("9600,rtscts"));
    with->start(7);
    EXPECT_NE(mPty.attributes().c_cflag & CRTSCTS, tcflag_t(0));
    with->stop();
    const auto without = deviceLine(mPty.name(), SerialSettings::parse("9600"));
    without->start(7);
    EXPECT_EQ(mPty.attributes().c_cflag & CRTSCTS, tcflag_t(0));
}

TEST_F(DeviceLineTest, IsExclusiveAndLockedUntilStop)
{
    const auto line = deviceLine(mPty.name());
    EXPECT_FALSE(isExclusive());
    line->start(7);
    EXPECT_TRUE(isExclusive());
    EXPECT_FALSE(canLock());
    line->stop();
    EXPECT_FALSE(isExclusive());
    EXPECT_TRUE(canLock());
}

TEST_F(DeviceLineTest, APortThatAnotherProgramHasLockedIsRefusedAndLeftAsItIs)
{
    const termios before = mPty.attributes();
    ASSERT_EQ(::flock(mPty.slave(), LOCK_EX), 0);
    const auto line = deviceLine(mPty.name());
    EXPECT_THAT([&] { line->start(7); },
                ThrowsMessage<std::runtime_error>(StrEq(mPty.name() + " is in use by another program")));
    EXPECT_TRUE(mPty.attributes() == before);
    EXPECT_EQ(line->descriptor(), -1);
    ASSERT_EQ(::flock(mPty.slave(), LOCK_UN), 0);
    line->start(7);
    EXPECT_GE(line->descriptor(), 0);
}

TEST_F(DeviceLineTest, StopRestoresTheSettings)
{
    const termios before = mPty.attributes();
    {
        const auto line = deviceLine(mPty.name(), SerialSettings::parse("300n8"));
        line->start(7);
        EXPECT_FALSE(mPty.attributes() == before);
        line->stop();
        EXPECT_TRUE(mPty.attributes() == before);
        line->start(7);
    }
    EXPECT_TRUE(mPty.attributes() == before) << "the destructor stops the line, too";
}

TEST_F(DeviceLineTest, StopDropsWhatHasNotBeenSent)
{
    const auto line = deviceLine(mPty.name());
    line->start(7);
    constexpr int kOn = 1;
    ASSERT_EQ(::ioctl(mPty.master(), TIOCPKT, &kOn), 0); // the master reads what is done to the terminal
    line->stop();
    char done = 0;
    ASSERT_EQ(::read(mPty.master(), &done, 1), 1);
    EXPECT_NE(done & TIOCPKT_FLUSHWRITE, 0);
}

TEST_F(DeviceLineTest, IsClosedInOtherPrograms)
{
    const auto line = deviceLine(mPty.name());
    line->start(7);
    EXPECT_NE(::fcntl(line->descriptor(), F_GETFD) & FD_CLOEXEC, 0);
}

TEST_F(DeviceLineTest, AFormatThatThePortDoesNotTakeIsRefused)
{
    const termios before = mPty.attributes();
    const auto line = deviceLine(mPty.name(), SerialSettings::parse("9600e7")); // a pseudo-terminal has 8 bits
    EXPECT_THAT([&] { line->start(7); },
                ThrowsMessage<std::runtime_error>(StrEq(mPty.name() + " does not take 9600e7")));
    EXPECT_TRUE(mPty.attributes() == before);
}

TEST_F(DeviceLineTest, AFileThatIsNotASerialPortIsRefused)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("file");
    std::ofstream(path) << "text";
    EXPECT_THAT([&] { deviceLine(path)->start(7); },
                ThrowsMessage<std::runtime_error>(StrEq(path + " is not a serial port")));
}

TEST_F(DeviceLineTest, ADeviceThatIsNotThereIsTheReason)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("none");
    EXPECT_THAT([&] { deviceLine(path)->start(7); },
                ThrowsMessage<std::runtime_error>(StrEq("cannot open " + path + ": No such file or directory")));
}

TEST_F(DeviceLineTest, EndsWhenTheDeviceIsGoneAndOpensItAgain)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("port");
    ASSERT_EQ(::symlink(mPty.name().c_str(), path.c_str()), 0);
    const auto line = deviceLine(path);
    LineDriver driver(*line);
    driver.bringUp();
    mPty.hangUp();
    EXPECT_EQ(driver.readUntilEnd(), "");
    EXPECT_EQ(line->endReason(), "the device is gone");

    const Pty other;
    ASSERT_EQ(::unlink(path.c_str()), 0);
    ASSERT_EQ(::symlink(other.name().c_str(), path.c_str()), 0);
    driver.bringUp();
    EXPECT_EQ(line->endReason(), "");
    other.type("back");
    EXPECT_EQ(driver.read(4), "back");
}

TEST_F(DeviceLineTest, WritingToADeviceThatIsGoneFails)
{
    const auto line = deviceLine(mPty.name());
    line->start(7);
    mPty.hangUp();
    EXPECT_TRUE(line->hasHungUp());
    EXPECT_THAT([&] { line->write("x", 1); }, ThrowsMessage<std::runtime_error>(StrEq("cannot write to " + mPty.name() +
                                                                                      ": 5 (Input/output error)")));
    EXPECT_EQ(line->endReason(), "the device is gone");
}

TEST_F(DeviceLineTest, AFullPortTakesNothingAndResumes)
{
    const auto line = deviceLine(mPty.name());
    LineDriver driver(*line);
    driver.bringUp();
    const std::size_t taken = driver.fill();
    EXPECT_GT(taken, 0U);
    EXPECT_EQ(mPty.read(taken), std::string(taken, 'x'));
    driver.write("y");
    EXPECT_EQ(mPty.read(1), "y");
}

TEST_F(DeviceLineTest, StartingAPortThatIsOpenChangesNothing)
{
    const auto line = deviceLine(mPty.name());
    line->start(7);
    const int descriptor = line->descriptor();
    line->start(7);
    EXPECT_EQ(line->descriptor(), descriptor);
}

TEST_F(DeviceLineTest, RefusesAnEmptyDeviceANullCharacterAndWrongSettings)
{
    EXPECT_THAT([] { deviceLine(""); }, ThrowsMessage<std::invalid_argument>(StrEq("device: it is empty")));
    EXPECT_THAT([] { deviceLine(std::string("a\0b", 3)); },
                ThrowsMessage<std::invalid_argument>(StrEq("device: it contains a null character")));
    SerialSettings settings;
    settings.speed = 12345;
    EXPECT_THAT(
        [&] { deviceLine("/dev/ttyS0", settings); },
        ThrowsMessage<std::invalid_argument>(StrEq("settings: \"12345n8\" has a speed that serial ports do not have")));
}

/// A port whose break is switched into a list.
class DeviceBreak : public DeviceLineTest {
protected:
    DeviceBreak() { mLine.start(7); }

    SettableClock mClock;
    std::vector<bool> mSwitched;
    int mError = 0;
    int mUnsent = 0;
    DeviceLine mLine{mPty.name(),
                     SerialSettings(),
                     {[this](int, bool on) {
                          mSwitched.push_back(on);
                          return mError;
                      },
                      [this](int) { return mUnsent; }}};
};

TEST_F(DeviceBreak, LastsAQuarterOfASecond)
{
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_THAT(mSwitched, ElementsAre(true));
    EXPECT_EQ(mLine.advanceAt(), PollDeadline(mClock.steady() + std::chrono::milliseconds(250)));
    mClock.advance(std::chrono::milliseconds(249));
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, ElementsAre(true));
    mClock.advance(std::chrono::milliseconds(1));
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, ElementsAre(true, false));
    EXPECT_TRUE(mLine.advanceAt().isDisabled());
}

TEST_F(DeviceBreak, InputWaitsForItsEnd)
{
    EXPECT_TRUE(mLine.sendBreak());
    const std::string input(4096, 'x');
    EXPECT_EQ(mLine.write(input.data(), 4095), 4095U);
    EXPECT_EQ(mLine.write("yz", 2), 1U);
    EXPECT_EQ(mLine.write("z", 1), 0U);
    EXPECT_FALSE(mLine.wantsToWrite());
    EXPECT_FALSE(PollSet(PollFd(mPty.master(), PollEvents::Read)).poll().anyReady());
    mClock.advance(std::chrono::milliseconds(250));
    EXPECT_TRUE(mLine.advance());
    LineDriver(mLine).write("z");
    EXPECT_EQ(mPty.read(4097), std::string(4095, 'x') + "yz");
    EXPECT_FALSE(mLine.wantsToWrite());
}

TEST_F(DeviceBreak, HeldInputThatThePortDoesNotTakeWaitsOn)
{
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_EQ(mLine.write("y", 1), 1U);
    ASSERT_EQ(::tcflow(mPty.slave(), TCOOFF), 0); // the port takes nothing
    mClock.advance(std::chrono::milliseconds(250));
    EXPECT_TRUE(mLine.advance());
    EXPECT_TRUE(mLine.wantsToWrite());
    EXPECT_EQ(mLine.write("z", 1), 0U);
    ASSERT_EQ(::tcflow(mPty.slave(), TCOON), 0);
    EXPECT_TRUE(mLine.advance());
    EXPECT_FALSE(mLine.wantsToWrite());
    LineDriver(mLine).write("z");
    EXPECT_EQ(mPty.read(2), "yz");
}

TEST_F(DeviceBreak, HeldInputIsDroppedWithTheLine)
{
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_EQ(mLine.write("old", 3), 3U);
    mLine.stop();
    mLine.start(7);
    EXPECT_TRUE(mLine.advance());
    LineDriver(mLine).write("new");
    EXPECT_EQ(mPty.read(3), "new");
}

TEST_F(DeviceBreak, BeginsWhenWhatWasWrittenBeforeHasBeenSent)
{
    mUnsent = 1;
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_EQ(mLine.advanceAt(), PollDeadline(mClock.steady() + DeviceLine::kDrainInterval));
    mClock.advance(DeviceLine::kDrainInterval);
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, IsEmpty());
    mUnsent = 0;
    EXPECT_TRUE(mLine.advance()) << "it is not due yet";
    EXPECT_THAT(mSwitched, IsEmpty());
    mClock.advance(DeviceLine::kDrainInterval);
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, ElementsAre(true));
}

TEST_F(DeviceBreak, BeginsAfterASecondWhenFlowControlHoldsTheOutput)
{
    mUnsent = 1;
    EXPECT_TRUE(mLine.sendBreak());
    mClock.advance(std::chrono::milliseconds(999));
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, IsEmpty());
    mClock.advance(DeviceLine::kDrainInterval);
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(mSwitched, ElementsAre(true));
}

TEST_F(DeviceBreak, AFailureAfterSendBreakHasReturnedIsLoggedAndTheLineGoesOn)
{
    const CapturedLog log(LogLevel::Warn);
    mUnsent = 1;
    EXPECT_TRUE(mLine.sendBreak());
    mUnsent = 0;
    mError = EIO;
    mClock.advance(DeviceLine::kDrainInterval);
    EXPECT_TRUE(mLine.advance());
    EXPECT_THAT(log.lines(), ElementsAre(EndsWith(mPty.name() + ": cannot send a break: Input/output error")));
    EXPECT_EQ(mLine.write("x", 1), 1U);
}

TEST_F(DeviceBreak, OneThatIsUnderWayIsNotBegunAgain)
{
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_TRUE(mLine.sendBreak());
    EXPECT_THAT(mSwitched, ElementsAre(true));
}

TEST_F(DeviceBreak, StopEndsIt)
{
    EXPECT_TRUE(mLine.sendBreak());
    mLine.stop();
    EXPECT_THAT(mSwitched, ElementsAre(true, false));
    EXPECT_TRUE(mLine.advanceAt().isDisabled());
}

TEST_F(DeviceBreak, APortThatHasNoneSaysSo)
{
    for (const int error : {ENOTTY, EINVAL}) {
        mError = error;
        EXPECT_FALSE(mLine.sendBreak());
        EXPECT_TRUE(mLine.advanceAt().isDisabled());
    }
}

TEST_F(DeviceBreak, AFailureIsAnException)
{
    mError = EIO;
    EXPECT_THAT([&] { mLine.sendBreak(); }, ThrowsMessage<std::runtime_error>(StrEq(
                                                "cannot send a break on " + mPty.name() + ": 5 (Input/output error)")));
    EXPECT_TRUE(mLine.advanceAt().isDisabled());
    EXPECT_EQ(mLine.write("x", 1), 1U) << "the line goes on";
}

} // namespace

} // namespace qel::test
