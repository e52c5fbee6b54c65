#include "serve/ServeCommand.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/Server.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/SignalWatch.hpp"
#include "lines/LineLogs.hpp"
#include "lines/LineText.hpp"
#include "serve/ServeMachine.hpp"
#include "serve/ServePlan.hpp"
#include "serve/ServeReload.hpp"
#include "serve/ServeStatus.hpp"
#include "serve/ServiceManager.hpp"
#include "transport/TransportOptions.hpp"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <initializer_list>
#include <iostream>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>
#include <sys/time.h>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr std::initializer_list<int> kSignals{SIGTERM, SIGINT, SIGHUP, SIGUSR1, SIGALRM};

void addPartitions(Hypervisor& machine, const ServePlan& plan, LineLogs& logs)
{
    for (const auto& entry : plan.partitions) {
        MadeLine made = makePartition(entry.first, entry.second, plan.term, logs);
        machine.addPartition(entry.first, std::move(made.line), made.options);
    }
}

/// The key leaves the memory when the server has been made.
/// @param handed  sockets to listen on in place of those that it would make
std::unique_ptr<Server> makeServer(Hypervisor& machine, const ServePlan& plan, const std::vector<UniqueFd>& handed)
{
    ServerOptions options = plan.server;
    options.credentials = loadCredentials(plan.transport);
    if (!handed.empty()) options.listen.clear();
    for (const UniqueFd& socket : handed)
        options.sockets.push_back(socket.get());
    try {
        return std::make_unique<Server>(machine, options);
    } catch (const std::invalid_argument& error) { // the other options have been checked
        throw CommandFailure(ExitStatus::Usage, std::string("the sockets that are handed over: ") + error.what());
    }
}

void announce(const Server& server)
{
    const std::vector<IPEndpoint> endpoints = server.endpoints();
    for (const IPEndpoint& endpoint : endpoints)
        std::cout << endpoint << '\n';
    std::cout << std::flush;
    flushOutput();
    for (const IPEndpoint& endpoint : endpoints)
        logLine(LogLevel::Info, "listening on ", endpoint);
}

constexpr std::chrono::hours kDay(24);

/// Has SIGALRM sent once a day, and as often as the watchdog of a service manager is to be fed.
void setAlarm(std::chrono::microseconds watchdog)
{
    const std::chrono::microseconds time =
        watchdog.count() == 0 ? kDay : std::min<std::chrono::microseconds>(watchdog, kDay);
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(time);
    const timeval interval{static_cast<time_t>(seconds.count()), static_cast<suseconds_t>((time - seconds).count())};
    const itimerval timer{interval, interval};
    static_cast<void>(::setitimer(ITIMER_REAL, &timer, nullptr));
}

/// What is done from time to time, on SIGALRM.
class Chores {
public:
    Chores(Server& server, const ServeReload& reload, ServiceManager& manager)
        : mServer(server), mReload(reload), mManager(manager), mWarnAt(TimeProvider::steady() + kDay)
    {}

    void run()
    {
        const bool feeds = mManager.watchdogInterval().count() > 0;
        // A server whose thread of the serial lines is stuck is of no use, though it accepts connections.
        if (feeds && mServer.hasPulse()) mManager.feedWatchdog();
        if (feeds && TimeProvider::steady() < mWarnAt) return;
        mWarnAt = TimeProvider::steady() + kDay;
        mReload.warnOfExpiry();
    }

private:
    Server& mServer;
    const ServeReload& mReload;
    ServiceManager& mManager;
    std::chrono::steady_clock::time_point mWarnAt;
};

/// A line for those who ask the service manager how the server is.
std::string statusText(const Server& server)
{
    std::string text = "serving " + countText(server.partitions().size(), "partition") + " on ";
    const char* separator = "";
    for (const IPEndpoint& endpoint : server.endpoints())
        text += std::exchange(separator, ", ") + endpoint.str();
    return text;
}

/// On SIGUSR1 and at the end: logs the statistics of the queues.
void logStatistics(Server& server)
{
    std::ostringstream text;
    server.dumpStatistics(text);
    logLines(LogLevel::Info, text.str());
}

/// @return the signal that ended it
int serveUntilStopped(Server& server, SignalWatch& signals, ServeReload& reload, LineLogs& logs,
                      ServiceManager& manager)
{
    Chores chores(server, reload, manager);
    for (;;) {
        server.run(signals.getPollFd());
        const int signal = signals.take();
        if (signal == SIGHUP) {
            manager.reloading();
            logs.rotate(); // before new ones are opened
            reload.run();
            manager.ready(statusText(server));
        } else if (signal == SIGALRM) {
            chores.run();
        } else if (signal == SIGUSR1) {
            logStatistics(server);
        } else if (signal != 0) {
            return signal;
        }
    }
}

ExitStatus runServe(const ServePlan& plan)
{
    const std::vector<UniqueFd> handed = takeHandedSockets();
    startLogging(plan.log, "qel-serve.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // a log pipe without a reader must not end the server
    static_cast<void>(std::signal(SIGCHLD, SIG_DFL)); // ignored, as a parent may leave it, it hides how commands end
    SignalWatch signals(kSignals);
    ServeMachine machine(plan.machine, plan.capabilities, plan.policy);
    LineLogs logs(plan.lineLogBytes);
    addPartitions(machine, plan, logs);
    const auto server = makeServer(machine, plan, handed);
    ServeStatus status(*server, plan);
    std::unique_ptr<StatusServer> statusServer = startStatus(status, plan);
    announce(*server);
    const PeerPins& pins = plan.transport.pins;
    if (!plan.transport.plain && plan.policy.rules.size() == 0 && pins.names.empty() && pins.fingerprints.empty()) {
        logLine(LogLevel::Info, "any certificate of the root may do anything: there are no rules, and no --peer-name");
    }
    ServeReload reload(*server, machine, logs, plan,
                       [&status](const ServePlan& inForce, bool hasLoaded) { status.note(inForce, hasLoaded); });
    reload.warnOfExpiry();
    ServiceManager manager = ServiceManager::fromEnvironment();
    setAlarm(manager.watchdogInterval());
    manager.ready(statusText(*server));
    const int signal = serveUntilStopped(*server, signals, reload, logs, manager);
    manager.stopping();

    statusServer.reset();
    logLine(LogLevel::Info, "stopping: signal ", signal);
    logStatistics(*server);
    for (const int number : kSignals)
        static_cast<void>(std::signal(number, SIG_IGN)); // a second one must not cut the shutdown short
    server->finish();
    return ExitStatus::Done;
}

/// Checks what can be checked without serving. Everything that is wrong is an error of usage here.
ExitStatus checkPlan(const ServePlan& plan)
{
    try {
        static_cast<void>(loadCredentials(plan.transport));
    } catch (const std::exception& error) {
        throw CommandFailure(ExitStatus::Usage, userMessage(error));
    }
    std::cout << (plan.file.empty() ? "the configuration" : plan.file)
              << " is fine: " << countText(plan.partitions.size(), "partition") << ", ";
    if (plan.policy.rules.size() == 0) {
        std::cout << "no rules: " << (plan.transport.plain ? "every console" : "every certificate of the root")
                  << " may do anything\n";
    } else {
        std::cout << countText(plan.policy.rules.size(), "rule") << '\n';
    }
    return ExitStatus::Done;
}

ExitStatus runPlan(const ServePlan& plan)
{
    if (plan.checkOnly) return checkPlan(plan);
    if (!plan.printOnly) return runServe(plan);
    printPlan(std::cout, plan);
    return ExitStatus::Done;
}

} // namespace

CLI::App& addServeCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "serve", "Run the hypervisor end: serve consoles until a signal stops it");
    const auto input = std::make_shared<ServeInput>(command);
    command.callback([&action, input] { action = [plan = input->plan()] { return runPlan(plan); }; });
    return command;
}

} // namespace qel::tool
