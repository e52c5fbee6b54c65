#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace qel::tool {

/// Counts latencies in a fixed amount of memory and computes percentiles.
///
/// The library's QelMessageLatencyBuckets have six classes, the first of which ends at a millisecond; a server on the
/// same machine answers in a tenth of that. Here each power of two has 64 classes, so a percentile is at most 1/64 too
/// long and never too short.
/// Thread safety: one thread at a time.
class LatencyHistogram {
public:
    /// A row for people: the number of latencies above the limit of the row before and up to this limit.
    struct Row {
        std::chrono::nanoseconds upTo; ///< nanoseconds::max() in the last row
        std::uint64_t count;
    };

    LatencyHistogram();

    /// Counts one latency; a negative one counts as zero.
    void record(std::chrono::nanoseconds latency) noexcept;

    /// Adds the counts of another histogram.
    void add(const LatencyHistogram& other) noexcept;

    std::uint64_t count() const noexcept { return mCount; }

    /// The longest latency, exact; zero when there is none.
    std::chrono::nanoseconds longest() const noexcept { return mLongest; }

    /// The latency that `perMille` of 1000 latencies do not exceed; zero when there is none.
    /// @param perMille  1 to 1000
    std::chrono::nanoseconds percentile(unsigned int perMille) const noexcept;

    /// Exact counts in steps of 1, 2, 5, 10, ... from one microsecond to ten seconds, from the first non-empty row to
    /// the last.
    std::vector<Row> rows() const;

private:
    static constexpr std::size_t kRows = 23;

    std::vector<std::uint64_t> mClasses;
    std::array<std::uint64_t, kRows> mRows{};
    std::uint64_t mCount = 0;
    std::chrono::nanoseconds mLongest{0};
};

} // namespace qel::tool
