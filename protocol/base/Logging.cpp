#include <qel/protocol/Logging.hpp>

#include <sstream>

namespace qel::protocol {

void logLines(LogLevel::Level level, const std::string& text)
{
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);)
        logLine(level, line);
}

QelLogger& logger()
{
    // Loggers live as long as the process; looking this one up by name each time would take the registry's lock.
    static QelLogger& qel = QelLogger::get("qel");
    return qel;
}

} // namespace qel::protocol
