#pragma once

#include "base/Library.hpp"
#include "lines/LineLog.hpp"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace qel::tool {

/// Where the lines' logs go.
struct LineLogOptions {
    std::string directory; ///< empty: no logs
    std::uint64_t fileBytes = LineLog::kDefaultBytes;
};

/// Adds --line-log and --line-log-size. @param options  must outlive the command
void addLineLogOptions(CLI::App& command, LineLogOptions& options);

/// The logs of all lines. Thread safety: one thread.
class LineLogs {
public:
    explicit LineLogs(LineLogOptions options) : mOptions(std::move(options)) {}

    /// The log of a partition, for its PartitionOptions. Partitions whose files have the same name share one.
    /// @return null: there are no logs
    /// @throws FileIOError  its files cannot be opened
    std::shared_ptr<protocol::SerialTap> open(std::uint16_t partition, const std::string& name);

    /// Begins new files for all logs: on SIGHUP.
    void rotate();

private:
    struct Entry {
        std::string name;
        std::weak_ptr<LineLog> log; ///< a partition has it
    };

    const LineLogOptions mOptions;
    std::vector<Entry> mLogs;
};

} // namespace qel::tool
