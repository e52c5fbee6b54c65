#include "bench/LatencyHistogram.hpp"

#include <algorithm>

namespace qel::tool {

namespace {

using std::chrono::nanoseconds;

// Each value below 64 is a class. Above, the seven leading bits of a value select its class: the power of two, and one
// of 64 parts of it.
constexpr unsigned int kLeadingBits = 6;
constexpr std::uint64_t kPerDoubling = std::uint64_t{1} << kLeadingBits;
constexpr std::size_t kClasses = kPerDoubling * (63 - kLeadingBits + 1);

unsigned int doublingOf(std::uint64_t value)
{
    unsigned int doubling = 0;
    while ((value >> doubling) >= 2 * kPerDoubling)
        ++doubling;
    return doubling;
}

std::size_t classOf(std::uint64_t value)
{
    if (value < kPerDoubling) return value;
    const unsigned int doubling = doublingOf(value);
    return kPerDoubling * doubling + (value >> doubling);
}

/// The longest latency of a class.
std::uint64_t endOf(std::size_t index)
{
    if (index < 2 * kPerDoubling) return index;
    const std::size_t doubling = index / kPerDoubling - 1;
    return ((index - kPerDoubling * doubling + 1) << doubling) - 1;
}

/// 1, 2, 5, 10, ... microseconds up to ten seconds; the last row has no limit.
nanoseconds endOfRow(std::size_t row, std::size_t rows)
{
    if (row + 1 == rows) return nanoseconds::max();
    constexpr std::array<int, 3> kSteps{1, 2, 5};
    nanoseconds end = std::chrono::microseconds(kSteps[row % kSteps.size()]);
    for (std::size_t i = 0; i < row / kSteps.size(); ++i)
        end *= 10;
    return end;
}

} // namespace

LatencyHistogram::LatencyHistogram() : mClasses(kClasses) {}

void LatencyHistogram::record(nanoseconds latency) noexcept
{
    const nanoseconds counted = std::max(latency, nanoseconds::zero());
    ++mClasses[classOf(static_cast<std::uint64_t>(counted.count()))];
    std::size_t row = 0;
    while (counted > endOfRow(row, kRows))
        ++row;
    ++mRows[row];
    ++mCount;
    mLongest = std::max(mLongest, counted);
}

void LatencyHistogram::add(const LatencyHistogram& other) noexcept
{
    for (std::size_t i = 0; i < kClasses; ++i)
        mClasses[i] += other.mClasses[i];
    for (std::size_t i = 0; i < kRows; ++i)
        mRows[i] += other.mRows[i];
    mCount += other.mCount;
    mLongest = std::max(mLongest, other.mLongest);
}

nanoseconds LatencyHistogram::percentile(unsigned int perMille) const noexcept
{
    constexpr std::uint64_t kWhole = 1000;
    const std::uint64_t rank = (mCount * perMille + kWhole - 1) / kWhole;
    std::uint64_t passed = 0;
    for (std::size_t i = 0; i < kClasses; ++i) {
        passed += mClasses[i];
        if (passed >= rank) return std::min(nanoseconds(endOf(i)), mLongest);
    }
    return mLongest;
}

std::vector<LatencyHistogram::Row> LatencyHistogram::rows() const
{
    std::vector<Row> rows;
    std::uint64_t passed = 0;
    for (std::size_t i = 0; i < kRows && passed < mCount; ++i) {
        passed += mRows[i];
        if (passed > 0) rows.push_back({endOfRow(i, kRows), mRows[i]});
    }
    return rows;
}

} // namespace qel::tool
