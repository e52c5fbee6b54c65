#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include "Loopback.hpp"
#include "Median.hpp"
#include "TcpSegments.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <exception>
#include <memory>
#include <sched.h>
#include <stdexcept>
#include <sys/resource.h>
#include <thread>
#include <vector>

/// @file
/// What reading ahead alone, gathering alone, and both cost and save where messages of 64 bytes stream from one thread
/// to another: with both on one core, and with a core for each. Nothing here passes or fails: the figures are for
/// people.
///
///   qel_bench_read_ahead [--quick]

namespace qel::bench {

namespace {

constexpr std::size_t kLength = 64; // bytes of a message

/// Counts the reads that reach the socket.
class CountingStream : public Stream {
public:
    explicit CountingStream(Stream& below) : mBelow(below) {}
    void close() override { mBelow.close(); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        ++mReads;
        return mBelow.read(buffer, length);
    }
    void write(const char* buffer, std::size_t length) override { mBelow.write(buffer, length); }
    std::size_t reads() const { return mReads; }

private:
    Stream& mBelow;
    std::size_t mReads = 0;
};

void pinTo(unsigned int core)
{
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(core, &set);
    if (::sched_setaffinity(0, sizeof(set), &set) != 0) throw std::runtime_error("sched_setaffinity");
}

/// What a thread has used of its core, and how often it slept.
struct Usage {
    double nanoseconds;
    double sleeps;

    static Usage ofThisThread()
    {
        timespec time = {};
        rusage usage = {};
        if (::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time) != 0) throw std::runtime_error("clock_gettime");
        if (::getrusage(RUSAGE_THREAD, &usage) != 0) throw std::runtime_error("getrusage");
        return {static_cast<double>(time.tv_sec) * 1e9 + static_cast<double>(time.tv_nsec),
                static_cast<double>(usage.ru_nvcsw)};
    }
    Usage since(const Usage& start) const { return {nanoseconds - start.nanoseconds, sleeps - start.sleeps}; }
};

struct Case {
    bool twoCores;
    bool gathers;
    bool readsAhead;
};

/// Everything of one message.
struct Figures {
    double nanoseconds;
    double sender;   // nanoseconds of its core
    double receiver; // nanoseconds of its core
    double reads;
    double sleeps; // of the receiver
    double segments;
};

Figures measure(const Case& what, std::size_t messages)
{
    TcpPair pair;
    QelMessageRegistry registry;
    Usage sent = {};
    const auto start = std::chrono::steady_clock::now();
    std::thread sender([&] {
        pinTo(0);
        const Usage before = Usage::ofThisThread();
        BufferedStreamOptions options;
        options.gatherBytes = what.gathers ? options.gatherBytes : 0;
        BufferedStream stream(*pair.near, options);
        QelMessageStream out(stream, registry);
        const std::unique_ptr<QelMessage> message = messageOf(kLength);
        for (std::size_t i = 0; i < messages; ++i)
            out.write(*message);
        stream.flush();
        sent = Usage::ofThisThread().since(before);
    });
    pinTo(what.twoCores ? 1 : 0);
    const Usage before = Usage::ofThisThread();
    CountingStream counting(*pair.far);
    BufferedStreamOptions options;
    options.readAheadBytes = what.readsAhead ? options.readAheadBytes : 0;
    BufferedStream stream(counting, options);
    QelMessageStream in(stream, registry);
    for (std::size_t i = 0; i < messages; ++i)
        in.read();
    const Usage received = Usage::ofThisThread().since(before);
    sender.join();
    const std::chrono::duration<double, std::nano> elapsed = std::chrono::steady_clock::now() - start;
    const auto each = static_cast<double>(messages);
    return {elapsed.count() / each,      sent.nanoseconds / each,
            received.nanoseconds / each, static_cast<double>(counting.reads()) / each,
            received.sleeps / each,      static_cast<double>(dataSegmentsSent(pair.nearFd())) / each};
}

double medianOf(const std::vector<Figures>& rounds, double Figures::*member)
{
    std::vector<double> values;
    for (const Figures& round : rounds)
        values.push_back(round.*member);
    return median(values);
}

void measureAll(unsigned int rounds, std::size_t messages)
{
    constexpr std::array<Case, 8> kCases{{{false, false, false},
                                          {false, false, true},
                                          {false, true, false},
                                          {false, true, true},
                                          {true, false, false},
                                          {true, false, true},
                                          {true, true, false},
                                          {true, true, true}}};
    std::array<std::vector<Figures>, kCases.size()> all;
    for (unsigned int round = 0; round < rounds; ++round) {
        for (std::size_t i = 0; i < kCases.size(); ++i)
            all.at(i).push_back(measure(kCases.at(i), messages));
    }
    std::printf(
        "\nmessages of %zu bytes, one thread sends and another receives; medians of %u rounds, for one message\n",
        kLength, rounds);
    std::printf("%-6s %-10s %-10s %10s %12s %12s %9s %8s %8s\n", "cores", "sender", "receiver", "ns", "ns of sender",
                "of receiver", "segments", "reads", "sleeps");
    for (std::size_t i = 0; i < kCases.size(); ++i) {
        const Case& row = kCases.at(i);
        std::printf("%-6d %-10s %-10s %10.0f %12.0f %12.0f %9.3f %8.3f %8.3f\n", row.twoCores ? 2 : 1,
                    row.gathers ? "gathers" : "at once", row.readsAhead ? "reads ahead" : "two reads",
                    medianOf(all.at(i), &Figures::nanoseconds), medianOf(all.at(i), &Figures::sender),
                    medianOf(all.at(i), &Figures::receiver), medianOf(all.at(i), &Figures::segments),
                    medianOf(all.at(i), &Figures::reads), medianOf(all.at(i), &Figures::sleeps));
    }
}

} // namespace

} // namespace qel::bench

int main(int argc, char** argv)
{
    try {
        const bool quick = argc > 1 && std::strcmp(argv[1], "--quick") == 0;
        if (std::thread::hardware_concurrency() < 2) {
            std::printf("\nreading ahead: this machine has one core, so there is nothing to compare\n");
            return EXIT_SUCCESS;
        }
        qel::bench::measureAll(quick ? 1 : 11, quick ? 1000 : 100000);
        return EXIT_SUCCESS;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_read_ahead: %s\n", error.what());
        return EXIT_FAILURE;
    }
}
