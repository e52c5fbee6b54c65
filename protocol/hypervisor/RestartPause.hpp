#pragma once

#include <algorithm>
#include <chrono>

namespace qel::protocol {

/// How long to wait before a line that has ended is brought up again: 1 s, and twice as long each time, up to 30 s. A
/// line that has been up long enough starts over. Thread safety: none of its own.
class RestartPause {
public:
    using Duration = std::chrono::steady_clock::duration;

    static constexpr std::chrono::seconds kFirst{1};
    static constexpr std::chrono::seconds kLongest{30};

    /// @param settled  how long a line has to be up to start over
    explicit RestartPause(Duration settled) : mSettled(settled) {}

    /// @param wasUp  how long the line has been up; 0: it did not come up
    /// @return the next pause
    Duration next(Duration wasUp)
    {
        if (wasUp >= mSettled) mNext = kFirst;
        const Duration pause = mNext;
        mNext = std::min<Duration>(2 * mNext, kLongest);
        return pause;
    }

private:
    Duration mSettled;
    Duration mNext = kFirst;
};

} // namespace qel::protocol
