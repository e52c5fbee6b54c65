#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace qel {

/// A histogram of latencies in six buckets, each ten times as wide as the one before.
///
/// Thread safety: one thread at a time; the queue that owns it serialises all calls.
class QEL_EXPORT QelMessageLatencyBuckets {
public:
    /// The upper bounds of the first five buckets. A bound belongs to its bucket: exactly 1 ms counts in the first one.
    /// The sixth bucket takes whatever is above.
    static constexpr std::chrono::nanoseconds LIMITS[5] = {std::chrono::milliseconds(1), std::chrono::milliseconds(10),
                                                           std::chrono::milliseconds(100), std::chrono::seconds(1),
                                                           std::chrono::seconds(10)};

    /// Characters of each label.
    static constexpr std::size_t LABEL_WIDTH = 11;

    /// What stands in front of each bucket's counts, padded with blanks to LABEL_WIDTH.
    static constexpr const char* BUCKET_LABELS[6] = {
        "0-1ms:     ", "1-10ms:    ", "10-100ms:  ", "100-1000ms:", "1-10s:     ", "10+s:      "};

    /// Counts `count` messages in the bucket of the given latency. A negative latency counts in the first bucket.
    /// Allocates nothing.
    void increment(const std::chrono::nanoseconds& latency, std::uint64_t count) noexcept;

    class Table;

private:
    std::array<std::uint64_t, 6> mBuckets = {};
};

/// Several histograms side by side, for printing: one column for each.
///
/// Lifetime: borrows the histograms, which must outlive the table.
class QEL_EXPORT QelMessageLatencyBuckets::Table {
public:
    /// Adds a column to the right of those already there.
    /// @param column  its title, copied, and its histogram, borrowed
    void addColumn(const std::pair<std::string, const QelMessageLatencyBuckets&>& column);

    /// Prints a line of titles and one line for each bucket. Titles and counts stand left-aligned in fields of twelve
    /// characters, so that lines end in blanks. The stream's flags are restored; its fill character is left a blank.
    void dump(std::ostream& os, const Indent& indent) const;

private:
    std::vector<std::pair<std::string, const QelMessageLatencyBuckets&>> mColumns;
};

} // namespace qel
