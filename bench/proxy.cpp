#include <qel/common/net/Listen.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "Contest.hpp"
#include "Loopback.hpp"
#include "Median.hpp"
#include "support/Process.hpp"

#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>
#include <string>
#include <thread>
#include <vector>

/// @file
/// What "qel proxy" costs: frames of 1 KiB from one thread to another, directly and through the proxy, all on one core,
/// in rounds that alternate. The sender writes each frame by itself; the receiver reads its header and then the rest,
/// as a message stream does.
///
///   qel_bench_proxy [--quick]

namespace qel::bench {

namespace {

constexpr std::size_t kFrameBytes = 1024;
constexpr double kAtLeast = 0.5; // of the throughput without the proxy

struct Plan {
    unsigned int rounds = 11;
    std::size_t frames = 60000;
};

/// A connection from one end to the other: directly, or through a proxy.
struct Path {
    Path(const IPEndpoint& where, Socket& listener)
    {
        constexpr std::chrono::seconds kDeadline(5);
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(where, kDeadline);
        near = std::make_unique<SocketStream>(std::move(socket));
        far = std::make_unique<SocketStream>(listener.accept());
    }

    std::unique_ptr<SocketStream> near;
    std::unique_ptr<SocketStream> far;
};

/// @return frames a second
double measure(const IPEndpoint& where, Socket& listener, std::size_t frames)
{
    const Path path(where, listener);
    const std::unique_ptr<QelMessage> message = messageOf(kFrameBytes);
    const auto begin = std::chrono::steady_clock::now();
    std::thread sender([&] {
        for (std::size_t i = 0; i < frames; ++i)
            path.near->write(message->serialize(), message->msgLength());
    });
    std::vector<char> buffer(QelMessage::MtuMax);
    for (std::size_t i = 0; i < frames; ++i)
        readFrame(path.far->getSocket().getFd(), buffer.data());
    const std::chrono::duration<double> time = std::chrono::steady_clock::now() - begin;
    sender.join();
    return static_cast<double>(frames) / time.count();
}

/// "qel proxy" in front of a listener.
struct ProxyProcess {
    ProxyProcess(const IPEndpoint& server, const std::vector<std::string>& options)
        : process(command(server, options)), endpoint(process.readLine())
    {}
    static std::vector<std::string> command(const IPEndpoint& server, const std::vector<std::string>& options)
    {
        std::vector<std::string> words{QEL_PROGRAM, "proxy", "--plain", "--connect", server.str()};
        words.insert(words.end(), options.begin(), options.end());
        return words;
    }

    test::Process process;
    IPEndpoint endpoint;
};

struct Row {
    const char* name;
    std::vector<std::string> options;
    double atLeast;         // of the throughput without the proxy; 0: only reported
    unsigned int fewer = 1; // frames, for what the proxy prints is collected
};

const std::vector<Row>& rows()
{
    static const std::vector<Row> all{
        {"quiet", {"--quiet"}, kAtLeast},
        {"a rule that no frame meets", {"--quiet", "--fault", "op=0xFFFF drop"}, 0},
        {"a filter that shows no frame", {"--filter", "op=0xFFFF"}, kAtLeast},
        {"a capture", {"--quiet", "--write", "/dev/null"}, 0},
        {"a line for each frame", {}, 0, 10},
    };
    return all;
}

void measureAll(const Plan& plan)
{
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 8);
    const IPEndpoint server = listener.getSocketName();
    std::vector<std::unique_ptr<ProxyProcess>> proxies;
    for (const Row& row : rows())
        proxies.push_back(std::make_unique<ProxyProcess>(server, row.options));
    std::vector<double> direct;
    std::vector<std::vector<double>> through(rows().size());
    for (unsigned int round = 0; round < plan.rounds; ++round) {
        direct.push_back(measure(server, listener, plan.frames));
        for (std::size_t i = 0; i < proxies.size(); ++i)
            through[i].push_back(measure(proxies[i]->endpoint, listener, plan.frames / rows()[i].fewer));
    }
    const double without = median(direct);
    std::printf("qel proxy, frames of %zu bytes, one core   frames/s  of direct\n", kFrameBytes);
    std::printf("%-40s %9.0f\n", "without the proxy", without);
    for (std::size_t i = 0; i < rows().size(); ++i) {
        const Row& row = rows()[i];
        const double rate = median(through[i]);
        std::printf("%-40s %9.0f  %9.2f", row.name, rate, rate / without);
        if (row.atLeast > 0)
            std::printf(", at least %.2f: %s", row.atLeast, rate / without >= row.atLeast ? "reached" : "MISSED");
        std::printf("\n");
    }
}

} // namespace

} // namespace qel::bench

int main(int argc, char** argv)
{
    qel::bench::Plan plan;
    if (argc > 1 && std::strcmp(argv[1], "--quick") == 0) plan = {1, 2000};
    try {
        qel::bench::pinToOneCore();
        qel::bench::measureAll(plan);
        return 0;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_proxy: %s\n", error.what());
        return 1;
    }
}
