#include <qel/common/stats/QelMessageLatencyBuckets.hpp>

#include <iomanip>
#include <iterator>

namespace qel {

namespace {

constexpr int kColumnWidth = 12; // characters of a title or a count

} // namespace

void QelMessageLatencyBuckets::increment(const std::chrono::nanoseconds& latency, std::uint64_t count) noexcept
{
    std::size_t bucket = 0;
    while (bucket < std::size(LIMITS) && latency > LIMITS[bucket])
        ++bucket;
    mBuckets[bucket] += count;
}

void QelMessageLatencyBuckets::Table::addColumn(const std::pair<std::string, const QelMessageLatencyBuckets&>& column)
{
    mColumns.push_back(column);
}

void QelMessageLatencyBuckets::Table::dump(std::ostream& os, const Indent& indent) const
{
    // Restored at the end: left alignment would turn the 0x0000002A of a later line into 0x2A000000.
    const std::ios_base::fmtflags flags = os.flags();
    os << std::left << std::setfill(' ');

    os << indent << std::string(LABEL_WIDTH, ' ');
    for (const auto& [title, buckets] : mColumns)
        os << ' ' << std::setw(kColumnWidth) << title;
    os << '\n';

    for (std::size_t i = 0; i < std::size(BUCKET_LABELS); ++i) {
        os << indent << BUCKET_LABELS[i];
        for (const auto& [title, buckets] : mColumns) {
            os << ' ' << std::setw(kColumnWidth) << decFormat(buckets.mBuckets[i]);
        }
        os << '\n';
    }
    os.flags(flags);
}

} // namespace qel
