#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>

namespace qel {

void QelMessageQueueStatistics::enqueued(const QelMessage& message, const std::chrono::nanoseconds& enqueueLatency)
{
    if (mPending.mCount == 0) mHeadReadyTime = TimeProvider::steady();
    mPending += message;
    mMaxPendingBytes = std::max(mMaxPendingBytes, mPending.mBytes);
    mEnqueueLatencyBuckets.increment(enqueueLatency, 1);
}

void QelMessageQueueStatistics::dropped(const QelMessage& message) { mDropped += message; }

void QelMessageQueueStatistics::dequeued(const QelMessage& message, const std::chrono::nanoseconds& latency)
{
    const auto now = TimeProvider::steady();
    mLatencyEvents.trace(message, latency); // reads clocks, which may throw: before any change
    mMaxLatency.trace(message, latency);
    mE2ELatencyBuckets.increment(latency, 1);
    mCompleted += message;
    mPending -= message;

    const std::chrono::nanoseconds headWait = now - mHeadReadyTime;
    mDequeueLatencyBuckets.increment(headWait, 1);
    mTotalHeadLatency += headWait;
    mHeadReadyTime = now; // the next message becomes the first one now
}

QelMessageThroughput QelMessageQueueStatistics::getThroughput() const noexcept
{
    constexpr std::uint64_t kNanosecondsPerSecond = 1000000000;
    QelMessageThroughput throughput;
    const auto total = static_cast<std::uint64_t>(mTotalHeadLatency.count());
    if (total == 0) return throughput;
    throughput.mPerSecond.mCount = mCompleted.mCount * kNanosecondsPerSecond / total;
    throughput.mPerSecond.mBytes = mCompleted.mBytes * kNanosecondsPerSecond / total;
    return throughput;
}

void QelMessageQueueStatistics::dump(std::ostream& os, const Indent& indent) const
{
    os << indent << "Max Size (HWM): " << decFormat(mMaxPendingBytes) << " B\n";
    os << indent << "Pending:        " << mPending << '\n';
    os << indent << "Dropped:        " << mDropped << '\n';
    os << indent << "Completed:      " << mCompleted << '\n';
    os << indent << "Throughput:     " << getThroughput() << '\n';
    if (mPending.mCount != 0) {
        const auto headWait = TimeProvider::steady() - mHeadReadyTime;
        const auto microseconds = std::chrono::duration_cast<std::chrono::microseconds>(headWait).count();
        os << indent << "Head Wait:      " << decFormat(microseconds) << " us\n";
    }

    QelMessageLatencyBuckets::Table table;
    table.addColumn({"Enqueue", mEnqueueLatencyBuckets});
    table.addColumn({"Dequeue", mDequeueLatencyBuckets});
    table.addColumn({"E2E", mE2ELatencyBuckets});
    os << indent << "Latency Buckets:\n";
    table.dump(os, indent + 2);

    if (!mMaxLatency.empty()) {
        os << indent << "Maximum Latency:\n";
        mMaxLatency.dump(os, indent + 2);
    }
    if (!mLatencyEvents.empty()) {
        os << indent << "Latency Events:\n";
        mLatencyEvents.dump(os, indent + 2);
    }
}

} // namespace qel
