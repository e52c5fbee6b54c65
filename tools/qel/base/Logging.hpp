#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

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

/// The logger of this program, whose lines begin with "[qel] ".
/// Thread safety: any thread.
QelLogger& programLogger();

/// Logs one line if the level is enabled.
template <typename... Parts>
void logLine(LogLevel::Level level, const Parts&... parts)
{
    QelLogger& logger = programLogger();
    if (!logger.isLevelEnabled(level)) return;
    QelDebugContext line(logger, level);
    (line << ... << parts);
}

/// Logs each line of a text separately.
void logLines(LogLevel::Level level, const std::string& text);

} // namespace qel::tool
