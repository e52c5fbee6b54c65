#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <string>

/// @file
/// What the library logs goes to one logger, "qel", whose lines begin with "[qel] ". A program chooses the level and
/// the back-ends (QelLogger::setLevel(), LogBackend::registerBackend()) and may log to it as well. Without a back-end
/// nothing is logged.

namespace qel::protocol {

/// The logger "qel". Valid as long as the process. Thread safety: any thread.
QEL_PROTOCOL_EXPORT QelLogger& logger();

/// Logs one line if the level is enabled.
/// Thread safety: any thread. Throws nothing of its own; printing a part may throw.
template <typename... Parts>
void logLine(LogLevel::Level level, const Parts&... parts)
{
    QelLogger& target = logger();
    if (!target.isLevelEnabled(level)) return;
    QelDebugContext line(target, level);
    (line << ... << parts);
}

/// Logs each line of a text separately.
QEL_PROTOCOL_EXPORT void logLines(LogLevel::Level level, const std::string& text);

} // namespace qel::protocol
