#include "hypervisor/ChildReaper.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include "base/Threads.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <exception>
#include <new>
#include <sys/wait.h>

namespace qel::protocol {

namespace {

/// How often finish() and the thread look at the commands.
constexpr std::chrono::milliseconds kPause(10);
constexpr std::chrono::milliseconds kInterval(50);

} // namespace

ChildReaper::ChildReaper(std::chrono::milliseconds grace) : mGrace(grace) {}

ChildReaper::~ChildReaper()
{
    {
        const MutexLock lock(mMutex);
        mStopping = true;
        mStopped.notifyAll();
    }
    if (mThread.joinable()) mThread.join();
    finish();
}

void ChildReaper::adopt(pid_t leader) noexcept
{
    // A stopped process acts on SIGHUP only after SIGCONT.
    static_cast<void>(::kill(-leader, SIGHUP));
    static_cast<void>(::kill(-leader, SIGCONT));
    const MutexLock lock(mMutex);
    try {
        mChildren.push_back({leader, TimeProvider::steady() + mGrace, false});
    } catch (const std::bad_alloc&) {
        static_cast<void>(::kill(-leader, SIGKILL));
        return;
    }
    pStartThreadLocked();
}

bool ChildReaper::reap()
{
    const MutexLock lock(mMutex);
    return pReapLocked();
}

void ChildReaper::finish()
{
    while (reap())
        std::this_thread::sleep_for(kPause);
}

bool ChildReaper::pReapLocked()
{
    if (mChildren.empty()) return false;
    const auto now = TimeProvider::steady();
    mChildren.erase(
        std::remove_if(mChildren.begin(), mChildren.end(), [now](Child& child) { return pIsGone(child, now); }),
        mChildren.end());
    return !mChildren.empty();
}

void ChildReaper::pStartThreadLocked()
{
    if (mHasThread || mStopping) return;
    try {
        if (mThread.joinable()) mThread.join(); // it has given up the lock for the last time, and ends
        mThread = startThread([this] { pRun(); });
        mHasThread = true;
    } catch (const std::exception&) { // the next command starts one, or finish() does without
    }
}

void ChildReaper::pRun() noexcept
{
    UniqueMutexLock lock(mMutex);
    while (pReapLocked() && !mStopping)
        mStopped.waitUntil(lock, std::chrono::steady_clock::now() + kInterval);
    mHasThread = false;
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
