#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "Contest.hpp"
#include "Loopback.hpp"
#include "Median.hpp"
#include "QelServer.hpp"
#include "TlsEnds.hpp"
#include "bench/BenchLoad.hpp"

#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <memory>
#include <stdexcept>
#include <string>
#include <sys/wait.h>
#include <system_error>
#include <unistd.h>
#include <vector>

/// @file
/// What `qel bench` measures of `qel serve` over mutual TLS 1.3 on loopback, beside an echo of two processes that use
/// OpenSSL directly. A program of its own, because it starts others. Nothing here passes or fails: the figures are for
/// people.
///
/// The two do not do the same work. A message of ours takes three frames: the sender's request, and the server's notice
/// and response, which pass the queues of two connections. One of the echo takes two records, to a thread that sends
/// back what it gets. So three are held against two, and there is nothing that ours could be equal to; the ratio tells
/// what the server adds to TLS.
///
/// A message of the echo has the bytes of the request's frame in both directions. Both are counted by the same loop:
/// one message at a time, each from its sending to the end of its last frame or record.

namespace qel::bench {

namespace {

constexpr std::array<std::size_t, 3> kSizes{64, 256, 4096}; // bytes of payload
constexpr unsigned int kRounds = 5;
constexpr std::chrono::milliseconds kOursTime(1000);
constexpr std::chrono::milliseconds kRawTime(500); // twice in a round, before ours and after it

/// The bytes of the frame that carries so many bytes of payload up to the server.
std::size_t frameOf(std::size_t payload)
{
    const std::vector<char> data(payload, 'q');
    return QelMessageDaxBroadcastReq(1, static_cast<std::uint16_t>(data.size()), 1, "addressee", data.data())
        .msgLength();
}

struct Figures {
    double perSecond;
    double p99; // microseconds
};

/// An echo with OpenSSL on the descriptors, whose far end is a process of its own.
///
/// Both ends are connected, and shake hands, before the process comes into being; after that each uses its own.
class RawEcho {
public:
    /// @throws std::system_error, std::runtime_error
    explicit RawEcho(const RawContexts& contexts) : mTls(contexts, mPair), mBuffer(QelMessage::MtuMax)
    {
        mTls.handshake();
        mFar = ::fork();
        if (mFar < 0) throw std::system_error(errno, std::generic_category(), "fork");
        if (mFar == 0) pServe();
        mTls.far.reset();
        mPair.far.reset();
    }
    ~RawEcho()
    {
        ::kill(mFar, SIGKILL);
        ::waitpid(mFar, nullptr, 0);
    }
    RawEcho(const RawEcho&) = delete;
    RawEcho& operator=(const RawEcho&) = delete;

    Figures measure(std::size_t length)
    {
        tool::BenchLoad load;
        load.time = kRawTime;
        tool::BenchFigures figures;
        std::atomic<std::uint64_t> done{0};
        const tool::BenchShare share(load, 0, TimeProvider::steady());
        try {
            share.run([&] { pExchange(length); }, [](tool::BenchShare::TimePoint) { return !isStopped(); }, figures,
                      done);
        } catch (const std::exception& error) {
            throw std::runtime_error(std::string("the echo with OpenSSL: ") + error.what());
        }
        checkNotStopped();
        const std::chrono::duration<double> elapsed(figures.elapsed);
        const std::chrono::duration<double, std::micro> p99(figures.latency.percentile(990));
        return {static_cast<double>(figures.latency.count()) / elapsed.count(), p99.count()};
    }

private:
    void pExchange(std::size_t length)
    {
        rawWrite(mTls.near.get(), mBuffer.data(), length);
        rawRead(mTls.near.get(), mBuffer.data(), length);
    }

    /// What the far process does until the near one is gone.
    [[noreturn]] void pServe()
    {
        mPair.near.reset();
        for (;;) {
            const int count = SSL_read(mTls.far.get(), mBuffer.data(), static_cast<int>(mBuffer.size()));
            if (count <= 0) ::_exit(EXIT_SUCCESS);
            if (SSL_write(mTls.far.get(), mBuffer.data(), count) != count) ::_exit(EXIT_FAILURE);
        }
    }

    TcpPair mPair;
    RawTlsPair mTls;
    std::vector<char> mBuffer;
    pid_t mFar = -1;
};

/// What the rounds of one contestant have shown.
class Series {
public:
    void add(const Figures& figures)
    {
        mPerSecond.push_back(figures.perSecond);
        mP99.push_back(figures.p99);
    }
    void add(const Series& other)
    {
        mPerSecond.insert(mPerSecond.end(), other.mPerSecond.begin(), other.mPerSecond.end());
        mP99.insert(mP99.end(), other.mP99.begin(), other.mP99.end());
    }
    Figures median() const { return {bench::median(mPerSecond), bench::median(mP99)}; }

private:
    std::vector<double> mPerSecond;
    std::vector<double> mP99;
};

struct Row {
    Series ours;
    Series raw;
    Series again;
};

void printRow(std::size_t size, const Row& row)
{
    const Figures ours = row.ours.median();
    const Figures again = row.again.median();
    const Figures first = row.raw.median();
    Series both = row.raw;
    both.add(row.again);
    const Figures raw = both.median();
    std::printf("%8zu %8zu %10.0f %10.0f %7.2f %10.1f %10.1f %7.2f %12.2f %7.2f\n", size, frameOf(size), ours.perSecond,
                raw.perSecond, ours.perSecond / raw.perSecond, ours.p99, raw.p99, ours.p99 / raw.p99,
                again.perSecond / first.perSecond, again.p99 / first.p99);
}

void printTable(const std::array<Row, kSizes.size()>& rows)
{
    std::printf(
        "\nmessages over TLS on loopback, processes of their own on one core, one message at a time; medians of "
        "%u rounds\n",
        kRounds);
    std::printf("%8s %8s %10s %10s %7s %10s %10s %7s %20s\n", "payload", "frame", "ours m/s", "raw m/s", "ratio",
                "ours p99", "raw p99", "ratio", "(raw against itself)");
    std::printf("%8s %8s %10s %10s %7s %10s %10s %7s %12s %7s\n", "bytes", "bytes", "", "", "", "us", "us", "", "m/s",
                "p99");
    for (std::size_t i = 0; i < rows.size(); ++i)
        printRow(kSizes[i], rows[i]);
    std::printf(
        "ours: qel bench and qel serve; a message is a request up, a notice down to another console and a "
        "response: three frames, the\n      server's queues, two connections, each sent and received by threads "
        "of its own.\n"
        "raw:  OpenSSL on the descriptors, an echo of as many bytes as the request's frame: two records, one "
        "connection.\n");
}

Figures oursOf(QelServer& server, std::size_t payload)
{
    const QelServer::Figures figures = server.measure(2, payload, kOursTime);
    return {figures.perSecond, figures.p99};
}

void measureAll()
{
    // The far ends of the echo must come first: a process that has threads had better not fork.
    const RawContexts contexts;
    RawEcho raw(contexts);
    RawEcho again(contexts);
    QelServer server(QelServer::Protection::Tls);
    std::array<Row, kSizes.size()> rows;
    for (unsigned int round = 0; round < kRounds; ++round) {
        for (std::size_t i = 0; i < kSizes.size(); ++i) {
            rows[i].raw.add(raw.measure(frameOf(kSizes[i])));
            rows[i].ours.add(oursOf(server, kSizes[i]));
            rows[i].again.add(again.measure(frameOf(kSizes[i])));
        }
    }
    printTable(rows);
}

} // namespace

} // namespace qel::bench

int main()
{
    try {
        qel::bench::stopOnSignals();
        qel::bench::pinToOneCore();
        qel::bench::measureAll();
        return EXIT_SUCCESS;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_tls_echo: %s\n", error.what());
        return EXIT_FAILURE;
    }
}
