#pragma once

#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <sys/types.h>
#include <vector>

namespace qel::protocol {

/// Ends commands and reaps them.
///
/// adopt() sends SIGHUP to the command's process group. A command that has not ended after the grace period is killed
/// with its group (SIGKILL). Other processes of the group that outlive the command are left alone: once the command is
/// reaped, the system may use the number of the group again. Only finish() blocks; while commands are left, the owner
/// must call reap() from time to time.
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

    /// Reaps what has ended and kills what is overdue, without blocking.
    /// @return true: commands are left
    bool reap();

    /// Blocks until none is left, for little more than the grace period. The destructor does the same.
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

} // namespace qel::protocol
