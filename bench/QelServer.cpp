#include "QelServer.hpp"

#include <cerrno>
#include <csignal>
#include <nlohmann/json.hpp>
#include <stdexcept>
#include <sys/wait.h>
#include <vector>

namespace qel::bench {

namespace {

using nlohmann::json;
using test::Process;

volatile std::sig_atomic_t sStop = 0;

/// Sleeps until the process has ended. Its own wait() looks again and again, on the core that is measured.
void awaitEnd(const Process& process)
{
    siginfo_t info;
    while (::waitid(P_PID, static_cast<id_t>(process.pid()), &info, WEXITED | WNOWAIT) != 0 && errno == EINTR)
        continue;
}

[[noreturn]] void fail(const std::string& command, const Process::Result& result)
{
    throw std::runtime_error("qel " + command + " ended with exit status " + std::to_string(result.exitStatus) +
                             ", signal " + std::to_string(result.signal) + "\n" + result.output + result.errors);
}

void run(const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{QEL_PROGRAM};
    command.insert(command.end(), arguments.begin(), arguments.end());
    const Process::Result result = test::run(command);
    checkNotStopped();
    if (result.exitStatus != 0) fail(arguments.at(0) + " " + arguments.at(1), result);
}

} // namespace

void stopOnSignals()
{
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // an end that is gone shows as a failed write
    for (const int number : {SIGINT, SIGTERM, SIGHUP})
        static_cast<void>(std::signal(number, [](int) { sStop = 1; }));
}

bool isStopped() { return sStop != 0; }

void checkNotStopped()
{
    if (isStopped()) throw std::runtime_error("interrupted");
}

QelServer::QelServer(Protection protection, const std::vector<std::string>& more) : mProtection(protection)
{
    std::vector<std::string> arguments{QEL_PROGRAM, "serve", "--listen", "127.0.0.1:0", "--max-consoles", "255"};
    if (protection == Protection::Plain) {
        arguments.emplace_back("--plain");
    } else {
        run({"ca", "init", pCredentials(), "--subject", "CN=bench root"});
        run({"ca", "issue", pCredentials(), "server", "--subject", "CN=server"});
        run({"ca", "issue", pCredentials(), "operator", "--subject", "CN=operator"});
        arguments.insert(arguments.end(), {"--credentials", pCredentials(), "--name", "server"});
    }
    arguments.insert(arguments.end(), more.begin(), more.end());
    mServer = std::make_unique<Process>(arguments);
    mEndpoint = mServer->readLine();
}

std::vector<std::string> QelServer::client(const std::string& subcommand, const std::vector<std::string>& more) const
{
    std::vector<std::string> command{QEL_PROGRAM, subcommand, "--connect", mEndpoint};
    if (mProtection == Protection::Plain) {
        command.emplace_back("--plain");
    } else {
        command.insert(command.end(), {"--credentials", pCredentials(), "--name", "operator", "--peer-name", "server"});
    }
    command.insert(command.end(), more.begin(), more.end());
    return command;
}

QelServer::Figures QelServer::measure(unsigned int consoles, std::size_t payload, std::chrono::milliseconds time)
{
    Process bench(
        client("bench", {"--json", "--connections", std::to_string(consoles), "--size", std::to_string(payload),
                         "--seconds", std::to_string(std::chrono::duration<double>(time).count())}));
    awaitEnd(bench);
    Process::Result result = bench.wait();
    checkNotStopped();
    if (result.exitStatus != 0) {
        result.errors += "qel serve wrote:\n" + mServer->errors();
        fail("bench", result);
    }
    const json report = json::parse(result.output);
    if (report.at("interrupted").get<bool>()) throw std::runtime_error("qel bench was interrupted");
    const json& latency = report.at("latencyNanoseconds");
    return {report.at("messagesPerSecond").get<double>(), latency.at("p50").get<double>() / 1000,
            latency.at("p99").get<double>() / 1000};
}

} // namespace qel::bench
