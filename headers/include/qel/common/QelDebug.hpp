#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/util/Mutex.hpp>

#include <map>
#include <string>

namespace qel {

/// The registry of all loggers of the process: the root logger and the tree of named ones below it.
///
/// Names are dotted: the parent of "a.b.c" is "a.b", whose parent is "a", whose parent is the root. Leading, trailing
/// and double dots are not special: ".a" is a child of the logger named "", which is a child of the root and not the
/// root itself.
///
/// Lifetime: created on first use; destroyed at process exit, after it has released all back-ends.
/// Thread safety: every operation from any thread. They share one lock. If a process forks while another thread holds
/// it, it stays locked in the child, so the child of a process with several threads must not log before it executes
/// another program.
class QEL_EXPORT QelDebug {
public:
    /// @return the one registry of the process
    static QelDebug& globals();

    QelDebug(const QelDebug&) = delete;
    QelDebug& operator=(const QelDebug&) = delete;

    /// @return the root logger
    QelLogger& getLogger() noexcept { return mRootLogger; }

    /// @return the logger of that name; it and its ancestors are created if they do not exist
    /// @throws std::bad_alloc  no memory; some of the ancestors may have been created
    QelLogger& getLogger(const std::string& name) QEL_EXCLUDES(mLock);

    /// @return the logger of that name, or null if it was never created; creates nothing. The root has no name by which
    /// it could be found.
    QelLogger* tryGetLogger(const std::string& name) QEL_EXCLUDES(mLock);

    /// Returns every logger to its initial state: no back-ends; threshold Warn and no propagation for the root,
    /// threshold Inherit and propagation for the others. The loggers stay valid. Back-ends without another owner are
    /// destroyed before this returns and after the lock is released.
    /// @throws std::bad_alloc  no memory; no logger has changed
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
