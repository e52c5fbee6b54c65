#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

namespace qel {

/// Writes one line to the root logger when its level is enabled. The level is tested first, so that a disabled line
/// formats nothing; the parts are values or formatters that cost nothing until they are printed.
template <typename... Parts>
void logLine(LogLevel::Level level, const Parts&... parts)
{
    QelLogger& logger = QelLogger::get();
    if (!logger.isLevelEnabled(level)) return;
    QelDebugContext line(logger, level);
    (line << ... << parts);
}

} // namespace qel
