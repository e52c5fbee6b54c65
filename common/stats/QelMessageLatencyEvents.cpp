#include <qel/common/stats/QelMessageLatencyEvents.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <cstdint>
#include <ctime>

namespace qel {

namespace {

/// Prints a time in UTC, rounded down to seconds: "2026-03-01 17:04:09". A time that gmtime refuses prints as nothing.
void printTime(std::ostream& os, const std::chrono::system_clock::time_point& time)
{
    const std::time_t second = std::chrono::system_clock::to_time_t(time);
    std::tm fields = {};
    char text[64] = "";
    if (::gmtime_r(&second, &fields) != nullptr) std::strftime(text, sizeof(text), "%F %T", &fields);
    os << text;
}

auto microseconds(const std::chrono::nanoseconds& duration)
{
    return decFormat(std::chrono::duration_cast<std::chrono::microseconds>(duration).count());
}

} // namespace

void QelMessageLatencyEvents::trace(const QelMessage& message, const std::chrono::nanoseconds& latency)
{
    if (pIsOpen()) {
        pContinue(message, latency);
    } else if (latency >= THRESHOLD) {
        pBegin(message, latency);
    }
}

void QelMessageLatencyEvents::pBegin(const QelMessage& message, const std::chrono::nanoseconds& latency)
{
    // Both clocks before any change: a substituted clock may throw.
    const auto systemNow = TimeProvider::system();
    const auto timeout = TimeProvider::steady() + ESCAPE_INTERVAL;
    mEntries.push(message, latency, systemNow);
    mTimeout = timeout;
}

void QelMessageLatencyEvents::pContinue(const QelMessage& message, const std::chrono::nanoseconds& latency)
{
    const auto now = TimeProvider::steady();
    if (latency >= THRESHOLD) {
        mEntries.head().extendEvent(message, latency, mPending, TimeProvider::system());
        mTimeout = now + ESCAPE_INTERVAL;
    } else if (now >= mTimeout) {
        mEntries.head().endEvent();
        mPending = PendingData();
    } else {
        mPending.mCompleted += message;
        mPending.mTotalLatency += latency;
    }
}

void QelMessageLatencyEvents::dump(std::ostream& os, Indent indent) const
{
    for (const Entry& entry : mEntries)
        entry.dump(os, indent);
}

QelMessageLatencyEvents::Entry::Entry(const QelMessage& message, const std::chrono::nanoseconds& latency,
                                      const std::chrono::system_clock::time_point& systemNow)
    : mStartTime(systemNow), mEndTime(systemNow), mStartMessage(message, latency), mEndMessage(mStartMessage),
      mMaxLatency(latency), mTotalLatency(latency)
{
    mCompleted += message;
}

void QelMessageLatencyEvents::Entry::extendEvent(const QelMessage& message, const std::chrono::nanoseconds& latency,
                                                 PendingData& pending,
                                                 const std::chrono::system_clock::time_point& systemNow)
{
    mEndTime = systemNow;
    mEndMessage = QelMessageLatency(message, latency);
    mCompleted += message;
    mCompleted += pending.mCompleted;
    mTotalLatency += latency + pending.mTotalLatency;
    mMaxLatency = std::max(mMaxLatency, latency);
    pending = PendingData();
}

std::chrono::nanoseconds QelMessageLatencyEvents::Entry::pAverageLatency() const noexcept
{
    if (mCompleted.mCount == 0) return {};
    return mTotalLatency / static_cast<std::int64_t>(mCompleted.mCount);
}

void QelMessageLatencyEvents::Entry::dump(std::ostream& os, Indent indent) const
{
    os << indent << '(' << (mActive ? 'A' : 'C') << ") [";
    printTime(os, mStartTime);
    os << " - ";
    printTime(os, mEndTime);
    os << " UTC]\n";

    indent += 4;
    const auto duration = std::chrono::duration_cast<std::chrono::milliseconds>(mEndTime - mStartTime);
    os << indent << "Duration:       " << DHMSDurationFormatter(duration) << '\n';
    os << indent << "First:          " << mStartMessage << '\n';
    os << indent << "Last:           " << mEndMessage << '\n';
    os << indent << "Completed:      " << mCompleted << '\n';
    os << indent << "Max Latency:    " << microseconds(mMaxLatency) << " us\n";
    os << indent << "Avg Latency:    " << microseconds(pAverageLatency()) << " us\n";
}

} // namespace qel
