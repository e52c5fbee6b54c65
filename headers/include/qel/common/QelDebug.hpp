#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/util/Mutex.hpp>

#include <map>
#include <string>

namespace qel {

/// The registry of all loggers of the process: the root logger and the tree of named ones below it.
///
/// Names are dotted: the parent of "a.b.c" is "a.b", whose parent is "a", whose parent is the root. A name stands for
/// itself even where dots lead, trail or double: ".a" is a child of the logger named "", which is a child of the root
/// and not the root itself.
///
/// Lifetime: created on first use, destroyed at process exit after it has let go of all back-ends.
/// Thread safety: every operation from any thread. One lock is behind them all; a process that forks while another
/// thread holds it leaves it locked for ever in the child, so a child of a process with several threads must not log
/// before it executes another program.
class QEL_EXPORT QelDebug {
public:
    /// @return the one registry of the process
    static QelDebug& globals();

    QelDebug(const QelDebug&) = delete;
    QelDebug& operator=(const QelDebug&) = delete;

    /// @return the root logger
    QelLogger& getLogger() noexcept { return mRootLogger; }

    /// @return the logger of that name, created together with all its ancestors where missing
    QelLogger& getLogger(const std::string& name) QEL_EXCLUDES(mLock);

    /// @return the logger of that name, or null if nobody ever asked for it; creates nothing. The root is not found
    /// under any name.
    QelLogger* tryGetLogger(const std::string& name) QEL_EXCLUDES(mLock);

    /// Returns every logger to its initial state: no back-ends, threshold Warn and no propagation for the root,
    /// threshold Inherit and propagation for the others. The loggers themselves stay. Back-ends that nobody else owns
    /// are destroyed before this returns, but after the lock is released.
    void resetLoggers() QEL_EXCLUDES(mLock);

private:
    friend class QelLogger; // for the lock

    QelDebug();
    ~QelDebug();

    QelLogger& pGetOrCreateLoggerLocked(const std::string& name, QelLogger& parent) QEL_REQUIRES(mLock);

    /// Guards mLoggers, the back-ends of all loggers, and every send.
    Mutex mLock;
    QelLogger mRootLogger;
    std::map<std::string, QelLogger> mLoggers QEL_GUARDED_BY(mLock); // by full name; without the root
};

} // namespace qel
