#include "base/TimeLeft.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>

namespace qel::protocol {

namespace {

using std::chrono::milliseconds;

constexpr milliseconds kNoLimit(-1);

} // namespace

TimePoint deadlineIn(milliseconds timeout)
{
    if (timeout < milliseconds::zero()) return TimePoint::max();
    const TimePoint now = TimeProvider::steady();
    const auto room = std::chrono::duration_cast<milliseconds>(TimePoint::max() - now);
    return timeout >= room ? TimePoint::max() : now + timeout;
}

milliseconds timeLeft(TimePoint deadline)
{
    if (deadline == TimePoint::max()) return kNoLimit;
    const TimePoint now = TimeProvider::steady();
    if (deadline <= now) return milliseconds::zero();
    return std::min(std::chrono::ceil<milliseconds>(deadline - now), kLongestWait);
}

milliseconds timeToTry(TimePoint deadline)
{
    const milliseconds left = timeLeft(deadline);
    return left < milliseconds::zero() ? left : std::max(left, kShortestWait);
}

bool hasPassed(TimePoint deadline) { return deadline != TimePoint::max() && TimeProvider::steady() >= deadline; }

} // namespace qel::protocol
