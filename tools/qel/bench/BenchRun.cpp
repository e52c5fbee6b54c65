#include "bench/BenchRun.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <sys/prctl.h>
#include <utility>

namespace qel::tool {

BenchRun::BenchRun(std::vector<std::unique_ptr<BenchPair>> pairs, const BenchLoad& load)
    : mLoad(load), mPairs(std::move(pairs)), mStart(TimeProvider::steady()), mFigures(mPairs.size()),
      mRunning(mPairs.size()), mCarrying(mPairs.size())
{
    try {
        for (std::size_t i = 0; i < mPairs.size(); ++i)
            mThreads.emplace_back([this, i] { pRunPair(i); });
    } catch (...) {
        cut();
        pJoin();
        throw;
    }
}

BenchRun::~BenchRun()
{
    if (mThreads.empty()) return; // finished
    cut();
    pJoin();
}

std::chrono::nanoseconds BenchRun::elapsed() const { return TimeProvider::steady() - mStart; }

void BenchRun::stop()
{
    const MutexLock lock(mMutex);
    if (!mStop) mInterrupted = true;
    mStop = true;
    mStopped.notifyAll();
}

void BenchRun::cut()
{
    stop();
    for (const auto& pair : mPairs)
        pair->cut();
}

BenchFigures BenchRun::finish()
{
    pJoin();
    BenchFigures all;
    for (const BenchFigures& figures : mFigures) {
        all.latency.add(figures.latency);
        all.unsent += figures.unsent;
        all.elapsed = std::max(all.elapsed, figures.elapsed);
    }
    const MutexLock lock(mMutex);
    if (mFailure) std::rethrow_exception(mFailure);
    all.interrupted = mInterrupted;
    return all;
}

void BenchRun::pRunPair(std::size_t number) noexcept
{
    // The default timer slack wakes a thread up to 50 microseconds late, which would count as latency. See prctl(2).
    static_cast<void>(::prctl(PR_SET_TIMERSLACK, 1UL));
    try {
        pCarryShare(number);
    } catch (...) {
        pKeepFailure(std::current_exception());
    }
    mPairs[number]->leave();
    if (--mRunning == 0) mEnded.interrupt();
}

void BenchRun::pCarryShare(std::size_t number)
{
    const BenchShare share(mLoad, static_cast<unsigned int>(number), mStart);
    share.run([this, number] { mPairs[number]->exchange(); },
              [this](BenchShare::TimePoint time) { return pWaitUntil(time); }, mFigures[number], mDone);
    const MutexLock lock(mMutex);
    if (--mCarrying == 0) mStop = true; // an interruption from now on has no effect
}

bool BenchRun::pWaitUntil(BenchShare::TimePoint time)
{
    UniqueMutexLock lock(mMutex);
    while (!mStop) {
        if (TimeProvider::steady() >= time) return true;
        static_cast<void>(mStopped.waitUntil(lock, time));
    }
    return false;
}

/// The first failure stops the run. Later failures, and failures after stop(), are consequences and are dropped.
void BenchRun::pKeepFailure(std::exception_ptr failure)
{
    const MutexLock lock(mMutex);
    if (!mStop) mFailure = std::move(failure);
    mStop = true;
    mStopped.notifyAll();
}

void BenchRun::pJoin()
{
    for (std::thread& thread : mThreads)
        thread.join();
    mThreads.clear();
}

} // namespace qel::tool
