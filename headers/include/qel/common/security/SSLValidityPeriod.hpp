#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <ctime>

namespace qel {

/// The time during which a certificate is valid: a first and a last second, both inclusive (RFC 5280, 4.1.2.5).
/// Thread safety: that of a plain value.
class QEL_EXPORT SSLValidityPeriod {
public:
    /// The calendar in seconds since 1970-01-01 00:00 UTC, as time(2) counts them. It always follows the system's
    /// clock: certificates are for other machines too, so a substituted clock (TimeProvider) does not affect them.
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
            return time.time_since_epoch().count();
        }
        static constexpr time_point from_time_t(std::time_t time) noexcept { return time_point(duration(time)); }

        static constexpr time_point(min)() noexcept { return time_point((duration::min)()); }
        static constexpr time_point(max)() noexcept { return time_point((duration::max)()); }
    };

    /// From 24 hours ago until `duration` from now. So a new certificate is already valid for a peer whose clock is up
    /// to a day behind, and the period is a day longer than `duration`.
    /// @param duration  in seconds; may be negative. An end that Clock cannot represent becomes Clock::max().
    SSLValidityPeriod(std::chrono::seconds duration) noexcept; // not explicit: a number of days converts to a period

    /// Takes both ends as given, without a check.
    constexpr SSLValidityPeriod(Clock::time_point notBefore, Clock::time_point notAfter) noexcept
        : mNotBefore(notBefore), mNotAfter(notAfter)
    {}

    /// @return n times 24 hours, or the largest number of whole days that the type can represent
    static std::chrono::seconds days(unsigned long n) noexcept;

    Clock::time_point getNotBefore() const noexcept { return mNotBefore; }
    Clock::time_point getNotAfter() const noexcept { return mNotAfter; }

    /// From Clock::min() to Clock::max(), for comparisons. No certificate can express it: making one with it throws
    /// SSLException.
    static const SSLValidityPeriod Infinite;

private:
    Clock::time_point mNotBefore;
    Clock::time_point mNotAfter;
};

} // namespace qel
