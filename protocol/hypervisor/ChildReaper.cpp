#include "hypervisor/ChildReaper.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <sys/wait.h>
#include <thread>

namespace qel::protocol {

namespace {

constexpr std::chrono::milliseconds kPause(10);

} // namespace

ChildReaper::ChildReaper(std::chrono::milliseconds grace) : mGrace(grace) {}

ChildReaper::~ChildReaper() { finish(); }

void ChildReaper::adopt(pid_t leader)
{
    // A stopped process acts on SIGHUP only after SIGCONT.
    static_cast<void>(::kill(-leader, SIGHUP));
    static_cast<void>(::kill(-leader, SIGCONT));
    const MutexLock lock(mMutex);
    mChildren.push_back({leader, TimeProvider::steady() + mGrace, false});
}

bool ChildReaper::reap()
{
    const MutexLock lock(mMutex);
    if (mChildren.empty()) return false;
    const auto now = TimeProvider::steady();
    mChildren.erase(
        std::remove_if(mChildren.begin(), mChildren.end(), [now](Child& child) { return pIsGone(child, now); }),
        mChildren.end());
    return !mChildren.empty();
}

void ChildReaper::finish()
{
    while (reap())
        std::this_thread::sleep_for(kPause);
}

bool ChildReaper::pIsGone(Child& child, std::chrono::steady_clock::time_point now)
{
    if (!child.killed && now >= child.overdue) {
        static_cast<void>(::kill(-child.leader, SIGKILL));
        child.killed = true;
    }
    const pid_t result = ::waitpid(child.leader, nullptr, WNOHANG);
    const int error = errno;
    return result == child.leader || (result < 0 && error == ECHILD);
}

} // namespace qel::protocol
