#include <qel/common/security/SSLValidityPeriod.hpp>

#include <algorithm>

namespace qel {

namespace {

using std::chrono::seconds;
using Clock = SSLValidityPeriod::Clock;

constexpr seconds kDay = std::chrono::hours(24);

} // namespace

const SSLValidityPeriod SSLValidityPeriod::Infinite((Clock::min)(), (Clock::max)());

// Reads the clock once, so that both ends refer to the same moment.
SSLValidityPeriod::SSLValidityPeriod(seconds duration) noexcept : mNotBefore(Clock::now()), mNotAfter(mNotBefore)
{
    mNotAfter += (std::min)(duration, (Clock::max)() - mNotBefore);
    mNotBefore -= kDay;
}

seconds SSLValidityPeriod::days(unsigned long n) noexcept
{
    constexpr auto kMaxDays = static_cast<unsigned long>((seconds::max)() / kDay);
    return static_cast<seconds::rep>((std::min)(n, kMaxDays)) * kDay;
}

} // namespace qel
