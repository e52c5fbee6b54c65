#pragma once

#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>

#include <exception>
#include <ostream>

/// @file
/// Log lines of threads that must go on whatever happens. Without memory for a line there is none.

namespace qel::protocol {

/// Prints an exception and its nested causes. Allocates when it is printed, not before.
struct Explained {
    const std::exception& error;
};

inline std::ostream& operator<<(std::ostream& os, const Explained& explained) { return os << explain(explained.error); }

/// As logLine(), without exceptions. Pass values, or formatters that do their work when printed.
template <typename... Parts>
void logQuietly(LogLevel::Level level, const Parts&... parts) noexcept
{
    try {
        logLine(level, parts...);
    } catch (...) { // NOLINT(bugprone-empty-catch): see above
    }
}

} // namespace qel::protocol
