#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PartitionOptions.hpp>
#include <qel/protocol/SerialLine.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/Partition.hpp"
#include "hypervisor/SerialEvents.hpp"

#include <cstddef>
#include <cstdint>
#include <map>
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
/// Each partition has sessions on the connection numbers 0 to 15, one at a time on each. Number 0 types, the others
/// watch. See Partition.
///
/// Ownership: borrows the lines and the consoles: release() must come before a console is destroyed.
/// Thread safety: none of its own; the hypervisor guards it with its lock.
class PartitionSet {
public:
    /// @param id  not taken
    /// @param line  borrowed
    void add(std::uint16_t id, SerialLine& line, const PartitionOptions& options);

    /// Ends the sessions of a partition with a notice, takes its line down and forgets both.
    /// @return false: there is no such partition
    bool remove(std::uint16_t id);

    /// Changes how a partition is served: see Partition::change(). @return false: there is no such partition
    bool change(std::uint16_t id, const PartitionOptions& options);

    /// Ends a session with a notice. @return false: there is none
    bool endSession(std::uint16_t id, std::uint16_t number);

    /// Sends a break on a partition's line. @return false: see Partition::sendBreak(); or there is no such partition
    bool sendBreak(std::uint16_t id);

    /// What all partitions do, by id.
    std::vector<PartitionState> states() const;

    std::size_t size() const noexcept { return mPartitions.size(); }

    /// Whether the partition exists.
    bool has(std::uint16_t id) const { return mPartitions.count(id) != 0; }

    /// Whether a console holds the session on a connection number of a partition.
    bool isHeldBy(const ConsoleEntry& console, std::uint16_t id, std::uint16_t number) const;

    /// Opens a session of a partition for a console and starts the partition's command if it does not run.
    /// @param force  take the session from the console that holds it; that console gets a notice
    /// @return NoError; InvalidLparId, InvalidConnectionNumber, ConnectionNotAvailable (held, and no force) or
    ///         CmdFailed (the command cannot be started), in this order, and no session changes
    QelMessageStatusCodes open(ConsoleEntry& console, std::uint16_t id, std::uint16_t number, bool force);

    /// Lets the data of an open session flow; the newest output comes first. Setting up twice changes nothing.
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or InvalidCmdSequence (the console does not hold it)
    QelMessageStatusCodes setUp(ConsoleEntry& console, std::uint16_t id, std::uint16_t number);

    /// Ends a session; the partition's command goes on.
    /// @param force  end it even if another console holds it; that console gets a notice
    /// @return NoError; InvalidLparId, InvalidConnectionNumber or ConnectionClosureFailure (the session is free, or
    ///         another console holds it and force is not set)
    QelMessageStatusCodes close(ConsoleEntry& console, std::uint16_t id, std::uint16_t number, bool force);

    /// Hands console input to a partition.
    /// @return false: the console does not hold the session, or has not set it up; the data is dropped
    bool feed(const ConsoleEntry& console, const QelMessageVirtualSerialDataToOsAsync& data);

    /// Ends all sessions of a console as a forced close does. @param why  comes in the data of those that are set up
    void endSessionsOf(const ConsoleEntry& console, const std::string& why);

    /// Ends all sessions of a console, without notices.
    void release(const ConsoleEntry& console);

    /// Ends all sessions with the notice that the hypervisor shuts down, and takes all lines down for good.
    void shutDown();

    /// False while a partition has Partition::kInputLimit bytes of input waiting, and the console can add to them: it
    /// holds the session that types and has set it up.
    bool hasInputRoom(const ConsoleEntry& console) const;

    // The serial thread's side.

    /// What to wait for, besides nextDeadline().
    std::vector<SerialWatch> watches() const;

    /// When to call serviceTime() at the latest.
    PollDeadline nextDeadline(Partition::TimePoint now) const;

    /// Whether sessions, lines or waiting input may have changed since the last call, and watches() with them. Room in
    /// a console's link changes watches() too; the link reports that itself.
    bool takeChanged();

    /// What the taps have to be told, in order. The caller does that without its lock.
    std::vector<TapCall> takeTapCalls();

    /// Moves what can be moved on one partition, at most one piece of output of its line.
    /// @return the bytes of the output that were read
    std::uint64_t service(std::uint16_t id);

    /// Does what is due on all partitions: brings lines up and takes them down, and sends what consoles have got room
    /// for.
    void serviceTime(Partition::TimePoint now);

private:
    Partition* pFind(std::uint16_t id);
    QelMessageStatusCodes pFindSession(std::uint16_t id, std::uint16_t number, Partition*& partition);

    SerialEvents mEvents;
    std::map<std::uint16_t, Partition> mPartitions;
};

} // namespace qel::protocol
