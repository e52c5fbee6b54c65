#pragma once

#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <sys/types.h>
#include <vector>

namespace qel::tool {

/// Sees to it that commands which are no longer wanted end, and are reaped.
///
/// A command that is handed over is asked to end (SIGHUP to its process group), killed with its group when it has not
/// within the grace period (SIGKILL), and reaped in either case. Others of its group that outlive it are left alone:
/// once it is reaped, the number of the group may come to mean another one. Nothing here waits but finish(): somebody
/// must call reap() from time to time while it says that commands are left.
///
/// Thread safety: any thread. Its lock is a leaf.
class ChildReaper {
public:
    static constexpr std::chrono::milliseconds kDefaultGrace{1000};

    explicit ChildReaper(std::chrono::milliseconds grace = kDefaultGrace);
    ~ChildReaper();
    ChildReaper(const ChildReaper&) = delete;
    ChildReaper& operator=(const ChildReaper&) = delete;

    /// Takes over a child of this process that leads a process group, and asks it to end.
    void adopt(pid_t leader);

    /// Reaps what has ended and kills what is overdue, without waiting.
    /// @return true: some are left
    bool reap();

    /// Waits until none is left; takes little more than the grace period. The destructor does the same.
    void finish();

private:
    struct Child {
        pid_t leader;
        std::chrono::steady_clock::time_point overdue;
        bool killed;
    };

    static bool pIsGone(Child& child, std::chrono::steady_clock::time_point now);

    const std::chrono::milliseconds mGrace;

    Mutex mMutex;
    std::vector<Child> mChildren QEL_GUARDED_BY(mMutex);
};

} // namespace qel::tool
