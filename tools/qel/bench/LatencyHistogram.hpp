#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace qel::tool {

/// Counts latencies, any number of them in a fixed amount of memory, and tells their percentiles.
///
/// The library's QelMessageLatencyBuckets have six classes, the first of which is a millisecond; a server on this
/// machine answers in a tenth of one. Here each doubling has 64 classes, so that a percentile is at most 1/64 too long,
/// and never too short.
/// Thread safety: one thread at a time.
class LatencyHistogram {
public:
    /// What people are shown: how many latencies are longer than the row before allows and no longer than this one
    /// does.
    struct Row {
        std::chrono::nanoseconds upTo; ///< nanoseconds::max() in the last row of all
        std::uint64_t count;
    };

    LatencyHistogram();

    /// Counts one latency; a negative one as zero.
    void record(std::chrono::nanoseconds latency) noexcept;

    /// Counts all that another one has counted.
    void add(const LatencyHistogram& other) noexcept;

    std::uint64_t count() const noexcept { return mCount; }

    /// The longest latency, exactly; zero when there is none.
    std::chrono::nanoseconds longest() const noexcept { return mLongest; }

    /// The latency that so many of a thousand latencies do not exceed; zero when there is none.
    /// @param perMille  1 to 1000
    std::chrono::nanoseconds percentile(unsigned int perMille) const noexcept;

    /// The counts in steps of 1, 2, 5, 10 and so on from one microsecond to ten seconds, exactly, from the first row
    /// that has any to the last one.
    std::vector<Row> rows() const;

private:
    static constexpr std::size_t kRows = 23;

    std::vector<std::uint64_t> mClasses;
    std::array<std::uint64_t, kRows> mRows{};
    std::uint64_t mCount = 0;
    std::chrono::nanoseconds mLongest{0};
};

} // namespace qel::tool
