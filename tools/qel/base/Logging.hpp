#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

#include <CLI/CLI.hpp>
#include <cstddef>
#include <string>

namespace qel::tool {

/// Where the log goes and how much of it is written.
struct LogOptions {
    std::string directory; ///< of the rotating files; empty: standard error
    std::string level;     ///< as LogLevel::parse() takes it; empty: not said
    std::size_t fileBytes = 1024 * 1024;

    LogLevel::Level usual = LogLevel::Info; ///< the level unless one is said
    bool quiet = false; ///< without any of the options nothing is logged: for commands whose output is their answer
};

/// Adds --log-dir, --log-level and --log-size. The help says what is logged unless they are given, so `usual` and
/// `quiet` have to be set before.
void addLogOptions(CLI::App& app, LogOptions& options);

/// Gives the root logger its back-end and level.
/// @param name  of the log file within the directory
/// @throws FileIOError  the log file cannot be written; later trouble with it goes to the system log alone
void startLogging(const LogOptions& options, const std::string& name);

/// The logger of this program's own lines, which tells them from the library's: "[qel] ".
/// Thread safety: any thread.
QelLogger& programLogger();

/// Writes one line to the program's logger when its level is enabled.
template <typename... Parts>
void logLine(LogLevel::Level level, const Parts&... parts)
{
    QelLogger& logger = programLogger();
    if (!logger.isLevelEnabled(level)) return;
    QelDebugContext line(logger, level);
    (line << ... << parts);
}

/// Writes each line of a text as a line of its own.
void logLines(LogLevel::Level level, const std::string& text);

} // namespace qel::tool
