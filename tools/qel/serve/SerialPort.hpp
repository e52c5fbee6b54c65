#pragma once

#include <cstddef>

namespace qel::tool {

/// The serial line of one partition, as the hypervisor's logic sees it. None of the operations waits.
/// Thread safety: none of its own; the hypervisor calls it with its lock held.
class SerialPort {
public:
    enum class LineState {
        Data,  ///< bytes were read
        Idle,  ///< nothing to read at the moment
        Ended, ///< nothing more will come: the other side is gone, and everything it wrote has been read
    };
    struct ReadResult {
        LineState state;
        std::size_t length; ///< bytes read; not 0 only with Data
    };

    virtual ~SerialPort() = default;

    /// Brings the line up. Does nothing while it is up; a line whose other side has ended starts afresh.
    /// @throws PosixError  it cannot be brought up
    virtual void start() = 0;

    /// True from start() to stop(), even after the other side has ended.
    virtual bool isRunning() const = 0;

    /// True when the other side has ended, though some of what it wrote may still be there to read.
    virtual bool hasHungUp() const = 0;

    /// Reads at most `length` bytes of what the partition put out.
    virtual ReadResult read(char* buffer, std::size_t length) = 0;

    /// @return how many of the bytes the line took, 0 to `length`
    /// @throws PosixError  the line is broken
    virtual std::size_t write(const char* data, std::size_t length) = 0;

    /// What to wait on for the line to become readable or writable, or to hang up; -1 while it is not up.
    virtual int descriptor() const = 0;

    /// Takes the line down and ends the other side. Does nothing while it is down.
    virtual void stop() = 0;
};

} // namespace qel::tool
