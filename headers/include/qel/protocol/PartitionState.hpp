#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace qel::protocol {

/// A session of a partition that is open.
struct SessionState {
    std::uint16_t number;  ///< connection number: 0 types, the others watch
    std::uint64_t console; ///< Peer::id of the console that holds it
    bool isSetUp;
};

/// What a partition does at one moment: see Server::partitions().
struct PartitionState {
    enum class Line {
        Down,
        ComingUp, ///< it is being connected
        Up,
        Ended ///< its output has been read; it is taken down when its consoles have got it and its command has ended
    };

    std::uint16_t id;
    std::string name; ///< this and the next one: of its PartitionOptions
    std::string description;
    Line line;
    std::vector<SessionState> sessions; ///< by number

    // Since the partition was added.
    std::uint64_t outputBytes; ///< that the line has put out
    std::uint64_t inputBytes;  ///< that the line has taken
    std::uint64_t starts;      ///< how often the line has come up

    std::uint64_t outputMessages; ///< of serial data, for its consoles
    std::uint64_t inputMessages;  ///< of serial data, from its consoles
    std::uint64_t skippedBytes;   ///< of output, that consoles did not get because they were too slow
    std::uint64_t droppedBytes;   ///< of input, that was not for the line: of watchers, or while the line was down

    std::size_t keptBytes;    ///< of output, for the next console
    std::size_t waitingBytes; ///< of input, that the line has not taken yet
    std::size_t replayBytes;  ///< PartitionOptions::replayBytes
};

} // namespace qel::protocol
