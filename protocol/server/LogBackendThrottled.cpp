#include <qel/protocol/LogBackendThrottled.hpp>

#include "server/LogThrottle.hpp"

#include <stdexcept>
#include <utility>

namespace qel::protocol {

LogBackendThrottled::LogBackendThrottled(std::shared_ptr<LogBackend> to) : mTo(std::move(to))
{
    if (mTo == nullptr) throw std::invalid_argument("to");
}

LogBackendThrottled::~LogBackendThrottled() = default;

void LogBackendThrottled::log(LogLevel::Level level, const std::string& line)
{
    if (LogThrottle::admits(level, line)) mTo->log(level, line);
}

} // namespace qel::protocol
