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

/// The eight slowest kinds of message, slowest first, each with its highest latency. A kind is a pair of function code
/// and operation type, so a request and its response are of one kind.
///
/// A kind whose function code or operation type is zero is listed like any other, but is not valid: printing stops at
/// its entry, and if it is the first one, nothing is printed.
/// Thread safety: one thread at a time; a queue calls it with its lock held.
class QEL_EXPORT QelMessageMaxLatencyStatistics {
public:
    /// A lower latency is not slow and does not enter the list.
    static constexpr std::chrono::nanoseconds THRESHOLD = std::chrono::milliseconds(250);

    /// Records a message, if it is slow enough for the list. Of equal latencies of different kinds the older entry
    /// comes first; of equal latencies of one kind the newer caller id is kept. Does not allocate.
    void trace(const QelMessage& message, const std::chrono::nanoseconds& latency);

    /// @return whether there is nothing to print: the first entry is unused, or not valid
    bool empty() const noexcept { return !mEntries.front().isValid(); }

    /// Prints a line for each entry before the first that is not valid.
    /// @param os  borrowed for the call
    /// @throws what the stream throws if its exceptions() are set
    void dump(std::ostream& os, const Indent& indent) const;

private:
    /// Moves an entry whose latency has grown up the list, to its place after equal ones.
    void pAdjust(std::size_t position);

    std::array<QelMessageLatency, 8> mEntries; // by descending latency; unused ones, all zero, at the end
};

} // namespace qel
