#pragma once

#include <qel/protocol/Logging.hpp>

#include <string>
#include <utility>

/// @file
/// Calls of code that is not the library's own, such as an operation that the user has overridden. Whatever it throws
/// must end neither a thread nor a server.

namespace qel::protocol {

/// The exception that is being handled and its causes in one line, be it a std::exception or not.
/// To be called in a handler only. @throws std::bad_alloc
std::string explainCurrent();

/// Logs the exception that is being handled, after the parts and a colon. To be called in a handler only.
template <typename... Parts>
void logCurrentAt(LogLevel::Level level, const Parts&... parts) noexcept
{
    try {
        logLine(level, parts..., ": ", explainCurrent());
    } catch (...) { // without memory for the line there is none
    }
}

/// The same at Error.
template <typename... Parts>
void logCurrent(const Parts&... parts) noexcept
{
    logCurrentAt(LogLevel::Error, parts...);
}

/// Runs an operation and logs what it throws as logCurrent() does.
/// @return false: it threw
template <typename Operation, typename... Parts>
bool runGuarded(Operation&& operation, const Parts&... parts) noexcept
{
    try {
        std::forward<Operation>(operation)();
        return true;
    } catch (...) {
        logCurrent(parts...);
        return false;
    }
}

} // namespace qel::protocol
