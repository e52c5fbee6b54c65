#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/CommandEnd.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/GuardedLine.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace qel::protocol {

/// What the thread that moves serial data waits for on one partition.
struct SerialWatch {
    std::uint16_t partition;
    PollFd fd;
};

/// The partitions and their virtual serial sessions: which console holds which session, and the bytes that pass.
///
/// Each partition has one session at a time, on connection number 0. Output is read from a partition only while the
/// console that holds its session has room for it, so that nothing is lost and memory stays bounded. Input that a
/// partition does not take is kept; hasInputRoom() says when to accept no more of it.
///
/// Ownership: borrows the lines and the consoles: release() must come before a console is destroyed.
/// Thread safety: none of its own; the hypervisor guards it with its lock.
class PartitionSet {
public:
    /// The one connection number that a partition's console has.
    static constexpr std::uint16_t kConnectionNumber = 0;
    /// Bytes of input kept for a partition at which its console is not read any further.
    static constexpr std::size_t kInputLimit = 64 * 1024;
    /// Bytes of output in one message, at most.
    static constexpr std::size_t kOutputChunk = 4096;
    /// How long a command may go on running after the end of its line before the line is taken down.
    static constexpr std::chrono::milliseconds kExitTimeout{1000};

    PartitionSet();

    /// Takes the lines down.
    ~PartitionSet();

    PartitionSet(const PartitionSet&) = delete;
    PartitionSet& operator=(const PartitionSet&) = delete;

    /// @param id  not taken
    /// @param line  borrowed
    void add(std::uint16_t id, SerialLine& line);

    std::size_t size() const noexcept { return mPartitions.size(); }

    /// Whether the partition exists.
    bool has(std::uint16_t id) const { return mPartitions.count(id) != 0; }

    /// Whether a console holds the session of a partition.
    bool isHeldBy(const ConsoleEntry& console, std::uint16_t id) const;

    /// Opens the session of a partition for a console and starts the partition's command if it does not run.
    /// @param force  take the session from the console that holds it; that console gets a notice
    /// @return NoError; InvalidLparId, InvalidConnectionNumber, ConnectionNotAvailable (held, and no force) or
    ///         CmdFailed (the command cannot be started), in this order, and no session changes
    QelMessageStatusCodes open(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection, bool force);

    /// Lets the data of an open session flow. Setting up twice changes nothing.
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or InvalidCmdSequence (the console does not hold it)
    QelMessageStatusCodes setUp(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection);

    /// Ends a session; the partition's command goes on.
    /// @param force  end it even if another console holds it; that console gets a notice
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or ConnectionClosureFailure (the session is free, or
    ///         another console holds it and force is not set)
    QelMessageStatusCodes close(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection, bool force);

    /// Hands console input to a partition.
    /// @return false: the console does not hold the session, or has not set it up; the data is dropped
    bool feed(const ConsoleEntry& console, const QelMessageVirtualSerialDataToOsAsync& data);

    /// Ends all sessions of a console, without notices.
    void release(const ConsoleEntry& console);

    /// Ends all sessions with the notice that the hypervisor shuts down, and takes all lines down.
    void shutDown();

    /// False while a partition has kInputLimit bytes of input waiting, and the console can add to them: it holds the
    /// session and has set it up.
    bool hasInputRoom(const ConsoleEntry& console) const;

    /// What to wait for. Leaves out lines that have nothing to do: a line that has hung up would otherwise be reported
    /// without end.
    std::vector<SerialWatch> watches() const;

    /// Whether sessions, lines or waiting input may have changed since the last call, and watches() with them. Room in
    /// a console's link changes watches() too; the link reports that itself.
    bool takeChanged();

    /// Moves what can be moved on one partition, at most one chunk of output.
    void service(std::uint16_t id);

    /// Takes down the lines that have ended, as soon as it is known how their commands ended, or after kExitTimeout.
    /// @return true: there are lines left whose commands have not ended; call again soon
    bool serviceEnded();

private:
    using CloseReason = QelMessageVirtualSerialSessionClosedAsync::CloseReason;

    struct Partition {
        Partition(std::uint16_t number, SerialLine& itsLine) : id(number), line(number, itsLine) {}

        std::uint16_t id;
        GuardedLine line;
        bool isUp = false;              ///< the line, from its start to its stop, even after its command has ended
        ConsoleEntry* holder = nullptr; ///< of the session; null: the session is free
        bool setUp = false;             ///< data may flow
        std::string input;              ///< from consoles, not yet taken by the line
        PollDeadline exitDeadline;      ///< of a line that has ended, for its command to end; disabled: the line is up
    };

    Partition* pFind(std::uint16_t id);
    QelMessageStatusCodes pFindPartition(std::uint16_t id, std::uint16_t connection, Partition*& partition);
    bool pStart(Partition& partition);
    void pEndSession(Partition& partition, CloseReason reason, const CommandEnd& end = {});
    void pTakeDown(Partition& partition, CloseReason reason, const CommandEnd& end = {});
    void pBeginExit(Partition& partition);
    bool pFinishExit(Partition& partition);
    void pEndLine(Partition& partition, const CommandEnd& end);
    void pPumpInput(Partition& partition);
    void pPumpOutput(Partition& partition);
    static bool pIsExiting(const Partition& partition);
    static bool pWantsOutput(const Partition& partition);

    std::map<std::uint16_t, Partition> mPartitions;
    bool mChanged = false;
};

} // namespace qel::protocol
