#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <ctime>

namespace qel {

/// From when until when a certificate is valid, both ends included (RFC 5280, 4.1.2.5). A value in whole seconds of the
/// calendar.
/// Thread safety: that of a plain value.
class QEL_EXPORT SSLValidityPeriod {
public:
    /// The calendar in seconds since 1970-01-01 00:00 UTC, as time(2) counts them. It follows the system's clock and
    /// nothing else: certificates are made for other machines, so a clock that a program has substituted
    /// (TimeProvider) does not move them.
    class Clock {
    public:
        using duration = std::chrono::seconds;
        using rep = duration::rep;
        using period = duration::period;
        using time_point = std::chrono::time_point<Clock, duration>;

        /// The calendar can be set.
        static constexpr bool is_steady = false;

        static time_point now() noexcept { return from_time_t(std::time(nullptr)); }

        static constexpr std::time_t to_time_t(const time_point& time) noexcept
        {
            return static_cast<std::time_t>(time.time_since_epoch().count());
        }
        static constexpr time_point from_time_t(std::time_t time) noexcept { return time_point(duration(time)); }

        static constexpr time_point(min)() noexcept { return time_point((duration::min)()); }
        static constexpr time_point(max)() noexcept { return time_point((duration::max)()); }
    };

    /// From 24 hours ago until `duration` from now: a certificate that is made now is at once valid for a peer whose
    /// clock runs up to a day behind, and the period is longer than `duration` by that day.
    /// @param duration  any length, also one that has passed; an end that the calendar does not reach becomes
    ///                  Clock::max()
    SSLValidityPeriod(std::chrono::seconds duration) noexcept; // not explicit: a number of days will do for a period

    /// Takes both ends as they are.
    constexpr SSLValidityPeriod(Clock::time_point notBefore, Clock::time_point notAfter) noexcept
        : mNotBefore(notBefore), mNotAfter(notAfter)
    {}

    /// @return n times 24 hours, or the most that the type can hold in whole days
    static std::chrono::seconds days(unsigned long n) noexcept;

    Clock::time_point getNotBefore() const noexcept { return mNotBefore; }
    Clock::time_point getNotAfter() const noexcept { return mNotAfter; }

    /// From Clock::min() to Clock::max(). A value to compare with: no certificate can express it, and making one with
    /// it throws SSLException.
    static const SSLValidityPeriod Infinite;

private:
    Clock::time_point mNotBefore;
    Clock::time_point mNotAfter;
};

} // namespace qel
