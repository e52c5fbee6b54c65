#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>

#include <array>
#include <chrono>
#include <cstddef>
#include <ostream>

namespace qel {

/// The slowest kinds of message: up to eight, the slowest first, each with the worst latency seen for it. A kind is a
/// pair of function code and operation type, so a request and its response are of one kind.
///
/// A kind whose function code or operation type is zero is kept like any other, but an entry of it ends what is
/// printed, and one in front hides the whole list.
/// Thread safety: one thread at a time; the queue that owns it serialises all calls.
class QEL_EXPORT QelMessageMaxLatencyStatistics {
public:
    /// A latency below this is not slow and never enters the list.
    static constexpr std::chrono::nanoseconds THRESHOLD = std::chrono::milliseconds(250);

    /// Enters one message, if it is slow enough for the list. Of equal latencies of different kinds the older stays in
    /// front; of equal latencies of one kind the caller id of the younger is kept. Allocates nothing.
    void trace(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return whether there is nothing to print: the first entry is unused, or not valid
    bool empty() const noexcept { return !mEntries.front().isValid(); }

    /// Prints one line for each entry from the first to the last valid one in front of any that is not.
    void dump(std::ostream& os, const Indent& indent) const;

private:
    /// Moves an entry whose latency has grown up to its place, behind those that are equal.
    void pAdjust(std::size_t position);

    std::array<QelMessageLatency, 8> mEntries; // by descending latency; unused ones, all zero, at the end
};

} // namespace qel
