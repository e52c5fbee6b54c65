#include "Logging.hpp"

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/LogBackendRotating.hpp>

#include "TerminalMode.hpp"

#include <cstdio>
#include <exception>
#include <memory>
#include <sstream>
#include <unistd.h>

namespace qel::tool {

namespace {

/// Lines to standard error: standard output belongs to what the commands print.
class LogBackendStderr final : public LogBackendFiltered {
public:
    LogBackendStderr() : LogBackendFiltered(LogLevel::Inherit) {}

private:
    void pLog(const std::string& line) override
    {
        // One call a line, so that lines stay whole beside those of other processes on the same terminal.
        const std::string whole = line + lineEndOf(STDERR_FILENO);
        static_cast<void>(std::fwrite(whole.data(), 1, whole.size(), stderr));
    }
};

std::string checkLevel(std::string& text)
{
    try {
        static_cast<void>(LogLevel::parse(text));
    } catch (const std::exception&) {
        return "'" + text + "' is no log level: debug, info, warn, error or critical";
    }
    return {};
}

} // namespace

void addLogOptions(CLI::App& app, LogOptions& options)
{
    app.add_option("--log-dir", options.directory,
                   "Write the log to files in this directory, five of them at most; without it, to standard error")
        ->type_name("")
        ->check(CLI::ExistingDirectory);
    app.add_option("--log-level", options.level, "Write lines of this level and above")
        ->type_name("LEVEL")
        ->check(CLI::Validator(checkLevel, ""));
    app.add_option("--log-size", options.fileBytes, "Bytes that one log file may hold")
        ->type_name("BYTES")
        ->check(CLI::Range(std::size_t{4096}, std::size_t{1} << 40))
        ->capture_default_str();
}

void startLogging(const LogOptions& options, const std::string& name, LogLevel::Level level, bool quiet)
{
    if (quiet && options.directory.empty() && options.level.empty()) return;
    QelLogger::get().setLevel(options.level.empty() ? level : LogLevel::parse(options.level));
    if (options.directory.empty()) {
        LogBackend::registerBackend(std::make_shared<LogBackendStderr>());
    } else {
        LogBackend::registerBackend(
            std::make_shared<LogBackendRotating>(LogLevel::Inherit, options.directory, name, options.fileBytes));
    }
}

void logLines(LogLevel::Level level, const std::string& text)
{
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);)
        logLine(level, line);
}

QelLogger& programLogger()
{
    // Loggers live as long as the process; looking this one up by name each time would take the registry's lock.
    static QelLogger& logger = QelLogger::get("qel");
    return logger;
}

} // namespace qel::tool
