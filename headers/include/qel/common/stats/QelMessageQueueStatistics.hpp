#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageLatencyBuckets.hpp>
#include <qel/common/stats/QelMessageLatencyEvents.hpp>
#include <qel/common/stats/QelMessageMaxLatencyStatistics.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>

#include <chrono>
#include <cstdint>
#include <ostream>

namespace qel {

/// The statistics of a message queue: how much is pending and has passed, how long messages wait, which kinds were the
/// slowest, and when latency was high.
///
/// Durations are measured on the steady clock, times of day on the system clock, both through TimeProvider. Updates
/// neither allocate nor format. An update that throws, because a substituted clock does, has changed nothing.
/// Thread safety: one thread at a time; a queue calls it with its lock held.
class QEL_EXPORT QelMessageQueueStatistics {
public:
    /// Records that a message has entered the queue. Reads the steady clock once if the queue was empty.
    /// @param enqueueLatency  how long its producer was blocked
    /// @throws what a substituted clock throws
    void enqueued(const QelMessage& message, const std::chrono::nanoseconds& enqueueLatency);

    /// Records that a message was refused.
    void dropped(const QelMessage& message);

    /// Records that the first message has left the queue. Reads the steady clock once, and both clocks again as
    /// QelMessageLatencyEvents::trace() describes.
    /// @param latency  the time since the call that enqueued it
    /// @throws what a substituted clock throws
    void dequeued(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return the messages in the queue; owned by this object
    const QelMessageCount& getPending() const noexcept { return mPending; }

    /// @return the messages that were refused; owned by this object
    const QelMessageCount& getDropped() const noexcept { return mDropped; }

    /// @return the messages that have left the queue; owned by this object
    const QelMessageCount& getCompleted() const noexcept { return mCompleted; }

    /// @return the highest number of pending bytes so far
    std::uint64_t getMaxPendingBytes() const noexcept { return mMaxPendingBytes; }

    /// @return how long messages took from the call that enqueued them to leaving the queue; owned by this object
    const QelMessageLatencyBuckets& getE2ELatency() const noexcept { return mE2ELatencyBuckets; }

    /// @return the messages and bytes that left the queue, per second during which it was not empty: integers, rounded
    ///         down; zero while that time is zero. The product of bytes and 10^9 wraps at 2^64, that is at 18 GB.
    QelMessageThroughput getThroughput() const noexcept;

    /// Prints everything, each line after the indent. Reads the steady clock once if the queue is not empty. Leaves the
    /// stream as the formatters do: upper-case digits, fill character '0' or a blank.
    /// @param os  borrowed for the call
    /// @throws std::bad_alloc, what a substituted clock throws, and what the stream throws if its exceptions() are set;
    /// part of the text may have been printed
    void dump(std::ostream& os, const Indent& indent) const;

private:
    std::uint64_t mMaxPendingBytes = 0; // the highest number of pending bytes
    QelMessageCount mPending;
    QelMessageCount mDropped;
    QelMessageCount mCompleted;
    std::chrono::steady_clock::time_point mHeadReadyTime; // when the head of the queue became the head
    std::chrono::nanoseconds mTotalHeadLatency = {};      // total time that messages were the head
    QelMessageLatencyBuckets mEnqueueLatencyBuckets;      // time that producers were blocked
    QelMessageLatencyBuckets mDequeueLatencyBuckets;      // time that a message was the head
    QelMessageLatencyBuckets mE2ELatencyBuckets;          // from the call of the producer to leaving the queue
    QelMessageMaxLatencyStatistics mMaxLatency;
    QelMessageLatencyEvents mLatencyEvents;
};

} // namespace qel
