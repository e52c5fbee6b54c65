#include "hypervisor/DeviceLine.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include "hypervisor/SerialSpeed.hpp"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <stdexcept>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <system_error>
#include <unistd.h>
#include <utility>

namespace qel::protocol {

namespace {

std::string describe(int error) { return std::system_category().message(error); }

bool isTransient(int error) { return error == EAGAIN || error == EINTR; }

tcflag_t sizeFlag(std::uint8_t dataBits)
{
    constexpr tcflag_t kSizes[] = {CS5, CS6, CS7, CS8};
    return kSizes[dataBits - 5];
}

tcflag_t formatFlags(const SerialSettings& settings)
{
    tcflag_t flags = sizeFlag(settings.dataBits);
    if (settings.parity != SerialSettings::Parity::None) flags |= PARENB;
    if (settings.parity == SerialSettings::Parity::Odd) flags |= PARODD;
    if (settings.stopBits == 2) flags |= CSTOPB;
    if (settings.hardwareFlowControl) flags |= CRTSCTS;
    return flags;
}

constexpr tcflag_t kFormatMask = CSIZE | PARENB | PARODD | CSTOPB | CRTSCTS;

/// Raw mode at the speed and in the format of the settings.
termios rawMode(termios attributes, const SerialSettings& settings)
{
    ::cfmakeraw(&attributes);
    // Without INPCK a byte with a wrong parity is read as it is; with IGNBRK a break is not read as a null character.
    attributes.c_iflag &= ~static_cast<tcflag_t>(IXOFF | IXANY | INPCK | IUCLC);
    attributes.c_iflag |= IGNBRK;
    attributes.c_cflag &= ~kFormatMask;
    attributes.c_cflag |= formatFlags(settings) | CLOCAL | CREAD;
    attributes.c_cc[VMIN] = 1; // with 0, reading nothing would look like the end
    attributes.c_cc[VTIME] = 0;
    const speed_t code = toSpeedCode(settings.speed).value();
    static_cast<void>(::cfsetispeed(&attributes, code));
    static_cast<void>(::cfsetospeed(&attributes, code));
    return attributes;
}

bool hasTaken(const termios& wanted, const termios& actual)
{
    return (wanted.c_cflag & kFormatMask) == (actual.c_cflag & kFormatMask) &&
           ::cfgetospeed(&wanted) == ::cfgetospeed(&actual);
}

int switchBreak(int fd, bool on) { return ::ioctl(fd, on ? TIOCSBRK : TIOCCBRK) == 0 ? 0 : errno; }

int unsentBytes(int fd)
{
    int unsent = 0;
    return ::ioctl(fd, TIOCOUTQ, &unsent) == 0 ? unsent : 0;
}

} // namespace

DeviceLine::DeviceLine(std::string device, SerialSettings settings)
    : DeviceLine(std::move(device), settings, {switchBreak, unsentBytes})
{}

DeviceLine::DeviceLine(std::string device, SerialSettings settings, Port calls)
    : mDevice(std::move(device)), mSettings(settings), mCalls(std::move(calls))
{}

DeviceLine::~DeviceLine() { DeviceLine::stop(); }

void DeviceLine::start(std::uint16_t /*partition*/)
{
    if (mPort.get() >= 0) {
        if (!mHasEnded) return;
        stop();
    }
    UniqueFd port = pOpen();
    termios before{};
    if (::tcgetattr(port.get(), &before) != 0) throw std::runtime_error(mDevice + " is not a serial port");
    if (::flock(port.get(), LOCK_EX | LOCK_NB) != 0) {
        throw std::runtime_error(mDevice + " is in use by another program");
    }
    pSetUp(port.get(), before);
    static_cast<void>(::ioctl(port.get(), TIOCEXCL)); // cannot fail on a terminal
    mBefore = before;
    mPort = std::move(port);
}

void DeviceLine::stop()
{
    if (mPort.get() >= 0) {
        pEndBreak();
        // Closing would wait for output that flow control holds, half a minute long.
        static_cast<void>(::tcflush(mPort.get(), TCOFLUSH));
        static_cast<void>(::tcsetattr(mPort.get(), TCSANOW, &mBefore));
        static_cast<void>(::ioctl(mPort.get(), TIOCNXCL));
    }
    mPort.reset();
    mHeld.clear();
    mHasEnded = false;
    mReason.clear();
}

bool DeviceLine::advance()
{
    const int error = pStepBreak();
    if (error != 0) logLine(LogLevel::Warn, mDevice, ": cannot send a break: ", describe(error));
    if (wantsToWrite()) pWriteHeld();
    return true;
}

bool DeviceLine::wantsToWrite() const { return mBreak != Break::On && !mHeld.empty(); }

PollDeadline DeviceLine::advanceAt() const { return mBreakStep; }

SerialLine::ReadResult DeviceLine::read(char* buffer, std::size_t length)
{
    const ssize_t count = ::read(mPort.get(), buffer, length);
    const int error = errno;
    if (count > 0) return {LineState::Data, static_cast<std::size_t>(count)};
    if (count < 0 && isTransient(error)) return {LineState::Idle, 0};
    mReason = count == 0 || error == EIO ? "the device is gone" : describe(error);
    mHasEnded = true;
    return {LineState::Ended, 0};
}

std::size_t DeviceLine::write(const char* data, std::size_t length)
{
    if (mBreak == Break::On) { // the port would lose it
        const std::size_t taken = std::min(length, kMaxHeld - mHeld.size());
        mHeld.append(data, taken);
        return taken;
    }
    if (!mHeld.empty()) pWriteHeld();
    return mHeld.empty() ? pWrite(data, length) : 0;
}

/// @return how many bytes the port took
std::size_t DeviceLine::pWrite(const char* data, std::size_t length)
{
    const ssize_t count = ::write(mPort.get(), data, length);
    const int error = errno;
    if (count >= 0) return static_cast<std::size_t>(count);
    if (isTransient(error)) return 0;
    mReason = error == EIO ? "the device is gone" : describe(error);
    mHasEnded = true;
    throw PosixError(error, "cannot write to " + mDevice);
}

int DeviceLine::descriptor() const { return mPort.get(); }

std::string DeviceLine::endReason() const { return mReason; }

bool DeviceLine::sendBreak()
{
    if (mBreak != Break::None) return true; // one is under way
    mBreak = Break::Draining;
    mBreakStep = TimeProvider::steady();
    mDrainLimit = TimeProvider::steady() + kDrainLimit;
    const int error = pStepBreak();
    if (error == ENOTTY || error == EINVAL) return false;
    if (error != 0) throw PosixError(error, "cannot send a break on " + mDevice);
    return true;
}

void DeviceLine::pWriteHeld() { mHeld.erase(0, pWrite(mHeld.data(), mHeld.size())); }

UniqueFd DeviceLine::pOpen() const
{
    UniqueFd port(::open(mDevice.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC | O_NONBLOCK));
    const int error = errno;
    if (port.get() >= 0) return port;
    if (error == EBUSY) throw std::runtime_error(mDevice + " is in use by another program");
    throw std::runtime_error("cannot open " + mDevice + ": " + describe(error));
}

void DeviceLine::pSetUp(int fd, const termios& before) const
{
    const termios wanted = rawMode(before, mSettings);
    termios actual{};
    // tcsetattr() reports success when it could change anything at all.
    if (::tcsetattr(fd, TCSANOW, &wanted) == 0 && ::tcgetattr(fd, &actual) == 0 && hasTaken(wanted, actual)) return;
    static_cast<void>(::tcsetattr(fd, TCSANOW, &before));
    throw std::runtime_error(mDevice + " does not take " + mSettings.str());
}

/// Does what is due of a break. @return 0, or the error number of a break that could not be begun
int DeviceLine::pStepBreak()
{
    const auto now = TimeProvider::steady();
    if (mBreak == Break::None || !mBreakStep.isExpired(now)) return 0;
    if (mBreak == Break::On) {
        pEndBreak();
        return 0;
    }
    if (mCalls.unsentBytes(mPort.get()) > 0 && !mDrainLimit.isExpired(now)) {
        mBreakStep = now + kDrainInterval;
        return 0;
    }
    const int error = mCalls.switchBreak(mPort.get(), true);
    mBreak = error == 0 ? Break::On : Break::None;
    mBreakStep = error == 0 ? PollDeadline(now + kBreakTime) : PollDeadline();
    return error;
}

void DeviceLine::pEndBreak()
{
    if (mBreak == Break::On) static_cast<void>(mCalls.switchBreak(mPort.get(), false)); // a device that is gone refuses
    mBreak = Break::None;
    mBreakStep = PollDeadline();
}

std::unique_ptr<SerialLine> deviceLine(const std::string& device, const SerialSettings& settings)
{
    if (device.empty()) throw std::invalid_argument("device: it is empty");
    if (device.find('\0') != std::string::npos) throw std::invalid_argument("device: it contains a null character");
    return std::make_unique<DeviceLine>(device, SerialSettings::parse(settings.str())); // which checks them
}

} // namespace qel::protocol
