#pragma once

#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace qel::protocol {

class ConsoleCore;
struct SerialState;

/// Why a virtual serial session ended.
enum class SessionEnd {
    None,             ///< it has not ended
    CommandEnded,     ///< read failure: the partition's command ended, and all of its output has been received
    Taken,            ///< force close: another console took or closed the session
    ShutDown,         ///< the hypervisor shuts down
    WriteFailure,     ///< the partition takes no more input
    Unknown,          ///< the notice has an unknown reason
    ConnectionClosed, ///< the hypervisor closes the connection
    Closed,           ///< this console closed it
};

/// The end in words, for people. Thread safety: any thread.
QEL_PROTOCOL_EXPORT const char* describe(SessionEnd end);

/// How to open a virtual serial session. The caller makes this struct, so its layout is part of the binary interface: a
/// new member needs a new soname.
struct SerialOptions {
    bool force = false;                      ///< take the session from the console that holds it
    std::uint16_t connection = 0;            ///< number of the serial connection within the partition
    std::size_t maxUnread = 4 * 1024 * 1024; ///< bytes of output that are kept until they are read; more than 0
};

/// The console's side of one virtual serial session. Console::openSerial() makes it.
///
/// The session is a byte stream in both directions. Output of the partition that arrives while the console waits for
/// something else is kept; up to one message beyond SerialOptions::maxUnread.
///
/// What the calls throw is described at Console. Data that was received before a failure can still be read.
///
/// Destroying an open session closes it, without waiting for the hypervisor: a request to close it is sent if the
/// connection takes it at once; over a stream without a descriptor, other than one of makeMemoryStreams(), none is
/// sent. An opening that was given up and is granted later is closed in the same way.
///
/// Lifetime: may outlive its console; its calls then throw Error. Movable; a moved-from session can only be destroyed
/// or assigned to. Thread safety: the thread of the console.
class QEL_PROTOCOL_EXPORT SerialSession {
public:
    /// The most bytes that one message carries.
    static constexpr std::size_t kMaxData = 16346;

    SerialSession(SerialSession&& other) noexcept;
    SerialSession& operator=(SerialSession&& other) noexcept;
    ~SerialSession();

    std::uint16_t getPartition() const noexcept;
    std::uint16_t getConnection() const noexcept;

    // Output of the partition.

    /// Waits until there is output, without limit, and takes it.
    /// @param buffer  room for `length` bytes, at least 1
    /// @return the number of bytes; 0: the session has ended, and all of its output has been read
    /// @throws std::invalid_argument  "length: zero"
    std::size_t read(char* buffer, std::size_t length);
    /// The same with a limit. @throws DeadlinePassed  there was no output in time
    std::size_t read(char* buffer, std::size_t length, std::chrono::milliseconds timeout);

    /// Takes output that has been received; receives nothing.
    /// @return the number of bytes; 0: there is none at the moment
    std::size_t readAvailable(char* buffer, std::size_t length) noexcept;
    /// How many bytes readAvailable() can take.
    std::size_t getAvailable() const noexcept;

    // Input for the partition.

    /// Sends all bytes. While the hypervisor takes nothing, receives messages, so that neither side blocks the other,
    /// as long as every session of the console has room for its output.
    ///
    /// The bytes go out as messages; each must be taken within the request timeout. When one is not, read the output
    /// and go on with the rest: the connection is as good as before.
    /// @return the number of bytes sent: fewer than `length` only when the session ended first or a message was not
    ///         taken in time
    /// @throws DeadlinePassed  not even the first message was taken in time
    std::size_t write(const char* data, std::size_t length);
    std::size_t write(const std::string& data) { return write(data.data(), data.size()); }

    /// How many bytes of input have been sent since the session was opened, by write() and writeSome(): tells how far a
    /// write() has come that an exception of a handler has left.
    std::uint64_t getSent() const noexcept;

    /// Sends the beginning of the bytes as one message. For a loop that waits until the console can be written to; does
    /// not receive.
    /// @param data  not empty; the bytes that were sent, at most kMaxData, are removed. All of them when the session
    /// has
    ///         ended
    void writeSome(std::string& data);

    // The end.

    /// Why the session ended; None while it is open.
    SessionEnd getEnd() const noexcept;
    /// How the command ended, with SessionEnd::CommandEnded; otherwise unknown.
    CommandEnd getCommandEnd() const noexcept;
    /// The end in words: describe(getEnd()), and how the command ended where the hypervisor says so.
    std::string describeEnd() const;

    /// Closes the session, unless it has ended. Output that has been received can still be read; while this waits, it
    /// may exceed SerialOptions::maxUnread.
    /// @throws StatusError  the hypervisor refuses; and what Console documents
    void close();
    /// The same with a timeout of its own; without it the request timeout of the console.
    void close(std::chrono::milliseconds timeout);

private:
    friend class Console;
    SerialSession(std::shared_ptr<ConsoleCore> core, std::shared_ptr<SerialState> state) noexcept;
    void pRelease() noexcept;

    std::shared_ptr<ConsoleCore> mCore;
    std::shared_ptr<SerialState> mState;
};

} // namespace qel::protocol
