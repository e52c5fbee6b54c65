#include <qel/common/LogBackendFiltered.hpp>

namespace qel {

LogBackendFiltered::LogBackendFiltered() = default;

LogBackendFiltered::LogBackendFiltered(LogLevel::Level level) { LogBackendFiltered::setLogLevel(level); }

LogBackendFiltered::~LogBackendFiltered() = default;

void LogBackendFiltered::log(LogLevel::Level level, const std::string& line)
{
    if (level >= getLogLevel()) pLog(line);
}

void LogBackendFiltered::setLogLevel(LogLevel::Level level) noexcept
{
    if (LogLevel::isValid(level)) mLevel.store(level, std::memory_order_relaxed);
}

} // namespace qel
