#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>

namespace qel::protocol {

/// How long to wait before a line that has ended is brought up again: 1 s, and twice as long each time, up to 30 s. A
/// line that has been up long enough starts over. Each pause is up to a quarter longer, by a share that is the same
/// each time, so that the lines of one device that has gone and come back are not all brought up in the same moment.
/// Thread safety: none of its own.
class RestartPause {
public:
    using Duration = std::chrono::steady_clock::duration;

    static constexpr std::chrono::seconds kFirst{1};
    static constexpr std::chrono::seconds kLongest{30};

    /// The share of a quarter that the pauses of a partition are longer, of kShares; 0 for partition 1.
    static constexpr std::uint16_t kShares = 256;
    static constexpr std::uint16_t shareOf(std::uint16_t partition)
    {
        constexpr unsigned int kFar = 99; // neighbours get shares that are far from each other, and all are used
        return static_cast<std::uint16_t>((partition - 1U) * kFar % kShares);
    }

    /// @param settled  how long a line has to be up to start over
    /// @param share  of a quarter: see shareOf()
    explicit RestartPause(Duration settled, std::uint16_t share = 0) : mSettled(settled), mShare(share) {}

    /// @param wasUp  how long the line has been up; 0: it did not come up
    /// @return the next pause
    Duration next(Duration wasUp)
    {
        if (wasUp >= mSettled) mNext = kFirst;
        const Duration pause = mNext;
        mNext = std::min<Duration>(2 * mNext, kLongest);
        return pause + pause * mShare / (4 * kShares);
    }

private:
    Duration mSettled;
    std::uint16_t mShare;
    Duration mNext = kFirst;
};

} // namespace qel::protocol
