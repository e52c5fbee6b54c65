#pragma once

#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "base/Library.hpp"
#include "bench/BenchLoad.hpp"
#include "bench/BenchPair.hpp"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <exception>
#include <memory>
#include <thread>
#include <vector>

namespace qel::tool {

/// A run of a benchmark. Each pair of consoles has a thread; all share one start time.
///
/// When one pair fails, the others stop after their current message. Each pair ends its connections on its own thread,
/// so that the waits for a stopped server run in parallel.
/// Thread safety: one thread owns it.
class BenchRun {
public:
    /// Starts the threads.
    /// @param pairs  as many as the load says
    /// @throws std::system_error  a thread cannot be started
    BenchRun(std::vector<std::unique_ptr<BenchPair>> pairs, const BenchLoad& load);

    /// Calls cut() if the run has not finished, and joins the threads.
    ~BenchRun();

    BenchRun(const BenchRun&) = delete;
    BenchRun& operator=(const BenchRun&) = delete;

    /// Readable once all pairs have finished and closed their connections.
    PollFd getPollFd() const { return mEnded.getPollFd(); }

    /// Messages completed so far.
    std::uint64_t done() const noexcept { return mDone; }

    std::chrono::nanoseconds elapsed() const;

    /// Lets each pair end with the message it has in hand. Changes nothing once all are done.
    void stop();

    /// As stop(), but ends the connections at once, messages in hand or not.
    void cut();

    /// Waits for all pairs.
    /// @return the figures of all together
    /// @throws what the first pair that failed has thrown, unless that was after stop()
    BenchFigures finish();

private:
    void pRunPair(std::size_t number) noexcept;
    void pCarryShare(std::size_t number);
    bool pWaitUntil(BenchShare::TimePoint time);
    void pKeepFailure(std::exception_ptr failure);
    void pJoin();

    const BenchLoad mLoad;
    const std::vector<std::unique_ptr<BenchPair>> mPairs;
    const BenchShare::TimePoint mStart;
    std::vector<BenchFigures> mFigures; // of each pair; its thread writes them, and after that the owner reads them
    std::atomic<std::uint64_t> mDone{0};
    std::atomic<std::size_t> mRunning{0};
    WakeUp mEnded;

    mutable Mutex mMutex;
    ConditionVariable mStopped;
    std::size_t mCarrying QEL_GUARDED_BY(mMutex);     // pairs that are not done
    bool mStop QEL_GUARDED_BY(mMutex) = false;        // also once all are done
    bool mInterrupted QEL_GUARDED_BY(mMutex) = false; // by the owner, not by a failure
    std::exception_ptr mFailure QEL_GUARDED_BY(mMutex);

    std::vector<std::thread> mThreads;
};

} // namespace qel::tool
