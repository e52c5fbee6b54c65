#pragma once

#include <qel/protocol/PartitionOptions.hpp>

#include <CLI/CLI.hpp>
#include <cstddef>
#include <string>

namespace qel::tool {

/// The options of "qel serve" that say how its partitions are served, as they are given.
struct PartitionChoices {
    std::size_t replayBytes = protocol::PartitionOptions().replayBytes;
    std::string unattended = "keep"; ///< or "wait"
    std::string start = "open";      ///< or "boot"
    std::string restart = "never";   ///< or "failure", "always"

    /// @throws std::invalid_argument  a word is none of those above
    protocol::PartitionOptions options() const;
};

/// Adds --replay, --when-unattended, --start and --restart. @param choices  must outlive the command
void addPartitionChoices(CLI::App& command, PartitionChoices& choices);

} // namespace qel::tool
