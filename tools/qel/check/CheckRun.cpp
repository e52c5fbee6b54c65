#include "check/CheckRun.hpp"

#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <exception>
#include <optional>
#include <thread>

namespace qel::tool::check {

namespace {

constexpr unsigned int kSharing = kShared | kPartition | kEchoPartition | kEndingPartition;

/// Which case is next, and what has come of the others. Several threads work on it.
class Work {
public:
    Work(const Cases& cases, const CheckRun::RunCase& runCase, const CheckRun::OnOutcome& onOutcome)
        : mCases(cases), mRunCase(runCase), mOnOutcome(onOutcome), mTaken(cases.size(), false), mOutcomes(cases.size())
    {
        for (std::size_t i = 0; i < cases.size(); ++i) {
            mOutcomes[i].test = &cases[i];
            mOutcomes[i].result = Result::Skipped;
            mOutcomes[i].seen = "interrupted";
        }
    }

    /// Runs cases until none is left for this thread. @param alone  only those that run alone, or all others
    void run(bool alone) noexcept
    {
        try {
            while (const auto next = pTake(alone))
                pFinish(*next, mRunCase(mCases[*next], static_cast<unsigned int>(*next + 1)));
        } catch (...) {
            const MutexLock lock(mMutex);
            mStopped = true;
            mFailure = std::current_exception();
        }
    }

    std::vector<Outcome> takeOutcomes()
    {
        const MutexLock lock(mMutex);
        if (mFailure) std::rethrow_exception(mFailure);
        return std::move(mOutcomes);
    }

private:
    bool pMayRun(std::size_t index, bool alone) const QEL_REQUIRES(mMutex)
    {
        const unsigned int needs = mCases[index].needs;
        if (mTaken[index] || ((needs & kAlone) != 0) != alone) return false;
        return !mIsSharing || (needs & kSharing) == 0;
    }

    std::optional<std::size_t> pTake(bool alone)
    {
        const MutexLock lock(mMutex);
        for (std::size_t i = 0; !mStopped && i < mCases.size(); ++i) {
            if (!pMayRun(i, alone)) continue;
            mTaken[i] = true;
            if ((mCases[i].needs & kSharing) != 0) mIsSharing = true;
            return i;
        }
        return std::nullopt;
    }

    void pFinish(std::size_t index, Outcome outcome)
    {
        const MutexLock lock(mMutex);
        if ((mCases[index].needs & kSharing) != 0) mIsSharing = false;
        mOutcomes[index] = std::move(outcome);
        if (!mOnOutcome(mOutcomes[index], ++mDone)) mStopped = true;
    }

    const Cases& mCases;
    const CheckRun::RunCase& mRunCase;
    const CheckRun::OnOutcome& mOnOutcome;

    Mutex mMutex; // also held while an outcome is reported, so that lines do not mix
    std::vector<bool> mTaken QEL_GUARDED_BY(mMutex);
    std::vector<Outcome> mOutcomes QEL_GUARDED_BY(mMutex);
    std::size_t mDone QEL_GUARDED_BY(mMutex) = 0;
    bool mIsSharing QEL_GUARDED_BY(mMutex) = false; ///< a case that shares state is running
    bool mStopped QEL_GUARDED_BY(mMutex) = false;
    std::exception_ptr mFailure QEL_GUARDED_BY(mMutex);
};

/// Tries the case. Whatever else it throws tells about the peer too: a library call did not get what it needs.
void tryCase(const Case& aCase, Trial& trial, Outcome& outcome)
{
    try {
        aCase.run(trial);
    } catch (const Skip& skip) {
        outcome.result = Result::Skipped;
        outcome.seen = skip.what();
    } catch (const Failure& failure) {
        outcome.result = Result::Fails;
        outcome.expected = failure.getExpected();
        outcome.seen = failure.getSeen();
    } catch (const std::bad_alloc&) {
        throw;
    } catch (const std::exception& error) {
        outcome.result = Result::Fails;
        outcome.expected = "the connection to go on";
        outcome.seen = error.what();
    }
}

} // namespace

Outcome runCase(const Case& aCase, const Target& target, unsigned int number)
{
    Outcome outcome;
    outcome.test = &aCase;
    outcome.seen = missingFor(aCase, target);
    if (!outcome.seen.empty()) {
        outcome.result = Result::Skipped;
        return outcome;
    }
    const auto begin = TimeProvider::steady();
    Trial trial(target, number);
    tryCase(aCase, trial, outcome);
    const std::string notPutBack = trial.finish();
    if (!notPutBack.empty() && outcome.result == Result::Holds) {
        outcome.result = Result::Fails;
        outcome.expected = "what the case has changed to be put back";
        outcome.seen = notPutBack;
    }
    if (outcome.result == Result::Fails) outcome.transcript = trial.transcript();
    outcome.time = TimeProvider::steady() - begin;
    return outcome;
}

CheckRun::CheckRun(const Cases& cases, unsigned int parallel, RunCase runCase)
    : mCases(cases), mParallel(parallel), mRunCase(std::move(runCase))
{}

std::vector<Outcome> CheckRun::run(const OnOutcome& onOutcome)
{
    Work work(mCases, mRunCase, onOutcome);
    std::vector<std::thread> threads;
    try {
        for (unsigned int i = 1; i < mParallel; ++i)
            threads.emplace_back([&work] { work.run(false); });
    } catch (const std::system_error&) { // NOLINT(bugprone-empty-catch): those that there are do all of it
    }
    work.run(false);
    for (std::thread& thread : threads)
        thread.join();
    work.run(true);
    return work.takeOutcomes();
}

} // namespace qel::tool::check
