#pragma once

#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace qel::protocol {

/// Ends commands and reaps them.
///
/// adopt() sends SIGHUP to the command's process group. A command that has not ended after the grace period is killed
/// with its group (SIGKILL). Other processes of the group that outlive the command are left alone: once the command is
/// reaped, the system may use the number of the group again.
///
/// While commands are left, a thread of its own looks at them. Only finish() and the destructor block.
/// Thread safety: any thread. Its lock is a leaf.
class ChildReaper {
public:
    static constexpr std::chrono::milliseconds kDefaultGrace{1000};

    explicit ChildReaper(std::chrono::milliseconds grace = kDefaultGrace);

    /// Blocks as finish() does.
    ~ChildReaper();

    ChildReaper(const ChildReaper&) = delete;
    ChildReaper& operator=(const ChildReaper&) = delete;

    /// Takes over a child of this process that leads a process group, and asks it to end. Kills it at once when there
    /// is no memory to remember it.
    void adopt(pid_t leader) noexcept;

    /// Reaps what has ended and kills what is overdue, without blocking.
    /// @return true: commands are left
    bool reap();

    /// Blocks until none is left, for little more than the grace period.
    void finish();

private:
    struct Child {
        pid_t leader;
        std::chrono::steady_clock::time_point overdue;
        bool killed;
    };

    static bool pIsGone(Child& child, std::chrono::steady_clock::time_point now);
    bool pReapLocked() QEL_REQUIRES(mMutex);
    void pStartThreadLocked() QEL_REQUIRES(mMutex);
    void pRun() noexcept;

    const std::chrono::milliseconds mGrace;

    Mutex mMutex;
    ConditionVariable mStopped;
    std::vector<Child> mChildren QEL_GUARDED_BY(mMutex);
    bool mHasThread QEL_GUARDED_BY(mMutex) = false; // that looks at the commands
    bool mStopping QEL_GUARDED_BY(mMutex) = false;
    std::thread mThread; // replaced under the lock; the last one is joined when no more can start
};

} // namespace qel::protocol
