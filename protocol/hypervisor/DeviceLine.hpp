#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/DeviceLine.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <termios.h>

namespace qel::protocol {

/// A serial line that is a serial port; its public header says how it behaves.
///
/// Not tcsendbreak(3): it waits until all output has been sent, without a limit where flow control holds it, and then
/// for a quarter to half a second, under the lock of all partitions.
///
/// Sources: termios(3), ioctl_tty(2). Thread safety: that of a SerialLine.
class DeviceLine final : public SerialLine {
public:
    /// What a test replaces, since a pseudo-terminal does not have it.
    struct Port {
        std::function<int(int fd, bool on)> switchBreak; ///< 0 or an error number
        std::function<int(int fd)> unsentBytes;          ///< written and not sent yet
    };

    /// How often to look whether output has been sent before a break, and for how long.
    static constexpr std::chrono::milliseconds kDrainInterval{10};
    static constexpr std::chrono::milliseconds kDrainLimit{1000};
    static constexpr std::chrono::milliseconds kBreakTime{250};
    /// Bytes of input that are taken during a break.
    static constexpr std::size_t kMaxHeld = 4096;

    DeviceLine(std::string device, SerialSettings settings);
    DeviceLine(std::string device, SerialSettings settings, Port calls);
    ~DeviceLine() override;
    DeviceLine(const DeviceLine&) = delete;
    DeviceLine& operator=(const DeviceLine&) = delete;

    void start(std::uint16_t partition) override;
    void stop() override;
    bool advance() override;
    bool wantsToWrite() const override;
    PollDeadline advanceAt() const override;
    ReadResult read(char* buffer, std::size_t length) override;
    std::size_t write(const char* data, std::size_t length) override;
    int descriptor() const override;
    std::string endReason() const override;
    bool sendBreak() override;

private:
    enum class Break { None, Draining, On };

    std::size_t pWrite(const char* data, std::size_t length);
    void pWriteHeld();
    UniqueFd pOpen() const;
    void pSetUp(int fd, const termios& before) const;
    int pStepBreak();
    void pEndBreak();

    const std::string mDevice;
    const SerialSettings mSettings;
    const Port mCalls;
    UniqueFd mPort;
    termios mBefore{}; // the settings of the port before it was opened
    bool mHasEnded = false;
    std::string mReason; // why it has ended
    Break mBreak = Break::None;
    std::string mHeld;        // input for after the break
    PollDeadline mBreakStep;  // when to look after the break again
    PollDeadline mDrainLimit; // when to begin the break at the latest
};

} // namespace qel::protocol
