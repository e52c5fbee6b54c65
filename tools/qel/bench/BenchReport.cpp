#include "bench/BenchReport.hpp"

#include <qel/common/stats/QelMessageStatisticsTypes.hpp>

#include <algorithm>
#include <array>
#include <cmath>
#include <iomanip>
#include <sstream>

namespace qel::tool {

namespace {

using nlohmann::ordered_json;
using std::chrono::nanoseconds;

struct Percentile {
    const char* name;
    unsigned int perMille;
};
constexpr std::array<Percentile, 4> kPercentiles{{{"p50", 500}, {"p90", 900}, {"p99", 990}, {"p99.9", 999}}};

constexpr int kLabelWidth = 13;
constexpr int kNumberWidth = 12;
constexpr std::uint64_t kBarWidth = 50;

double seconds(nanoseconds time) { return std::chrono::duration<double>(time).count(); }

/// A number with `digits` decimals.
std::string fixed(double value, int digits)
{
    std::ostringstream text;
    text << std::fixed << std::setprecision(digits) << value;
    return text.str();
}

std::string microseconds(nanoseconds time) { return fixed(std::chrono::duration<double, std::micro>(time).count(), 1); }

/// Messages and payload bytes per second of elapsed time.
QelMessageThroughput throughputOf(const BenchLoad& load, const BenchFigures& figures)
{
    QelMessageThroughput throughput;
    if (figures.elapsed <= nanoseconds::zero()) return throughput;
    const double perSecond = static_cast<double>(figures.latency.count()) / seconds(figures.elapsed);
    throughput.mPerSecond.mCount = static_cast<std::uint64_t>(std::llround(perSecond));
    throughput.mPerSecond.mBytes =
        static_cast<std::uint64_t>(std::llround(perSecond * static_cast<double>(load.bytes)));
    return throughput;
}

std::string pace(const BenchLoad& load)
{
    return load.rate > 0 ? fixed(load.rate, 1) + " messages a second" : std::string("flat out");
}

template <typename T>
void line(std::ostream& os, const std::string& label, const T& value)
{
    os << std::left << std::setw(kLabelWidth) << label + ":" << std::right << value << "\n";
}

void latencyLine(std::ostream& os, const std::string& label, nanoseconds latency)
{
    os << "  " << std::left << std::setw(kLabelWidth - 2) << label + ":" << std::right << std::setw(kNumberWidth)
       << microseconds(latency) << " us\n";
}

std::string rowLabel(nanoseconds upTo)
{
    if (upTo == nanoseconds::max()) return "more";
    constexpr nanoseconds kMillisecond = std::chrono::milliseconds(1);
    constexpr nanoseconds kSecond = std::chrono::seconds(1);
    if (upTo >= kSecond) return "to " + std::to_string(upTo / kSecond) + " s";
    if (upTo >= kMillisecond) return "to " + std::to_string(upTo / kMillisecond) + " ms";
    return "to " + std::to_string(upTo / std::chrono::microseconds(1)) + " us";
}

void printHistogram(std::ostream& os, const LatencyHistogram& latency)
{
    const auto rows = latency.rows();
    if (rows.empty()) return;
    const auto largest = std::max_element(rows.begin(), rows.end(),
                                          [](const auto& left, const auto& right) { return left.count < right.count; });
    os << "Histogram:\n";
    for (const LatencyHistogram::Row& row : rows) {
        const std::string bar(row.count * kBarWidth / largest->count, '#');
        os << "  " << std::left << std::setw(kLabelWidth - 2) << rowLabel(row.upTo) << std::right
           << std::setw(kNumberWidth) << row.count << (bar.empty() ? "" : "  ") << bar << "\n";
    }
}

} // namespace

void printReport(std::ostream& os, const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures)
{
    os << "Broadcasts of " << load.bytes << " bytes between " << load.pairs << (load.pairs == 1 ? " pair" : " pairs")
       << " of consoles of " << endpoint << ", " << pace(load) << (figures.interrupted ? "; interrupted" : "") << "\n";
    line(os, "Messages", figures.latency.count());
    if (load.rate > 0) line(os, "Unsent", figures.unsent);
    line(os, "Elapsed", fixed(seconds(figures.elapsed), 3) + " s");
    line(os, "Throughput", throughputOf(load, figures));
    os << "Latency:\n";
    for (const Percentile& percentile : kPercentiles)
        latencyLine(os, percentile.name, figures.latency.percentile(percentile.perMille));
    latencyLine(os, "max", figures.latency.longest());
    printHistogram(os, figures.latency);
}

ordered_json reportJson(const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures)
{
    const QelMessageThroughput throughput = throughputOf(load, figures);
    ordered_json latency;
    for (const Percentile& percentile : kPercentiles)
        latency[percentile.name] = figures.latency.percentile(percentile.perMille).count();
    latency["max"] = figures.latency.longest().count();
    ordered_json rows = ordered_json::array();
    for (const LatencyHistogram::Row& row : figures.latency.rows()) {
        ordered_json upTo;
        if (row.upTo != nanoseconds::max()) upTo = row.upTo.count();
        rows.push_back({{"upToNanoseconds", upTo}, {"messages", row.count}});
    }
    return {{"endpoint", endpoint},
            {"connections", 2 * load.pairs},
            {"messageBytes", load.bytes},
            {"rate", load.rate > 0 ? ordered_json(load.rate) : ordered_json()},
            {"interrupted", figures.interrupted},
            {"messages", figures.latency.count()},
            {"unsent", figures.unsent},
            {"seconds", seconds(figures.elapsed)},
            {"messagesPerSecond", throughput.mPerSecond.mCount},
            {"bytesPerSecond", throughput.mPerSecond.mBytes},
            {"latencyNanoseconds", latency},
            {"histogram", rows}};
}

} // namespace qel::tool
