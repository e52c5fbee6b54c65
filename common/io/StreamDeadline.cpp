#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <cstdint>

namespace qel {

namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using time_point = std::chrono::steady_clock::time_point;

static_assert(time_point::duration::period::den == nanoseconds::period::den && sizeof(time_point::rep) == 8,
              "the arithmetic below counts 64-bit nanoseconds");

// The timeout is the user's and may be anything; the result stays within the range of the clock.
time_point addSaturated(time_point now, milliseconds timeout) noexcept
{
    constexpr milliseconds longest = std::chrono::duration_cast<milliseconds>(nanoseconds::max());
    if (timeout > longest) timeout = longest;
    if (timeout < -longest) timeout = -longest;

    const nanoseconds delta = timeout;
    if (delta.count() > 0 && now > time_point::max() - delta) return time_point::max();
    if (delta.count() < 0 && now < time_point::min() - delta) return time_point::min();
    return now + delta;
}

// Whole milliseconds from `now` to `deadline`, which is not before it. The distance of two 64-bit points fits 64 bits
// only without a sign, and a substituted clock may well stand far below zero.
milliseconds wholeMillisecondsBetween(time_point now, time_point deadline) noexcept
{
    const auto from = static_cast<std::uint64_t>(now.time_since_epoch().count());
    const auto to = static_cast<std::uint64_t>(deadline.time_since_epoch().count());
    constexpr std::uint64_t nanosecondsPerMillisecond = 1000 * 1000;
    return milliseconds(static_cast<milliseconds::rep>((to - from) / nanosecondsPerMillisecond));
}

} // namespace

StreamDeadline::StreamDeadline(milliseconds timeout) noexcept : mPendingDeadline(timeout) {}

void StreamDeadline::setDeadline(milliseconds timeout) noexcept
{
    if (timeout < milliseconds::zero()) {
        mPendingDeadline = Infinite;
        mDeadline = NoDeadline;
        return;
    }
    mPendingDeadline = timeout;
}

// An operator of its own: by way of the converting constructor, an assignment would throw away the deadline in force.
StreamDeadline& StreamDeadline::operator=(milliseconds timeout) noexcept
{
    setDeadline(timeout);
    return *this;
}

milliseconds StreamDeadline::getEffectiveTimeout()
{
    if (mPendingDeadline != Infinite) {
        const milliseconds timeout = mPendingDeadline;
        mDeadline = addSaturated(TimeProvider::steady(), timeout);
        mPendingDeadline = Infinite;
        return timeout;
    }
    if (mDeadline == NoDeadline) return Infinite;

    const time_point now = TimeProvider::steady();
    if (now > mDeadline) throw StreamIOException("I/O deadline");
    return wholeMillisecondsBetween(now, mDeadline);
}

} // namespace qel
