#include "Contest.hpp"
#include "Median.hpp"
#include "QelServer.hpp"
#include "Terminal.hpp"
#include "TerminalPeers.hpp"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <fstream>
#include <functional>
#include <map>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

/// @file
/// What `qel serve` and `qel console` make of a terminal, beside socat and ssh: all on one core, the others kept busy
/// (BusyCores); output also on all cores. And what consoles and partitions that do nothing cost in memory. Nothing here
/// passes or fails: the figures are for people.
///
///   qel_bench_terminal [--quick]

namespace qel::bench {

namespace {

using std::chrono::milliseconds;

struct Plan {
    unsigned int rounds = 5;
    std::size_t bytes = 100 * 1000 * 1000;
    std::size_t keys = 2000; // in a round; as many as these and a tenth more are typed
    milliseconds settle{2500};
    unsigned int fewConsoles = 20;
    unsigned int manyConsoles = 120;
};

struct Times {
    std::vector<double> seconds;        // of the output, on one core
    std::vector<double> secondsOnCores; // on all
    std::vector<double> keys;           // microseconds
    double p50() const { return part(0.50); }
    double p99() const { return part(0.99); }

private:
    double part(double share) const
    {
        std::vector<double> sorted = keys;
        std::sort(sorted.begin(), sorted.end());
        return sorted.at(static_cast<std::size_t>(static_cast<double>(sorted.size() - 1) * share));
    }
};

using Results = std::map<std::string, Times>;

void verdict(const std::string& what, double ratio, double atMost)
{
    std::printf("%-62s %5.2f, at most %4.2f: %s\n", what.c_str(), ratio, atMost,
                ratio <= atMost ? "reached" : "MISSED");
}

void printResults(const TerminalPeers& peers, const Results& results, const Plan& plan)
{
    std::printf("\n%.0f MB of a terminal's output, in seconds, and the echo of a key on one core; %u rounds\n",
                static_cast<double>(plan.bytes) / 1e6, plan.rounds);
    std::printf("%-12s %12s %12s %12s %12s\n", "", "on all cores", "on one core", "key p50 us", "key p99 us");
    for (const TerminalPeer& peer : peers.all()) {
        const Times& times = results.at(peer.name);
        std::printf("%-12s %12.3f %12.3f %12.1f %12.1f\n", peer.name.c_str(), median(times.secondsOnCores),
                    median(times.seconds), times.p50(), times.p99());
    }
    const auto compare = [&](const char* ours, const char* theirs, double output, double key) {
        const auto other = results.find(theirs);
        if (other == results.end()) return static_cast<void>(std::printf("%s: not installed\n", theirs));
        const Times& own = results.at(ours);
        const std::string what = std::string(ours) + " against " + theirs;
        verdict(what + ": output, all cores", median(own.secondsOnCores) / median(other->second.secondsOnCores),
                output);
        verdict(what + ": output, one core", median(own.seconds) / median(other->second.seconds), output);
        verdict(what + ": echo of a key, p50", own.p50() / other->second.p50(), key);
        verdict(what + ": echo of a key, p99", own.p99() / other->second.p99(), key);
    };
    compare("qel, plain", "socat, TCP", 1.05, 1.2);
    compare("qel, TLS", "socat, TLS", 1.0, 1.2);
    compare("qel, TLS", "ssh", 1.0, 1.2);
}

/// @param take  measures one program
void takeTurns(const Plan& plan, const TerminalPeers& peers, const std::function<void(const TerminalPeer&)>& take)
{
    for (unsigned int round = 0; round < plan.rounds; ++round) {
        for (const TerminalPeer& peer : peers.all()) {
            checkNotStopped();
            take(peer);
        }
    }
}

/// On the cores that the caller may use.
Results besideOthers(const Plan& plan, bool isOneCore, Results results)
{
    const test::TemporaryDirectory directory;
    const std::string file = directory.file("output");
    std::ofstream(file) << std::string(plan.bytes, 'q');
    const TerminalPeers peers("stty raw -echo; exec cat " + file, EchoedKeys::kCommand);
    takeTurns(plan, peers, [&](const TerminalPeer& peer) {
        Times& times = results[peer.name];
        const double seconds = secondsToReceive(peer.toReceive, plan.bytes);
        (isOneCore ? times.seconds : times.secondsOnCores).push_back(seconds);
        if (!isOneCore) return;
        const EchoedKeys keys(peer.toType);
        for (std::size_t i = 0; i < plan.keys / 10; ++i)
            keys.type();
        for (std::size_t i = 0; i < plan.keys; ++i)
            times.keys.push_back(keys.type());
    });
    if (isOneCore) printResults(peers, results, plan);
    return results;
}

struct Use {
    double bytes;
    double threads;
};

Use useOf(const test::Process& server)
{
    std::ifstream status("/proc/" + std::to_string(server.pid()) + "/status");
    std::string word;
    double threads = 0;
    while (status >> word) {
        if (word == "Threads:") status >> threads;
    }
    return {static_cast<double>(server.residentBytes()), threads};
}

/// Of a server whose consoles send each other 20 messages a second in all.
Use useWith(QelServer& server, unsigned int consoles, const Plan& plan)
{
    test::Process bench(server.client("bench", {"--json", "--connections", std::to_string(consoles), "--size", "64",
                                                "--rate", "20", "--seconds", "60"}));
    const auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (useOf(server.process()).threads < 2 * consoles) { // two for each console
        if (std::chrono::steady_clock::now() > giveUp) throw std::runtime_error("the consoles do not connect");
        std::this_thread::sleep_for(milliseconds(20));
    }
    std::this_thread::sleep_for(plan.settle);
    const Use use = useOf(server.process());
    bench.signal(SIGINT);
    bench.wait();
    checkNotStopped();
    return use;
}

void memoryOfConsoles(const char* kind, QelServer::Protection protection, double atMost, const Plan& plan)
{
    QelServer server(protection);
    const Use few = useWith(server, plan.fewConsoles, plan);
    const Use many = useWith(server, plan.manyConsoles, plan);
    const double consoles = plan.manyConsoles - plan.fewConsoles;
    const double kibibytes = (many.bytes - few.bytes) / consoles / 1024;
    const double threads = (many.threads - few.threads) / consoles;
    std::printf("%-6s %7.1f KiB, at most %3.0f: %s; %.2f threads, at most 2: %s\n", kind, kibibytes, atMost,
                kibibytes <= atMost ? "reached" : "MISSED", threads, threads <= 2 ? "reached" : "MISSED");
}

void memoryOfPartitions(const Plan& plan)
{
    constexpr int kFew = 4;
    constexpr int kMany = 64;
    constexpr double kAtMost = 80;
    const auto bytesWith = [&](int partitions) {
        std::vector<std::string> options{"--start", "boot"};
        for (int i = 1; i <= partitions; ++i)
            options.insert(options.end(), {"--partition", std::to_string(i) + "=exec sleep 1000"});
        const QelServer server(QelServer::Protection::Plain, options);
        std::this_thread::sleep_for(plan.settle / 2);
        return useOf(server.process()).bytes;
    };
    const double kibibytes = (bytesWith(kMany) - bytesWith(kFew)) / (kMany - kFew) / 1024;
    std::printf("an idle partition, with nothing to replay: %.1f KiB, at most %.0f: %s\n", kibibytes, kAtMost,
                kibibytes <= kAtMost ? "reached" : "MISSED");
}

/// 16 consoles over TLS at once, each on a partition of its own, of 64.
void manyAtOnce(const Plan& plan)
{
    constexpr unsigned int kPartitions = 64;
    constexpr unsigned int kConsoles = 16;
    const std::size_t bytes = plan.bytes / kConsoles;
    std::vector<std::string> options{"--log-level", "error"};
    for (unsigned int i = 1; i <= kPartitions; ++i) {
        options.insert(options.end(), {"--partition", std::to_string(i) + "=stty raw -echo; exec head -c " +
                                                          std::to_string(bytes) + " /dev/zero"});
    }
    const QelServer server(QelServer::Protection::Tls, options);
    std::vector<double> seconds(kConsoles);
    std::vector<std::exception_ptr> failures(kConsoles);
    std::vector<std::thread> threads;
    for (unsigned int i = 0; i < kConsoles; ++i) {
        threads.emplace_back([&, i] {
            try {
                const std::string partition = std::to_string(4 * i + 1);
                seconds[i] = secondsToReceive(server.client("console", {"--no-eof", partition}), bytes);
            } catch (...) {
                failures[i] = std::current_exception();
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    for (const std::exception_ptr& failure : failures) {
        if (failure) std::rethrow_exception(failure);
    }
    const auto ends = std::minmax_element(seconds.begin(), seconds.end());
    std::printf("%u partitions, %u consoles over TLS at once: %.1f MB/s in all, the first done after %.2f s, the last "
                "after %.2f s\n",
                kPartitions, kConsoles, static_cast<double>(bytes) * kConsoles / 1e6 / *ends.second, *ends.first,
                *ends.second);
}

void measureAll(const Plan& plan)
{
    const Results onAllCores = besideOthers(plan, false, {});
    {
        const BusyCores others;
        pinToOneCore();
        besideOthers(plan, true, onAllCores);
        manyAtOnce(plan);
    }
    std::printf("memory of the server for a console, of %u that send 20 messages a second in all\n", plan.manyConsoles);
    memoryOfConsoles("plain", QelServer::Protection::Plain, 48, plan);
    memoryOfConsoles("TLS", QelServer::Protection::Tls, 124, plan);
    memoryOfPartitions(plan);
}

Plan planOf(int argc, char** argv)
{
    Plan plan;
    for (int i = 1; i < argc; ++i) {
        if (argv[i] != std::string("--quick")) throw std::runtime_error(std::string("unknown argument ") + argv[i]);
        plan = {1, 1000 * 1000, 20, milliseconds(500), 4, 8};
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
        qel::bench::measureAll(plan);
        return EXIT_SUCCESS;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_terminal: %s\n", error.what());
        return EXIT_FAILURE;
    }
}
