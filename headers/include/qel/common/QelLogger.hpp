#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/util/Mutex.hpp>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

namespace qel {

class QelDebug;

/// One logger of the process-wide tree of named loggers: a threshold, a list of back-ends, and whether lines also go to
/// the parent. The library itself logs through the root logger only; named loggers are for programs.
///
/// A line is written in two steps. The test comes first, so that a disabled level costs no formatting:
/// @code
/// if (QelLogger::get().isLevelEnabled(LogLevel::Error)) {
///     QelDebugContext line(QelLogger::get(), LogLevel::Error);
///     line << "bad length = " << hexFormat(length);
/// }
/// @endcode
///
/// Ownership and lifetime: loggers belong to the registry (QelDebug) and live as long as it, from their first use to
/// process exit; references to them stay valid until then. Do not log from destructors that run later than that, such
/// as those of static objects built before the first use of the log.
/// Thread safety: every operation from any thread. Level tests and changes never block; sending, adding and listing
/// back-ends take the registry's one lock.
class QEL_EXPORT QelLogger {
public:
    /// Lets nobody but the registry construct loggers, though it does so inside a container.
    class CtorPasskey {
        friend class QelDebug;
        CtorPasskey() {} // user-provided: a defaulted one would leave this an aggregate that anybody can write as {}
    };

    /// The root logger; use get() instead.
    QelLogger(CtorPasskey, QelDebug& owner);
    /// A named logger; use get(name) instead. The parent is borrowed and is never null.
    QelLogger(CtorPasskey, QelDebug& owner, const std::string& name, QelLogger* parent);
    ~QelLogger();
    QelLogger(const QelLogger&) = delete;
    QelLogger& operator=(const QelLogger&) = delete;

    /// @return the root logger of the process, the same as QelDebug::globals().getLogger()
    static QelLogger& get()
    {
        // Inline because every disabled log call is little more than this.
        QelLogger* const root = sRoot.load(std::memory_order_acquire);
        return root != nullptr ? *root : pFirstGet();
    }
    /// @return the logger of that dotted name, the same as QelDebug::globals().getLogger(name)
    static QelLogger& get(const std::string& name);

    /// @return true when lines of this level are worth composing: the level is not below the effective level
    bool isLevelEnabled(LogLevel::Level level) const noexcept { return level >= getEffectiveLevel(); }

    /// @return the threshold of this logger or, while that is Inherit, of its nearest ancestor that has one; never
    /// Inherit
    LogLevel::Level getEffectiveLevel() const noexcept
    {
        const QelLogger* logger = this;
        LogLevel::Level level = logger->mThreshold.load(std::memory_order_relaxed);
        while (level == LogLevel::Inherit && logger->mParent != nullptr) {
            logger = logger->mParent;
            level = logger->mThreshold.load(std::memory_order_relaxed);
        }
        return level;
    }

    /// Sets the threshold: Warn at first for the root, Inherit for every other logger. A value that is no level is
    /// ignored. The root, which has nothing to inherit from, takes Inherit as Warn. @return this logger
    QelLogger& setLevel(LogLevel::Level level) noexcept;

    /// Sets whether lines sent to this logger also go to its parent, as they do at first. Ignored on the root.
    /// @return this logger
    QelLogger& propagate(bool enable) noexcept;

    /// @return the full dotted name; empty for the root
    const std::string& getName() const noexcept { return mName; }
    /// @return true for the one logger without a parent
    bool isRoot() const noexcept { return mParent == nullptr; }

    /// Adds a back-end after those already there. A back-end that is added twice gets every line twice.
    /// @throws std::invalid_argument  with the text "backend": the pointer is null
    void addBackend(std::shared_ptr<LogBackend> backend);

    /// @return the back-ends of this logger, in the order in which they were added
    std::vector<std::shared_ptr<const LogBackend>> getBackends() const;

    /// Hands a finished line to the back-ends of this logger in their order and then, while lines propagate, to those
    /// of its parent, and so on up to the root. No logger's threshold is looked at: the back-ends have their own.
    /// One lock serialises the lines of all loggers: they reach every back-end whole and in one order.
    /// @throws whatever a back-end throws; the back-ends after it do not get the line
    void send(LogLevel::Level level, const std::string& line);

private:
    friend class QelDebug;

    static QelLogger& pFirstGet();

    /// The lock of the registry, which guards the back-ends of all its loggers.
    Mutex& pLock() const noexcept;
    /// Tells the thread-safety analysis that the caller holds this logger's lock under another name, the registry's or
    /// a child's: they are all the same.
    void pAssertLocked() const noexcept QEL_THREAD_ANNOTATION(assert_capability(pLock())) {}

    void pSendLocked(LogLevel::Level level, const std::string& line) QEL_REQUIRES(pLock());
    /// Back to the initial state. @return the back-ends, which the caller lets go of after it has released the lock
    std::vector<std::shared_ptr<LogBackend>> pResetLocked() QEL_REQUIRES(pLock());

    LogLevel::Level pInitialLevel() const noexcept { return isRoot() ? LogLevel::Warn : LogLevel::Inherit; }

    // The root logger once somebody has asked for it. One variable for the whole process, so it is defined in the
    // source file and exported with the class.
    static std::atomic<QelLogger*> sRoot;

    const std::string mName;
    QelDebug& mOwner;
    QelLogger* const mParent;
    std::atomic<LogLevel::Level> mThreshold;
    std::atomic<bool> mPropagate;
    std::vector<std::shared_ptr<LogBackend>> mBackends QEL_GUARDED_BY(pLock());
};

} // namespace qel
