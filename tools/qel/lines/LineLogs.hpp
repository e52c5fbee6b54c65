#pragma once

#include "base/Library.hpp"
#include "lines/LineLog.hpp"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace qel::tool {

/// Where the lines' logs go, unless a partition says otherwise.
struct LineLogOptions {
    std::string directory; ///< empty: no logs
    std::uint64_t fileBytes = LineLog::kDefaultBytes;
};

/// Adds --line-log and --line-log-size. @param options  must outlive the command
void addLineLogOptions(CLI::App& command, LineLogOptions& options);

/// What is wrong with a directory for logs; empty: nothing.
std::string directoryProblem(const std::string& name);

/// The logs of all lines. Thread safety: one thread.
class LineLogs {
public:
    explicit LineLogs(std::uint64_t fileBytes) : mFileBytes(fileBytes) {}

    /// The log of a partition, for its PartitionOptions. Partitions whose files have the same path share one.
    /// @param directory  empty: the partition has no log
    /// @return null: the partition has no log
    /// @throws FileIOError  its files cannot be opened
    std::shared_ptr<protocol::SerialTap> open(std::uint16_t partition, const std::string& name,
                                              const std::string& directory);

    /// Begins new files for all logs: on SIGHUP.
    void rotate();

private:
    struct Entry {
        std::string path;
        std::weak_ptr<LineLog> log; ///< a partition has it
    };

    const std::uint64_t mFileBytes;
    std::vector<Entry> mLogs;
};

} // namespace qel::tool
