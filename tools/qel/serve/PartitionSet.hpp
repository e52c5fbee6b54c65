#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>

#include "serve/Console.hpp"
#include "serve/SerialPort.hpp"

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace qel::tool {

/// What the thread that moves serial data has to wait for on one partition.
struct SerialWatch {
    std::uint16_t partition;
    PollFd fd;
};

/// The partitions and their virtual serial sessions: who holds which, and the bytes that go through them.
///
/// Each partition has one session at a time, on connection number 0. Output is read from a partition only when the
/// console that holds its session has room for it, so that nothing is lost and nothing piles up; input that a partition
/// does not take is kept, and hasInputRoom() tells when no more of it should be accepted.
///
/// Ownership: owns the ports, borrows the consoles: release() must come before a console goes.
/// Thread safety: none of its own; the hypervisor guards it with its lock.
class PartitionSet {
public:
    /// The one connection number that a partition's console has.
    static constexpr std::uint16_t kConnectionNumber = 0;
    /// Bytes of input that a partition may be behind before its console is not read any further.
    static constexpr std::size_t kInputLimit = 64 * 1024;
    /// Bytes of output that go into one message at most.
    static constexpr std::size_t kOutputChunk = 4096;

    PartitionSet();
    ~PartitionSet();
    PartitionSet(PartitionSet&&) noexcept;

    /// @throws std::invalid_argument  "partition": there is one of that id
    void add(std::uint16_t id, std::unique_ptr<SerialPort> port);

    std::size_t size() const noexcept { return mPartitions.size(); }

    /// Opens the session of a partition for a console and starts the partition's line if it is not up.
    /// @param force  take the session from the console that holds it, which is told so
    /// @return NoError; InvalidLparId, InvalidConnectionNumber, ConnectionNotAvailable (held, and no force) or
    /// CmdFailed
    ///         (the line cannot be started), in this order, and nothing is changed
    QelMessageStatusCodes open(Console& console, std::uint16_t id, std::uint16_t connection, bool force);

    /// Lets the data of an open session flow. Setting up twice changes nothing.
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or InvalidCmdSequence (the console does not hold it)
    QelMessageStatusCodes setUp(Console& console, std::uint16_t id, std::uint16_t connection);

    /// Ends a session; the partition's line stays up.
    /// @param force  end it even if another console holds it, which is told so
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or ConnectionClosureFailure (nobody holds it, or another
    ///         console and no force)
    QelMessageStatusCodes close(Console& console, std::uint16_t id, std::uint16_t connection, bool force);

    /// Hands console input to a partition.
    /// @return false: the console holds no such session, or has not set it up; the data is dropped
    bool feed(const Console& console, const QelMessageVirtualSerialDataToOsAsync& data);

    /// Ends all sessions of a console without telling it.
    void release(const Console& console);

    /// Ends all sessions, tells their consoles that the hypervisor shuts down, and takes all lines down.
    void shutDown();

    /// False while a partition of which the console holds the session is behind with its input.
    bool hasInputRoom(const Console& console) const;

    /// What to wait for. Lines that nothing is wanted of are left out: a line that has hung up would otherwise be
    /// reported without end.
    std::vector<SerialWatch> watches() const;

    /// Whether sessions, lines or waiting input may have changed since the last call, and watches() with them. What the
    /// room in a console's link does to watches() is for the link to tell.
    bool takeTouched();

    /// Moves what can be moved on one partition, at most one chunk of output.
    void service(std::uint16_t id);

private:
    using CloseReason = QelMessageVirtualSerialSessionClosedAsync::CloseReason;

    struct Partition {
        std::uint16_t id = 0;
        std::unique_ptr<SerialPort> port;
        Console* holder = nullptr; ///< of the session; null: it is not open
        bool setUp = false;        ///< data may flow
        std::string input;         ///< from consoles, not yet taken by the line
    };

    Partition* pFind(std::uint16_t id);
    QelMessageStatusCodes pFindPartition(std::uint16_t id, std::uint16_t connection, Partition*& partition);
    bool pStart(Partition& partition);
    void pEnd(Partition& partition, CloseReason reason);
    void pBreak(Partition& partition, CloseReason reason);
    void pPumpInput(Partition& partition);
    void pPumpOutput(Partition& partition);
    static bool pWantsOutput(const Partition& partition);

    std::map<std::uint16_t, Partition> mPartitions;
    bool mTouched = false;
};

} // namespace qel::tool
