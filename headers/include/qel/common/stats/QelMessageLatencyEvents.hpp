#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>
#include <qel/common/util/RingBuffer.hpp>

#include <chrono>
#include <ostream>

namespace qel {

/// A short history of the times when messages were slow. An event begins with a slow message and ends when no slow one
/// has come for ten seconds; what is kept are the last five.
///
/// Fast messages inside an event belong to it only once another slow one shows that it went on. So an event stretches
/// from its first slow message to its latest one, and the fast ones after that are dropped when it closes. It is closed
/// by the first fast message after those ten seconds, which is not counted; without any message it stays open.
/// Thread safety: one thread at a time; the queue that owns it serialises all calls.
class QEL_EXPORT QelMessageLatencyEvents {
public:
    /// A message is slow when its latency is this or more.
    static constexpr std::chrono::nanoseconds THRESHOLD = std::chrono::milliseconds(250);

    /// How long after the latest slow message an event may close.
    static constexpr std::chrono::nanoseconds ESCAPE_INTERVAL = std::chrono::seconds(10);

    /// The fast messages since the latest slow one of an open event.
    struct PendingData {
        QelMessageCount mCompleted;
        std::chrono::nanoseconds mTotalLatency = {};
    };

    class Entry;

    /// Tells of one message. Allocates nothing. Reads the steady clock while an event is open or begins, and the system
    /// clock when the message is slow.
    void trace(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return whether there has never been an event
    bool empty() const noexcept { return mEntries.empty(); }

    /// Prints the events from the newest to the oldest.
    void dump(std::ostream& os, Indent indent) const;

    /// One event.
    class QEL_EXPORT Entry {
    public:
        /// A new event, open, with its first slow message.
        Entry(const QelMessage& message, const std::chrono::nanoseconds& latency,
              const std::chrono::system_clock::time_point& systemNow);

        /// Another slow message: the event goes on, and the fast messages before this one belong to it.
        /// @param pending  those fast messages; set to zero
        void extendEvent(const QelMessage& message, const std::chrono::nanoseconds& latency, PendingData& pending,
                         const std::chrono::system_clock::time_point& systemNow);

        /// Closes the event. Its end stays the time of its latest slow message.
        void endEvent() noexcept { mActive = false; }

        /// @return whether the event is open
        bool isActive() const noexcept { return mActive; }

        /// Prints one line with 'A' for an open or 'C' for a closed event and its two times in UTC, cut to whole
        /// seconds, and six lines of figures, which are indented by four more.
        void dump(std::ostream& os, Indent indent) const;

    private:
        std::chrono::nanoseconds pAverageLatency() const noexcept;

        bool mActive = true;
        std::chrono::system_clock::time_point mStartTime;
        std::chrono::system_clock::time_point mEndTime;
        QelMessageLatency mStartMessage; // the first slow message
        QelMessageLatency mEndMessage;   // the latest slow message
        QelMessageCount mCompleted;      // all messages of the event, slow and fast
        std::chrono::nanoseconds mMaxLatency;
        std::chrono::nanoseconds mTotalLatency;
    };

private:
    bool pIsOpen() const { return !mEntries.empty() && mEntries.head().isActive(); }
    void pBegin(const QelMessage& message, const std::chrono::nanoseconds& latency);
    void pContinue(const QelMessage& message, const std::chrono::nanoseconds& latency);

    std::chrono::steady_clock::time_point mTimeout; // when the open event may close
    RingBuffer<Entry, 5> mEntries;
    PendingData mPending; // zero unless an event is open
};

} // namespace qel
