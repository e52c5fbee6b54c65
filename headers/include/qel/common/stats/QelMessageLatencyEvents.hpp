#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>
#include <qel/common/util/RingBuffer.hpp>

#include <chrono>
#include <ostream>

namespace qel {

/// The last five latency events: periods in which messages were slow. An event begins with a slow message and ends when
/// no slow message has come for ten seconds.
///
/// An event extends from its first slow message to its last one. Fast messages count only if a slow message follows
/// them in the same event; those after the last slow message are not counted. The first fast message after the ten
/// seconds closes the event and is not counted; without any message the event stays open.
///
/// Thread safety: one thread at a time; a queue calls it with its lock held.
class QEL_EXPORT QelMessageLatencyEvents {
public:
    /// A message is slow when its latency is this or more.
    static constexpr std::chrono::nanoseconds THRESHOLD = std::chrono::milliseconds(250);

    /// The time without slow messages after which an event closes.
    static constexpr std::chrono::nanoseconds ESCAPE_INTERVAL = std::chrono::seconds(10);

    /// The fast messages since the last slow one of an open event.
    struct PendingData {
        QelMessageCount mCompleted;
        std::chrono::nanoseconds mTotalLatency = {};
    };

    class Entry;

    /// Records a message. Does not allocate. Reads the steady clock if an event is open or begins, and the system clock
    /// if the message is slow.
    /// @throws what a substituted clock throws; nothing is recorded then
    void trace(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return whether there has been no event yet
    bool empty() const noexcept { return mEntries.empty(); }

    /// Prints the events, newest first.
    /// @param os  borrowed for the call
    /// @throws what the stream throws if its exceptions() are set
    void dump(std::ostream& os, Indent indent) const;

    /// One event.
    class QEL_EXPORT Entry {
    public:
        /// Opens an event with its first slow message.
        Entry(const QelMessage& message, const std::chrono::nanoseconds& latency,
              const std::chrono::system_clock::time_point& systemNow);

        /// Adds another slow message, and the fast messages before it.
        /// @param pending  those fast messages; reset to zero
        void extendEvent(const QelMessage& message, const std::chrono::nanoseconds& latency, PendingData& pending,
                         const std::chrono::system_clock::time_point& systemNow);

        /// Closes the event. Its end remains the time of its last slow message.
        void endEvent() noexcept { mActive = false; }

        /// @return whether the event is open
        bool isActive() const noexcept { return mActive; }

        /// Prints a line with 'A' for an open or 'C' for a closed event and with its start and end in UTC, rounded down
        /// to seconds; then six lines of figures, indented by four more.
        void dump(std::ostream& os, Indent indent) const;

    private:
        std::chrono::nanoseconds pAverageLatency() const noexcept;

        bool mActive = true;
        std::chrono::system_clock::time_point mStartTime;
        std::chrono::system_clock::time_point mEndTime;
        QelMessageLatency mStartMessage; // the first slow message
        QelMessageLatency mEndMessage;   // the last slow message
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
