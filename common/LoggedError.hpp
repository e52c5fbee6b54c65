#pragma once

#include <qel/common/util/PosixError.hpp>

#include "LogLine.hpp"

namespace qel {

/// Reports a failed system call: writes the text of the error to the log at Error, then throws it.
/// @param code     pass errno itself: it is taken before any text is composed
/// @param context  what failed, a fixed phrase
[[noreturn]] inline void throwLogged(PosixErrorCode code, const char* context)
{
    const PosixError error(code, context);
    logLine(LogLevel::Error, error.what());
    throw error;
}

} // namespace qel
