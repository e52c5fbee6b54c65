#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "support/Process.hpp"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <deque>
#include <exception>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

/// @file
/// Requests that are pipelined: one console keeps 128 of them under way, and `qel serve --plain` answers them. A
/// program of its own, because it starts others:
///
///     qel_bench_pipeline [PROGRAM...]
///
/// Each PROGRAM is a path to a `qel`; its libraries may be beside it. They take turns, five rounds. The last line of
/// each has the median, and its ratio to the first. Start it with taskset(1) to measure on one core; the servers
/// inherit that.

namespace qel::bench {

namespace {

using std::chrono::steady_clock;
using test::Process;

constexpr unsigned kWindow = 128;
constexpr unsigned kRounds = 5;
constexpr std::chrono::milliseconds kRoundTime(1000);
constexpr std::chrono::seconds kDeadline(20);

/// A server, and a console that is connected to it.
class Pipeline {
public:
    explicit Pipeline(const std::string& program)
        : mServer({program, "serve", "--plain", "--log-level", "error"},
                  {{"LD_LIBRARY_PATH", std::filesystem::path(program).parent_path().string()}}),
          mStream(connect(mServer.readLine()), flushedByReading()), mMessages(mStream, protocol::messageRegistry())
    {
        mStream.setReadDeadline(kDeadline);
        mMessages.write(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 0, 1, "pipeline"));
        if (mMessages.read()->getStatus() != 0) throw std::runtime_error("the server refuses the console");
        mStream.clearReadDeadline();
    }
    ~Pipeline() { mServer.signal(SIGTERM); }
    Pipeline(const Pipeline&) = delete;
    Pipeline& operator=(const Pipeline&) = delete;

    /// @return microseconds for a request and its response
    double run()
    {
        std::deque<unsigned int> underWay;
        unsigned done = 0;
        const auto start = steady_clock::now();
        for (unsigned i = 0; i < kWindow; ++i)
            underWay.push_back(ask());
        while (steady_clock::now() - start < kRoundTime) {
            answer(underWay);
            underWay.push_back(ask());
            ++done;
        }
        const std::chrono::duration<double, std::micro> elapsed = steady_clock::now() - start;
        while (!underWay.empty())
            answer(underWay);
        return elapsed.count() / done;
    }

private:
    static BufferedStreamOptions flushedByReading()
    {
        BufferedStreamOptions options;
        options.flushBeforeRead = true;
        return options;
    }

    /// @param line  of the server: its endpoint
    static std::unique_ptr<SocketStream> connect(const std::string& line)
    {
        const IPEndpoint endpoint(line);
        Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(endpoint, kDeadline);
        return std::make_unique<SocketStream>(std::move(socket));
    }

    unsigned int ask()
    {
        const QelMessageGetQelTodReq request;
        mMessages.write(request);
        return request.getCallerId();
    }

    void answer(std::deque<unsigned int>& underWay)
    {
        const std::unique_ptr<QelMessage> response = mMessages.read();
        response->checkStatus();
        if (response->getCallerId() != underWay.front()) throw std::runtime_error("the responses are out of order");
        underWay.pop_front();
    }

    Process mServer;
    BufferedStream mStream;
    QelMessageStream mMessages;
};

void compare(const std::vector<std::string>& programs)
{
    std::vector<std::vector<double>> times(programs.size());
    for (unsigned round = 0; round < kRounds; ++round) {
        for (std::size_t i = 0; i < programs.size(); ++i)
            times[i].push_back(Pipeline(programs[i]).run());
    }
    double first = 0;
    for (std::size_t i = 0; i < programs.size(); ++i) {
        std::sort(times[i].begin(), times[i].end());
        const double median = times[i][kRounds / 2];
        if (i == 0) first = median;
        std::printf("%s: %u requests under way, plain: %.2f us each (%.2f to %.2f), ratio %.2f\n",
                    programs.size() == 1 ? "qel serve" : programs[i].c_str(), // a path means nothing elsewhere
                    kWindow, median, times[i].front(), times[i].back(), median / first);
    }
}

} // namespace

} // namespace qel::bench

int main(int argc, char** argv)
{
    try {
        std::vector<std::string> programs(argv + 1, argv + argc);
        if (programs.empty()) programs.emplace_back(QEL_PROGRAM);
        qel::bench::compare(programs);
        return 0;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "qel_bench_pipeline: %s\n", error.what());
        return 1;
    }
}
