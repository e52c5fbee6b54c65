#pragma once

#include <qel/common/CappedStringStream.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelLogger.hpp>

#include <cstddef>

namespace qel {

/// One log line: a stream to write the text to, which sends the line when it is destroyed. Test
/// QelLogger::isLevelEnabled before building one; the context itself does not test the level.
///
/// The line begins with the UTC time, the process id, the kernel's thread id and the one-letter level, and for named
/// loggers the name: "[2026-03-01 17:04:09] (4711:4719) (E): ", then "[net.tcp] ". The stream formats by the classic
/// locale, whatever the global locale is. A line holds at most 32767 bytes, prefix included; the rest is dropped (see
/// CappedStringStream).
///
/// The time comes from TimeProvider::system(), once for each line. If that clock throws, or its time cannot be broken
/// down, the line begins with "[] ".
///
/// Each thread keeps the ids for its next lines and asks for them again after fork(), in the parent and in the child. A
/// pthread_atfork handler sees to that: a process made by _Fork(), vfork() or the clone system call runs no such
/// handlers and logs with the ids of its creator.
///
/// Lifetime: borrows the logger; meant to live for one statement or block.
/// Thread safety: one thread uses a context; threads with contexts of their own do not affect each other.
class QEL_EXPORT QelDebugContext : public CappedStringStream {
public:
    /// The maximum length of a line in bytes, prefix included.
    static constexpr std::size_t kMaxLineBytes = 32767;

    /// Starts a line with its prefix. Without memory the line stays empty.
    QelDebugContext(QelLogger& logger, LogLevel::Level level) noexcept;
    /// Sends the line. A back-end that throws ends the process here (std::terminate).
    ~QelDebugContext() override;

private:
    QelLogger& mLogger;
    LogLevel::Level mLevel;
};

} // namespace qel
