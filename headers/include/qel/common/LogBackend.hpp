#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <memory>
#include <string>

namespace qel {

/// A destination of finished log lines. Programs create back-ends and register them with a logger.
/// Ownership and lifetime: the logger shares ownership and keeps the back-end until the loggers are reset or the
/// process exits. Thread safety: the loggers call log from any thread, for one line at a time, under the registry's one
/// lock.
class QEL_EXPORT LogBackend {
public:
    LogBackend() = default;
    LogBackend(const LogBackend&) = delete;
    LogBackend& operator=(const LogBackend&) = delete;

    /// Runs when the last owner releases the back-end, usually in QelDebug::resetLoggers() or at process exit. The
    /// registry's lock is not held in either case, so a destructor may look up loggers and log.
    virtual ~LogBackend();

    /// Takes one line that the logger has composed. The line does not end with a line end, though its text, such as a
    /// hex dump, may contain some. It is valid during the call only.
    /// Called with the registry's lock held: an implementation that logs through a logger, adds back-ends or looks up
    /// loggers deadlocks. It must not throw: an exception leaves QelLogger::send, and ends the process if a
    /// QelDebugContext sends the line.
    virtual void log(LogLevel::Level level, const std::string& line) = 0;

    /// Adds a back-end to the root logger: QelLogger::get().addBackend(backend).
    /// Thread safety: any thread.
    /// @throws std::invalid_argument  with the text "backend": the pointer is null
    /// @throws std::bad_alloc         no memory; nothing was added
    static void registerBackend(std::shared_ptr<LogBackend> backend);
};

} // namespace qel
