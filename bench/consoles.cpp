#include "Contest.hpp"
#include "Median.hpp"
#include "QelServer.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <stdexcept>
#include <string>
#include <vector>

/// @file
/// How the cost of a message through `qel serve` grows with the number of consoles, as `qel bench` measures it: all on
/// one core, each pair with one message of 64 bytes at a time. What a message costs is the time between two of them;
/// how long it takes also counts the messages of the other pairs, which wait for the same core. Nothing here passes or
/// fails: the figures are for people.
///
///   qel_bench_consoles [--quick] [--figures=FILE]

namespace qel::bench {

namespace {

constexpr std::array<unsigned int, 5> kConsoles{2, 8, 32, 128, 254};
constexpr std::size_t kFewer = 1; // the places in kConsoles of the numbers that are compared
constexpr std::size_t kMore = 4;
constexpr double kAtMost = 1.6; // what a message may cost with more consoles, as a multiple of its cost with fewer
constexpr std::size_t kPayload = 64;

struct Plan {
    unsigned int rounds = 11;
    std::chrono::milliseconds time{300};
    std::string figures;
};

struct Series {
    std::vector<double> cost; // microseconds
    std::vector<double> p50;
    std::vector<double> p99;
};

using Rows = std::array<Series, kConsoles.size()>;

void measure(QelServer& server, const Plan& plan, std::size_t place, Rows& rows)
{
    constexpr double kMicroseconds = 1e6;
    const QelServer::Figures figures = server.measure(kConsoles.at(place), kPayload, plan.time);
    Series& series = rows.at(place);
    series.cost.push_back(kMicroseconds / figures.perSecond);
    series.p50.push_back(figures.p50);
    series.p99.push_back(figures.p99);
}

void printTable(const char* kind, const Rows& rows, std::ostream& figures)
{
    for (std::size_t i = 0; i < rows.size(); ++i) {
        const Series& row = rows.at(i);
        const double cost = median(row.cost);
        const double p50 = median(row.p50);
        const double p99 = median(row.p99);
        std::printf("%-6s %9u %10.1f %10.1f %10.1f\n", kind, kConsoles.at(i), cost, p50, p99);
        figures << kind << '\t' << kConsoles.at(i) << '\t' << cost << '\t' << p50 << '\t' << p99 << '\n';
    }
    const double ratio = median(rows.at(kMore).cost) / median(rows.at(kFewer).cost);
    std::printf("%-6s %u against %u consoles: %.2f, at most %.2f: %s\n", kind, kConsoles.at(kMore),
                kConsoles.at(kFewer), ratio, kAtMost, ratio <= kAtMost ? "reached" : "MISSED");
}

void measureAll(const Plan& plan)
{
    QelServer plain(QelServer::Protection::Plain);
    QelServer tls(QelServer::Protection::Tls);
    Rows plainRows;
    Rows tlsRows;
    for (unsigned int round = 0; round < plan.rounds; ++round) {
        for (std::size_t place = 0; place < kConsoles.size(); ++place) {
            measure(plain, plan, place, plainRows);
            measure(tls, plan, place, tlsRows);
        }
    }
    std::ofstream figures(plan.figures.empty() ? "/dev/null" : plan.figures);
    std::printf("\nqel bench and qel serve on one core, messages of %zu bytes, microseconds; medians of %u rounds\n",
                kPayload, plan.rounds);
    std::printf("%-6s %9s %10s %10s %10s\n", "", "consoles", "a message", "p50", "p99");
    printTable("plain", plainRows, figures);
    printTable("TLS", tlsRows, figures);
    if (!figures.flush().good()) throw std::runtime_error("cannot write " + plan.figures);
}

Plan planOf(int argc, char** argv)
{
    Plan plan;
    const std::string flag = "--figures=";
    for (int i = 1; i < argc; ++i) {
        const std::string argument = argv[i];
        if (argument == "--quick") {
            plan.rounds = 1;
            plan.time = std::chrono::milliseconds(20);
        } else if (argument.compare(0, flag.size(), flag) == 0) {
            plan.figures = argument.substr(flag.size());
        } else {
            throw std::runtime_error("unknown argument " + argument);
        }
    }
    return plan;
}

} // namespace

} // namespace qel::bench

int main(int argc, char** argv)
{
    try {
        const qel::bench::Plan plan = qel::bench::planOf(argc, argv);
        qel::bench::stopOnSignals();
        qel::bench::pinToOneCore();
        qel::bench::measureAll(plan);
        return EXIT_SUCCESS;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_consoles: %s\n", error.what());
        return EXIT_FAILURE;
    }
}
