#pragma once

#include <qel/protocol/SerialTap.hpp>

#include <cstddef>
#include <memory>
#include <string>

namespace qel::protocol {

/// What becomes of a partition's output while no console takes it.
enum class WhenUnattended {
    Keep, ///< it is read all the time; the last PartitionOptions::replayBytes of it are kept
    Wait  ///< it is read only for a console; the partition blocks once its line is full, and nothing is lost
};

/// When a partition's line is brought up first.
enum class StartLine {
    AtFirstOpen, ///< when a console opens a session of the partition
    Boot         ///< when the server starts
};

/// Whether a line is brought up again after its command has ended.
enum class RestartLine {
    Never,     ///< when the next console opens the session
    OnFailure, ///< unless the command exited with status 0
    Always
};

/// How a partition is served: the second half of what Hypervisor::addPartition() takes.
struct PartitionOptions {
    static constexpr std::size_t kMaxReplayBytes = 16 * 1024 * 1024;

    std::string name;        ///< for people: the log, the status; may be empty
    std::string description; ///< for people; may be empty

    /// Bytes of the newest output that are kept, and come first when a session is set up; 0 to kMaxReplayBytes. Memory
    /// is taken as output comes, not before.
    std::size_t replayBytes = 64 * 1024;
    WhenUnattended unattended = WhenUnattended::Keep;
    StartLine start = StartLine::AtFirstOpen;
    /// The line is brought up again a second after its command has ended. The pause doubles, to 30 s at most, while the
    /// command ends within 30 s of its start.
    RestartLine restart = RestartLine::Never;

    /// For a line to something that breaks and comes back, such as a socket or a device. The line is brought up when
    /// the server starts, and again when it is lost: after 1 s, then after twice the time, up to 30 s; 1 s again once
    /// it has been up for 5 s. Its sessions stay open meanwhile, and their data say when the line is lost and when it
    /// is back. What is typed from the loss until then is dropped, and the session is told. `start` and `restart` do
    /// not apply.
    bool keepsSession = false;

    std::shared_ptr<SerialTap> tap; ///< listens to the output; may be null
};

} // namespace qel::protocol
