#pragma once

#include <qel/common/CappedStringStream.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelLogger.hpp>

#include <cstddef>

namespace qel {

/// One log line in the making: a stream to write the text to, which sends the line when it is destroyed. Test
/// QelLogger::isLevelEnabled before building one; the context itself tests nothing.
///
/// The line begins with the UTC time, the process id, the kernel's thread id and the one-letter level, and for named
/// loggers the name: "[2026-03-01 17:04:09] (4711:4719) (E): ", then "[net.tcp] ". The stream formats by the classic
/// locale whatever the global one says. A line holds at most 32767 bytes with all this; what does not fit is dropped
/// (see CappedStringStream).
///
/// The time is read from TimeProvider::system() for each line. The ids are kept from one line of a thread to its next
/// one and asked for again after a fork, in the parent and in the child. That goes by pthread_atfork: a process made by
/// vfork or by the clone system call alone keeps showing the ids of its creator.
///
/// Lifetime: borrows the logger; meant to live for one statement or block.
/// Thread safety: used by one thread; contexts of different threads do not disturb each other.
class QEL_EXPORT QelDebugContext : public CappedStringStream {
public:
    /// The most bytes of one line, prefix included.
    static constexpr std::size_t kMaxLineBytes = 32767;

    /// Starts a line with its prefix.
    QelDebugContext(QelLogger& logger, LogLevel::Level level);
    /// Sends the line. An exception of a back-end ends the process here.
    ~QelDebugContext() override;

private:
    QelLogger& mLogger;
    LogLevel::Level mLevel;
};

} // namespace qel
