#include <qel/common/stats/QelMessageMaxLatencyStatistics.hpp>

#include <algorithm>

namespace qel {

void QelMessageMaxLatencyStatistics::trace(const QelMessage& message, const std::chrono::nanoseconds& latency)
{
    if (latency < THRESHOLD || latency <= mEntries.back().mLatency) return;

    const QelMessageLatency traced(message, latency);
    const auto sameKind = [&traced](const QelMessageLatency& entry) {
        return entry.mFunction == traced.mFunction && entry.mOperation == traced.mOperation;
    };
    auto entry = std::find_if(mEntries.begin(), mEntries.end(), sameKind);
    if (entry == mEntries.end()) {
        --entry; // replace the least slow kind
    } else if (latency < entry->mLatency) {
        return;
    }
    *entry = traced;
    pAdjust(static_cast<std::size_t>(entry - mEntries.begin()));
}

void QelMessageMaxLatencyStatistics::pAdjust(std::size_t position)
{
    const QelMessageLatency moving = mEntries[position];
    while (position > 0 && mEntries[position - 1].mLatency < moving.mLatency) {
        mEntries[position] = mEntries[position - 1];
        --position;
    }
    mEntries[position] = moving;
}

void QelMessageMaxLatencyStatistics::dump(std::ostream& os, const Indent& indent) const
{
    for (const QelMessageLatency& entry : mEntries) {
        if (!entry.isValid()) return;
        os << indent << entry << '\n';
    }
}

} // namespace qel
