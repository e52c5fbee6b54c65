#include "Contest.hpp"
#include "Median.hpp"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <map>
#include <string>
#include <unistd.h>
#include <vector>

/// @file
/// Runs all contests and prints one table of ratios. Every flag of Google Benchmark is understood, for example
/// --benchmark_filter='^log'; --figures=FILE writes the medians as a table with tabs, too. Nothing here passes or
/// fails: the figures are for people.

namespace {

using qel::bench::Contest;

constexpr char kMemoryFolder[] = "/dev/shm";

/// Collects the time of each round and says nothing while they run but which one it is.
class RoundCollector : public benchmark::BenchmarkReporter {
public:
    bool ReportContext(const Context& context) override
    {
        PrintBasicContext(&std::cerr, context);
        return true;
    }

    void ReportRuns(const std::vector<Run>& runs) override
    {
        for (const Run& run : runs) {
            if (run.run_type != Run::RT_Iteration) continue;
            if (run.error_occurred) {
                std::fprintf(stderr, "%s: %s\n", run.run_name.function_name.c_str(), run.error_message.c_str());
                continue;
            }
            mRounds[run.run_name.function_name].push_back(run.real_accumulated_time /
                                                          static_cast<double>(run.iterations) * 1e9);
        }
    }

    /// Nanoseconds of the middle round; negative when there was none.
    double median(const std::string& name) const
    {
        const auto found = mRounds.find(name);
        if (found == mRounds.end() || found->second.empty()) return -1;
        return qel::bench::median(found->second);
    }

private:
    std::map<std::string, std::vector<double>> mRounds;
};

void printRow(const std::string& work, const std::string& rival, double ours, double theirs, double atMost)
{
    char limit[32] = "-";
    if (atMost > 0) std::snprintf(limit, sizeof(limit), "%.2f", atMost);
    const char* verdict = "";
    if (atMost > 0) verdict = ours / theirs <= atMost ? "reached" : "MISSED";
    std::printf("%-52s %-34s %10.1f %10.1f %7.2f %7s  %s\n", work.c_str(), rival.c_str(), ours, theirs, ours / theirs,
                limit, verdict);
}

void printTable(const RoundCollector& rounds)
{
    std::printf("\n%-52s %-34s %10s %10s %7s %7s\n", "work", "held against", "ours ns", "theirs ns", "ratio",
                "at most");
    for (const Contest* contest : qel::bench::contests()) {
        const auto median = [&](const std::string& contestant) {
            return rounds.median(Contest::benchmarkName(contest->work(), contestant));
        };
        const double ours = median(Contest::kOurs);
        for (const Contest::Rival& rival : contest->rivals()) {
            const double theirs = median(rival.name);
            if (ours > 0 && theirs > 0) printRow(contest->work(), rival.name, ours, theirs, rival.atMost);
        }
        const double floor = median(contest->floorName());
        const double again = median(contest->floorName() + Contest::kAgain);
        if (floor > 0 && again > 0) printRow(contest->work(), "(the floor against itself)", again, floor, 0);
    }
}

/// All figures, for gnuplot: work, contestant, nanoseconds of ours, of theirs, and the most that the ratio may be.
/// @return false: the file could not be written
bool writeFigures(const RoundCollector& rounds, const std::string& path)
{
    std::ofstream file(path);
    for (const Contest* contest : qel::bench::contests()) {
        const double ours = rounds.median(Contest::benchmarkName(contest->work(), Contest::kOurs));
        for (const Contest::Rival& rival : contest->rivals()) {
            const double theirs = rounds.median(Contest::benchmarkName(contest->work(), rival.name));
            if (ours <= 0 || theirs <= 0) continue;
            file << contest->work() << '\t' << rival.name << '\t' << ours << '\t' << theirs << '\t' << rival.atMost
                 << '\n';
        }
    }
    return file.flush().good();
}

/// Takes the flag with the path of the figures out of the arguments.
/// @return the path; empty if there is no such flag
std::string takeFiguresFlag(std::vector<std::string>& arguments)
{
    const std::string flag = "--figures=";
    const auto found = std::find_if(arguments.begin(), arguments.end(), [&flag](const std::string& argument) {
        return argument.compare(0, flag.size(), flag) == 0;
    });
    if (found == arguments.end()) return {};
    const std::string path = found->substr(flag.size());
    arguments.erase(found);
    return path;
}

/// Our defaults come first, so that what the user gives overrides them.
std::vector<std::string> withDefaults(int argc, char** argv)
{
    std::vector<std::string> arguments = {argv[0], "--benchmark_repetitions=11",
                                          "--benchmark_enable_random_interleaving=true", "--benchmark_min_time=0.05"};
    arguments.insert(arguments.end(), argv + 1, argv + argc);
    return arguments;
}

} // namespace

int main(int argc, char** argv)
{
    std::vector<std::string> arguments = withDefaults(argc, argv);
    const std::string figures = takeFiguresFlag(arguments);
    std::vector<char*> pointers;
    for (std::string& argument : arguments)
        pointers.push_back(argument.data());
    int count = static_cast<int>(pointers.size());
    benchmark::Initialize(&count, pointers.data());
    if (benchmark::ReportUnrecognizedArguments(count, pointers.data())) return EXIT_FAILURE;

    qel::bench::pinToOneCore();
    std::string disk = "qel-bench.XXXXXX";
    std::string memory = std::string(kMemoryFolder) + "/qel-bench.XXXXXX";
    if (::mkdtemp(disk.data()) == nullptr || ::mkdtemp(memory.data()) == nullptr) {
        std::perror("bench: no folder for log files");
        return EXIT_FAILURE;
    }

    qel::bench::addFrameContests();
    qel::bench::addLoggingContests(memory, disk);
    qel::bench::addTransportContests();
    qel::bench::addTlsContests();
    qel::bench::addBufferedContests();
    qel::bench::addConsoleContests();
    qel::bench::addQueueContests();

    RoundCollector rounds;
    benchmark::RunSpecifiedBenchmarks(&rounds);
    printTable(rounds);
    if (!figures.empty() && !writeFigures(rounds, figures)) {
        std::fprintf(stderr, "bench: cannot write %s\n", figures.c_str());
        return EXIT_FAILURE;
    }

    for (const std::string& folder : {disk, memory}) {
        const std::string command = "rm -rf '" + folder + "'";
        if (std::system(command.c_str()) != 0) return EXIT_FAILURE;
    }
    return EXIT_SUCCESS;
}
