#pragma once

#include <qel/protocol/CommandEnd.hpp>

#include <cstddef>
#include <optional>

namespace qel::protocol {

/// The serial line of one partition, as the hypervisor's logic sees it. No operation blocks.
/// Thread safety: none of its own; the hypervisor calls it with its lock held.
class SerialLine {
public:
    enum class LineState {
        Data,  ///< bytes were read
        Idle,  ///< nothing to read at the moment
        Ended, ///< end of stream: the command is gone, or has closed its terminal, and all its output has been read
    };
    struct ReadResult {
        LineState state;
        std::size_t length; ///< bytes read; not 0 only with Data
    };

    virtual ~SerialLine() = default;

    /// Starts the command. Does nothing while it runs; starts it again when it has ended.
    /// @throws PosixError  the command cannot be started
    virtual void start() = 0;

    /// True from start() to stop(), even after the command has ended.
    virtual bool isRunning() const = 0;

    /// True when the command is gone, or has closed its terminal. Some of its output may still be there to read.
    virtual bool hasHungUp() const = 0;

    /// How the command ended; empty while it runs. Unknown when another part of the system has reaped it.
    virtual std::optional<CommandEnd> commandEnd() = 0;

    /// Reads at most `length` bytes of the command's output.
    virtual ReadResult read(char* buffer, std::size_t length) = 0;

    /// @return how many of the bytes the line took, 0 to `length`
    /// @throws PosixError  the line is broken
    virtual std::size_t write(const char* data, std::size_t length) = 0;

    /// The descriptor to poll for the line to become readable or writable, or to hang up; -1 while the line is down.
    virtual int descriptor() const = 0;

    /// Takes the line down and ends the command. Does nothing while the line is down.
    virtual void stop() = 0;
};

} // namespace qel::protocol
