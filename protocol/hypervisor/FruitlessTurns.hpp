#pragma once

#include <qel/common/util/Poll.hpp>

#include <chrono>

namespace qel::protocol {

/// Keeps a line from making the serial thread spin: when its descriptor stays ready and several turns in a row have
/// moved nothing, the descriptor is left alone for a moment. A few such turns are normal, since a line may read
/// protocol bytes of its own. Thread safety: none of its own.
class FruitlessTurns {
public:
    /// Turns in a row that may move nothing.
    static constexpr int kMost = 8;
    static constexpr std::chrono::milliseconds kPause{20};

    /// Notes what a turn has achieved.
    void count(bool hasMoved, PollDeadline::time_point now)
    {
        mInARow = hasMoved ? 0 : mInARow + 1;
        if (mInARow < kMost) return;
        mInARow = 0;
        mPauseEnd = now + kPause;
    }

    bool isPausing() const noexcept { return !mPauseEnd.isDisabled(); }
    PollDeadline pauseEnd() const noexcept { return mPauseEnd; }

    /// Ends the pause when it is over.
    void passTime(PollDeadline::time_point now)
    {
        if (mPauseEnd.isExpired(now)) mPauseEnd = PollDeadline();
    }

private:
    int mInARow = 0;
    PollDeadline mPauseEnd; ///< enabled: pausing
};

} // namespace qel::protocol
