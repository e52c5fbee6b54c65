#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

namespace qel {

/// Writes one line to the root logger if its level is enabled. The level is tested first, so that a disabled line
/// formats nothing: pass values, or formatters that do their work when printed.
/// Never throws: the lines of the library precede its exceptions and must not replace them. A part that cannot be
/// printed, for want of memory, ends the line.
template <typename... Parts>
void logLine(LogLevel::Level level, const Parts&... parts) noexcept
{
    QelLogger& logger = QelLogger::get();
    if (!logger.isLevelEnabled(level)) return;
    QelDebugContext line(logger, level);
    try {
        (line << ... << parts);
    } catch (...) { // NOLINT(bugprone-empty-catch): the line goes out as far as it got
    }
}

} // namespace qel
