#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace qel::protocol {

/// The serial line of one partition: what Hypervisor::addPartition() takes. commandLine() makes the line of a command;
/// derive from this class for any other one, such as a device or a socket.
///
/// A line is down at first. start() brings it up, at the latest when a console opens the partition's session; stop()
/// takes it down. read(), write() and hasHungUp() are called only while it is up.
///
/// A line that takes time to come up, such as one that connects, overrides advance(): start() begins, and advance() is
/// called until it returns true. Until then the line is coming up, and read(), write() and hasHungUp() are not called.
///
///     start() ---> coming up -- advance() returns true --> up -- read() returns Ended, or a failure --> ended
///                      |                                                                                  |
///                      +---- advance() throws ----> stop() <----------------------------------------------+
///
/// PartitionOptions::keepsSession says whether the sessions survive the end of the line, and that it is started again.
///
/// No operation may block: one lock is held for all consoles and partitions. Whatever an operation throws is logged,
/// and the operation has failed: the session ends, or the request of the console is answered with status 6. With
/// PartitionOptions::keepsSession the session goes on, and the line is brought up again.
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

    /// Writes input of a console. Called while the line is up, with at least one byte.
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

    // For lines that connect. The defaults suit a line that is up when start() returns.

    /// Takes the next step: of coming up, or of work that the line has of its own, such as writing protocol bytes or
    /// ending a break. Called after start(); while the line is coming up, whenever descriptor() is readable or has hung
    /// up; at any time when wantsToWrite() and descriptor() is writable; and when advanceAt() has passed. Extra calls
    /// do no harm. The default returns true.
    /// @return true: the line is up; false: it is coming up. Once true, stays true until stop()
    /// @throws any exception  the line cannot be brought up, or is broken; what() is the reason that people read, such
    ///         as "cannot connect to /run/vm.sock: Connection refused". stop() follows
    virtual bool advance();

    /// Whether advance() waits for descriptor() to become writable: while it connects, or has bytes of its own to
    /// write. The default returns false.
    virtual bool wantsToWrite() const;

    /// When to call advance() at the latest, for a time limit of the line; in the time of TimeProvider::steady(). The
    /// default is the disabled deadline.
    virtual PollDeadline advanceAt() const;

    /// Why the line has ended, for people, without a full stop: "the peer has closed the connection". Asked after
    /// read() has returned Ended or an operation has thrown, before stop(). Empty, which the default returns: what the
    /// operation threw says it, or commandEnd().
    virtual std::string endReason() const;

    /// Sends a break. Called while the line is up. The default returns false.
    /// @return false: this line has no break
    /// @throws any exception  it could not be sent; the line goes on
    virtual bool sendBreak();
};

} // namespace qel::protocol
