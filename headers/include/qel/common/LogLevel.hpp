#pragma once

#include <qel/common/QelExport.hpp>

#include <cstdint>
#include <iosfwd>
#include <string>

/// @file
/// The severity scale of the log, its printed forms, and the reading of level names.

namespace qel {

namespace LogLevel {

/// How grave a log line is, from Debug up to Critical; also the threshold of loggers and back-ends.
/// The numbers are part of the interface: thresholds are compared by them and configurations may give them.
enum Level : std::int32_t {
    Inherit = -1, ///< a logger takes its parent's threshold; a back-end with this threshold lets every line through
    Debug = 0,
    Info = 1,
    Warn = 2,
    Error = 3,
    Critical = 4,
    Min = -1, ///< the low end of the range, Inherit
    Max = 4   ///< the high end of the range, Critical
};

/// @return true for Min to Max inclusive
constexpr bool isValid(Level level) noexcept { return level >= Min && level <= Max; }

/// @return the full name in capitals ("INHERIT", "DEBUG", "INFO", "WARN", "ERROR", "CRITICAL"); the number in decimal
/// for a value that is no level
QEL_EXPORT std::string getName(Level level);

/// @return the first letter of the full name, but '^' for Inherit (the letter 'I' is Info's), and '?' for a value that
/// is no level
QEL_EXPORT char getAbbreviatedName(Level level) noexcept;

/// Reads a level from a full name or a one-letter name, in any case, or from its number in decimal. The number is read
/// as std::stoi reads it: leading blanks, a sign and trailing characters are accepted.
/// @throws std::invalid_argument  with the text "name": the number is no level; with the text "stoi": neither a name
///         nor a number
/// @throws std::out_of_range  the number does not fit an int
QEL_EXPORT Level parse(const std::string& text);

/// Writes getName(level).
QEL_EXPORT std::ostream& operator<<(std::ostream& os, Level level);

/// Reads one word (up to white space) and stores what parse makes of it. If no word can be read, the stream fails and
/// the level keeps its value.
/// @throws what parse throws; the level keeps its value then too
QEL_EXPORT std::istream& operator>>(std::istream& is, Level& level);

/// Sets the threshold of the shared root logger: QelLogger::get().setLevel(level).
/// Thread safety: any thread.
QEL_EXPORT void setLogLevel(Level level);

} // namespace LogLevel

} // namespace qel
