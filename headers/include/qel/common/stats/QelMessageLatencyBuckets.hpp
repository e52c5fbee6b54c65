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

/// A histogram of latencies in six buckets.
///
/// Thread safety: one thread at a time; a queue calls it with its lock held.
class QEL_EXPORT QelMessageLatencyBuckets {
public:
    /// The upper bounds of the first five buckets, inclusive: exactly 1 ms counts in the first one. The sixth bucket
    /// has no upper bound.
    static constexpr std::chrono::nanoseconds LIMITS[5] = {std::chrono::milliseconds(1), std::chrono::milliseconds(10),
                                                           std::chrono::milliseconds(100), std::chrono::seconds(1),
                                                           std::chrono::seconds(10)};

    /// The length of each label in characters.
    static constexpr std::size_t LABEL_WIDTH = 11;

    /// The labels of the buckets, padded with blanks to LABEL_WIDTH.
    static constexpr const char* BUCKET_LABELS[6] = {
        "0-1ms:     ", "1-10ms:    ", "10-100ms:  ", "100-1000ms:", "1-10s:     ", "10+s:      "};

    /// Adds `count` to the bucket of the latency. A negative latency belongs to the first bucket. Does not allocate.
    void increment(const std::chrono::nanoseconds& latency, std::uint64_t count) noexcept;

    /// @return the counts of the buckets, from the fastest to the slowest; owned by this object
    const std::array<std::uint64_t, 6>& getCounts() const noexcept { return mBuckets; }

    class Table;

private:
    std::array<std::uint64_t, 6> mBuckets = {};
};

/// Prints several histograms side by side, one column for each.
///
/// Lifetime: borrows the histograms, which must outlive the table.
/// Thread safety: one thread at a time; no other thread may change the histograms meanwhile.
class QEL_EXPORT QelMessageLatencyBuckets::Table {
public:
    /// Adds a column on the right.
    /// @param column  its title, copied, and its histogram, borrowed
    void addColumn(const std::pair<std::string, const QelMessageLatencyBuckets&>& column);

    /// Prints a line of titles and a line for each bucket. Titles and counts are left-aligned in fields of twelve
    /// characters, so lines end in blanks. Restores the flags of the stream, and leaves its fill character a blank.
    /// @param os  borrowed for the call
    /// @throws what the stream throws if its exceptions() are set
    void dump(std::ostream& os, const Indent& indent) const;

private:
    std::vector<std::pair<std::string, const QelMessageLatencyBuckets&>> mColumns;
};

} // namespace qel
