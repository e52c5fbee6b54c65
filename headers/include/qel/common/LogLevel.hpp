#pragma once

#include <qel/common/QelExport.hpp>

#include <cstdint>
#include <iosfwd>
#include <string>

/// @file
/// The severity scale of the log, its printed forms, and the parsing of level names.
/// Thread safety: any thread may call every function.

namespace qel::LogLevel {

/// The severity of a log line, from Debug up to Critical; also the threshold of loggers and back-ends.
/// The numbers are part of the interface: thresholds are compared by number, and configurations may contain numbers.
enum Level : std::int32_t {
    Inherit = -1, ///< as a logger's threshold: that of its parent; as a back-end's threshold: every line passes
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
/// for an invalid level
/// @throws std::bad_alloc  no memory
QEL_EXPORT std::string getName(Level level);

/// @return the first letter of the full name, but '^' for Inherit (the letter 'I' is taken by Info), and '?' for an
/// invalid level
QEL_EXPORT char getAbbreviatedName(Level level) noexcept;

/// Parses a full name or a one-letter name, in any case, or a number in decimal. std::stoi parses the number, so
/// leading blanks, a sign and trailing characters are accepted.
/// @throws std::invalid_argument  with the text "name": the number is not a level; with the text "stoi": neither a name
///         nor a number
/// @throws std::out_of_range  with the text "stoi": the number does not fit an int
QEL_EXPORT Level parse(const std::string& text);

/// Writes getName(level).
QEL_EXPORT std::ostream& operator<<(std::ostream& os, Level level);

/// Reads one word (up to white space), parses it and stores the level. If there is no word, the stream fails and the
/// level keeps its value.
/// @throws what parse throws; the level keeps its value
QEL_EXPORT std::istream& operator>>(std::istream& is, Level& level);

/// Sets the threshold of the root logger: QelLogger::get().setLevel(level).
QEL_EXPORT void setLogLevel(Level level);

} // namespace qel::LogLevel
