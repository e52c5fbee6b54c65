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

/// What a message queue knows about itself: how much waits and has passed, how long messages wait, which kinds were the
/// slowest, and when there were times of high latency.
///
/// Durations are measured on the steady clock, times of day read from the system clock, both through TimeProvider.
/// Updates allocate nothing and format nothing. Should a substitute clock throw, an update has changed nothing.
/// Thread safety: one thread at a time; the queue that owns it serialises all calls, dumps included.
class QEL_EXPORT QelMessageQueueStatistics {
public:
    /// A message has entered the queue. Reads the steady clock once if the queue was empty.
    /// @param enqueueLatency  how long its producer was held up before that
    void enqueued(const QelMessage& message, const std::chrono::nanoseconds& enqueueLatency);

    /// A message was refused.
    void dropped(const QelMessage& message);

    /// The message at the head has left the queue. Reads the steady clock once, and both clocks again as
    /// QelMessageLatencyEvents::trace() says.
    /// @param latency  how long it took from the call that brought it
    void dequeued(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return what is in the queue now
    const QelMessageCount& getPending() const noexcept { return mPending; }

    /// @return messages and bytes that left the queue per second in which it was not empty; whole numbers, rounded
    /// down, and zero before any such time has passed. The product of bytes and nanoseconds wraps at 2^64, that is at
    /// 18 GB.
    QelMessageThroughput getThroughput() const noexcept;

    /// Prints everything, each line behind the indent. Reads the steady clock once if the queue is not empty. The
    /// stream is left as the formatters leave it: upper-case digits, fill character '0' or a blank.
    /// @throws std::bad_alloc, what a substitute clock throws, and what the stream throws if it was told to; part of
    /// the text may have been printed then
    void dump(std::ostream& os, const Indent& indent) const;

private:
    std::uint64_t mMaxPendingBytes = 0; // the most bytes that ever waited
    QelMessageCount mPending;
    QelMessageCount mDropped;
    QelMessageCount mCompleted;
    std::chrono::steady_clock::time_point mHeadReadyTime; // when the message at the head came there
    std::chrono::nanoseconds mTotalHeadLatency = {};      // what all heads waited there, together
    QelMessageLatencyBuckets mEnqueueLatencyBuckets;      // producers held up
    QelMessageLatencyBuckets mDequeueLatencyBuckets;      // waiting at the head
    QelMessageLatencyBuckets mE2ELatencyBuckets;          // from the producer's call to leaving the queue
    QelMessageMaxLatencyStatistics mMaxLatency;
    QelMessageLatencyEvents mLatencyEvents;
};

} // namespace qel
