#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <memory>
#include <string>

namespace qel {

/// Where finished log lines go. Programs create back-ends and register them with a logger, which shares ownership.
/// Thread safety: the loggers call log for one line at a time, under the registry's one lock.
class QEL_EXPORT LogBackend {
public:
    LogBackend() = default;
    LogBackend(const LogBackend&) = delete;
    LogBackend& operator=(const LogBackend&) = delete;

    /// Runs when the last owner lets go: usually in QelDebug::resetLoggers() or at process exit, in both cases without
    /// the registry's lock, so a destructor may look up loggers and log.
    virtual ~LogBackend();

    /// Takes one line that the logger has composed. The line has no line end of its own (one that belongs to the text,
    /// such as in a hex dump, may stand inside it) and is valid only during the call.
    /// Called with the registry's lock held: an implementation must not log through a logger, nor add back-ends or look
    /// up loggers, or it waits for itself for ever. It should not throw: an exception that leaves it while a
    /// QelDebugContext sends its line ends the process.
    virtual void log(LogLevel::Level level, const std::string& line) = 0;

    /// Adds a back-end to the shared root logger: QelLogger::get().addBackend(backend). It stays there for the rest of
    /// the process unless the loggers are reset.
    /// @throws std::invalid_argument  with the text "backend": the pointer is null
    static void registerBackend(std::shared_ptr<LogBackend> backend);
};

} // namespace qel
