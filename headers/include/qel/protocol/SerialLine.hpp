#pragma once

#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <cstddef>
#include <cstdint>
#include <optional>

namespace qel::protocol {

/// The serial line of one partition: what Hypervisor::addPartition() takes. commandLine() makes the line of a command;
/// derive from this class for any other one, such as a device or a socket.
///
/// A line is down at first. start() brings it up, at the latest when a console opens the partition's session; stop()
/// takes it down. read(), write() and hasHungUp() are called only while it is up.
///
/// No operation may block: one lock is held for all consoles and partitions. Whatever an operation throws is logged,
/// and the operation has failed: the session ends, or the request of the console is answered with status 6.
/// Thread safety: none needed; one operation is called at a time, from several threads.
class QEL_PROTOCOL_EXPORT SerialLine {
public:
    /// What read() found.
    enum class LineState {
        Data,  ///< bytes were read
        Idle,  ///< nothing to read at the moment
        Ended, ///< end of stream: nothing more will come, and all output has been read
    };
    /// The result of read().
    struct ReadResult {
        LineState state;
        std::size_t length; ///< bytes read; not 0 only with Data
    };

    SerialLine() = default;
    virtual ~SerialLine();
    SerialLine(const SerialLine&) = delete;
    SerialLine& operator=(const SerialLine&) = delete;

    /// Brings the line up. Called whenever a console opens the session: does nothing while the line is up, except when
    /// what is at its other end has ended; then it starts that again.
    /// @param partition  the partition's id
    /// @throws any exception  the line cannot be brought up; the request gets status 6, and a session that another
    ///         console holds goes on unless the line is down now
    virtual void start(std::uint16_t partition) = 0;

    /// Takes the line down. Called on a line that is down too, and does nothing then.
    virtual void stop() = 0;

    /// Reads at most `length` bytes of the partition's output. After Idle, descriptor() becomes readable when there is
    /// more, and not before.
    virtual ReadResult read(char* buffer, std::size_t length) = 0;

    /// Writes input of a console.
    /// @return how many of the bytes the line took, 0 to `length`; when fewer than all, descriptor() becomes writable
    ///         when it takes more
    /// @throws any exception  the line is broken; the session ends with reason 5 (write failure)
    virtual std::size_t write(const char* data, std::size_t length) = 0;

    /// The descriptor to poll for the line to become readable or writable, or to hang up; -1 while the line is down.
    virtual int descriptor() const = 0;

    /// True when nothing will read what is written any more. Some output may still be there to read.
    /// The default asks poll(2) about descriptor().
    virtual bool hasHungUp() const;

    /// How the command on the line ended, asked after the end of stream; empty: it has not, so ask again. The consoles
    /// are told. The default says that it is unknown.
    virtual std::optional<CommandEnd> commandEnd();
};

} // namespace qel::protocol
