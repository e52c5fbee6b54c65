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
/// Test the level before writing a line, so that a disabled level costs no formatting:
/// @code
/// if (QelLogger::get().isLevelEnabled(LogLevel::Error)) {
///     QelDebugContext line(QelLogger::get(), LogLevel::Error);
///     line << "bad length = " << hexFormat(length);
/// }
/// @endcode
///
/// Ownership and lifetime: the registry (QelDebug) owns the loggers. References to them stay valid until the registry
/// is destroyed at process exit. Do not log from destructors that run later, such as those of static objects
/// constructed before the first use of the log. Thread safety: every operation from any thread. Testing and setting
/// levels never blocks; sending, adding and listing back-ends take the registry's one lock.
class QEL_EXPORT QelLogger {
public:
    /// A key that only the registry can make: the registry constructs loggers inside a container, which needs public
    /// constructors.
    class CtorPasskey {
        friend class QelDebug;
        // User-provided: with a defaulted constructor this would be an aggregate, which {} initialises.
        CtorPasskey() {} // NOLINT(modernize-use-equals-default)
    };

    /// The root logger; use get() instead.
    QelLogger(CtorPasskey, QelDebug& owner);
    /// A named logger; use get(name) instead. The parent is borrowed and must not be null.
    QelLogger(CtorPasskey, QelDebug& owner, const std::string& name, QelLogger* parent);
    ~QelLogger();
    QelLogger(const QelLogger&) = delete;
    QelLogger& operator=(const QelLogger&) = delete;

    /// @return the root logger of the process, the same as QelDebug::globals().getLogger()
    static QelLogger& get()
    {
        // Inline, because a disabled log call does little more than this.
        QelLogger* const root = sRoot.load(std::memory_order_acquire);
        return root != nullptr ? *root : pFirstGet();
    }
    /// @return the logger of that dotted name, the same as QelDebug::globals().getLogger(name)
    /// @throws std::bad_alloc  no memory
    static QelLogger& get(const std::string& name);

    /// @return true unless the level is below the effective level
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

    /// Sets the threshold. It is initially Warn for the root and Inherit for the others. An invalid level is ignored.
    /// The root, which has nothing to inherit from, takes Inherit as Warn.
    /// @return this logger
    QelLogger& setLevel(LogLevel::Level level) noexcept;

    /// Sets whether lines sent to this logger also go to its parent; initially they do. Ignored on the root.
    /// @return this logger
    QelLogger& propagate(bool enable) noexcept;

    /// @return the full dotted name; empty for the root
    const std::string& getName() const noexcept { return mName; }
    /// @return true for the one logger without a parent
    bool isRoot() const noexcept { return mParent == nullptr; }

    /// Adds a back-end at the end of the list. A back-end that is added twice gets every line twice.
    /// @throws std::invalid_argument  with the text "backend": the pointer is null
    /// @throws std::bad_alloc         no memory; nothing was added
    void addBackend(std::shared_ptr<LogBackend> backend);

    /// @return the back-ends of this logger, in the order in which they were added
    /// @throws std::bad_alloc  no memory
    std::vector<std::shared_ptr<const LogBackend>> getBackends() const;

    /// Passes a finished line to the back-ends of this logger, in their order, and then, if lines propagate, to those
    /// of its parent, and so on up to the root. The thresholds of loggers do not matter here; back-ends have their own.
    /// One lock serialises the lines of all loggers: every back-end gets whole lines, and all get them in the same
    /// order.
    /// @throws nothing, unless a back-end breaks its rule not to throw: its exception passes through, and the back-ends
    ///         after it do not get the line. Through a QelDebugContext it ends the process.
    void send(LogLevel::Level level, const std::string& line);

private:
    friend class QelDebug;

    static QelLogger& pFirstGet();

    /// The lock of the registry, which guards the back-ends of all its loggers.
    Mutex& pLock() const noexcept;
    /// For the thread-safety analysis: the caller holds the lock under another name, the registry's or a child's, which
    /// is the same lock.
    void pAssertLocked() const noexcept QEL_THREAD_ANNOTATION(assert_capability(pLock())) {}

    void pSendLocked(LogLevel::Level level, const std::string& line) QEL_REQUIRES(pLock());
    /// Returns to the initial state.
    /// @return the back-ends, for the caller to release after the lock
    std::vector<std::shared_ptr<LogBackend>> pResetLocked() QEL_REQUIRES(pLock());

    LogLevel::Level pInitialLevel() const noexcept { return isRoot() ? LogLevel::Warn : LogLevel::Inherit; }

    // The root logger, from the first get() on. The source file defines it, so that a process has one.
    static std::atomic<QelLogger*> sRoot;

    const std::string mName;
    QelDebug& mOwner;
    QelLogger* const mParent;
    std::atomic<LogLevel::Level> mThreshold;
    std::atomic<bool> mPropagate;
    std::vector<std::shared_ptr<LogBackend>> mBackends QEL_GUARDED_BY(pLock());
};

} // namespace qel
