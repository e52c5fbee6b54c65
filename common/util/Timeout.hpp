#pragma once

#include <chrono>
#include <cstdint>

/// @file
/// Arithmetic with timeouts that cannot overflow: a timeout comes from the caller and may have any value, and a
/// substituted clock may show any time.

namespace qel {

/// A timeout longer than the range of the clock, which is 292 years, counts as that range.
/// @return now + timeout; where the steady clock cannot hold that, the end of its range on that side
inline std::chrono::steady_clock::time_point deadlineAfter(std::chrono::steady_clock::time_point now,
                                                           std::chrono::milliseconds timeout) noexcept
{
    using std::chrono::milliseconds;
    using time_point = std::chrono::steady_clock::time_point;
    using duration = time_point::duration;

    constexpr milliseconds kMax = std::chrono::duration_cast<milliseconds>(duration::max());
    duration delta = timeout > milliseconds(0) ? duration::max() : duration::min();
    if (timeout >= -kMax && timeout <= kMax) delta = timeout;

    if (delta.count() > 0 && now > time_point::max() - delta) return time_point::max();
    if (delta.count() < 0 && now < time_point::min() - delta) return time_point::min();
    return now + delta;
}

/// @param deadline  not before now
/// @return the time from now to the deadline in milliseconds, rounded down
inline std::chrono::milliseconds timeLeft(std::chrono::steady_clock::time_point now,
                                          std::chrono::steady_clock::time_point deadline) noexcept
{
    using std::chrono::milliseconds;
    using std::chrono::nanoseconds;

    static_assert(std::chrono::steady_clock::duration::period::den == nanoseconds::period::den &&
                      sizeof(std::chrono::steady_clock::rep) == sizeof(std::uint64_t),
                  "the clock counts 64-bit nanoseconds");
    // The difference of two 64-bit numbers always fits 64 bits without a sign.
    const auto from = static_cast<std::uint64_t>(now.time_since_epoch().count());
    const auto to = static_cast<std::uint64_t>(deadline.time_since_epoch().count());
    constexpr std::uint64_t kNanosecondsPerMillisecond = 1000 * 1000;
    return milliseconds(static_cast<milliseconds::rep>((to - from) / kNanosecondsPerMillisecond));
}

} // namespace qel
