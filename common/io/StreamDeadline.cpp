#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "util/Timeout.hpp"

namespace qel {

using std::chrono::milliseconds;

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

// Without this operator an assignment would construct a new StreamDeadline and lose the deadline in force.
StreamDeadline& StreamDeadline::operator=(milliseconds timeout) noexcept
{
    setDeadline(timeout);
    return *this;
}

milliseconds StreamDeadline::getEffectiveTimeout()
{
    if (mPendingDeadline != Infinite) {
        const milliseconds timeout = mPendingDeadline;
        mDeadline = deadlineAfter(TimeProvider::steady(), timeout);
        mPendingDeadline = Infinite;
        return timeout;
    }
    if (mDeadline == NoDeadline) return Infinite;

    const auto now = TimeProvider::steady();
    if (now > mDeadline) throw StreamIOException("I/O deadline");
    return timeLeft(now, mDeadline);
}

} // namespace qel
