#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Library.hpp"

#include <CLI/CLI.hpp>
#include <cstddef>
#include <string>

namespace qel::tool {

/// Options of the log.
struct LogOptions {
    std::string directory; ///< of the rotating files; empty: standard error
    std::string level;     ///< as LogLevel::parse() takes it; empty: not given
    std::size_t fileBytes = 1024 * 1024;

    LogLevel::Level usual = LogLevel::Info; ///< the default level
    bool quiet = false;                     ///< log nothing unless --log-dir or --log-level is given
};

/// Adds --log-dir, --log-level and --log-size. Set `usual` and `quiet` before: the help text depends on them.
void addLogOptions(CLI::App& app, LogOptions& options);

/// Sets the back-end and the level of the root logger.
/// @param name  of the log file within the directory
/// @throws FileIOError  the log file cannot be written; later failures go to the system log
void startLogging(const LogOptions& options, const std::string& name);

} // namespace qel::tool
