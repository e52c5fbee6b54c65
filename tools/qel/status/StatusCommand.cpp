#include "status/StatusCommand.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/OptionChecks.hpp"
#include "status/StatusClient.hpp"
#include "status/StatusMetrics.hpp"
#include "status/StatusScreen.hpp"
#include "status/StatusText.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <iostream>
#include <memory>
#include <poll.h>
#include <sstream>
#include <string>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::chrono::seconds kTimeout(5);
/// While it is drawn again and again: keys are not read meanwhile.
constexpr std::chrono::seconds kWatchTimeout(2);
constexpr double kUsualSeconds = 2;

constexpr const char* kFooter = R"(
The socket is that of "qel serve --status-socket PATH": without --socket the one in $QEL_STATUS_SOCKET, or else
$XDG_RUNTIME_DIR/qel-status.sock, or else /run/qel/status.sock, that of the service. It is for the user of the server,
and for root.

    qel status --watch                # redraws every two seconds; q leaves
    qel status --close web1           # ends the session of whoever types on partition web1; web1/3 that on connection 3
    qel status --close alice          # ends all sessions of the console with this common name; "#7" is console 7
    qel status --break 2              # sends a break through the line of partition 2

Exit status: 0 done; 1 the server cannot do it; 2 usage; 3 no server is there; 5, 6, 7 it does not answer as it should.)";

struct Options {
    std::string socket;
    bool json = false;
    bool metrics = false;
    bool watches = false;
    double seconds = kUsualSeconds;
    std::string close;
    std::string breakTo;

    std::chrono::milliseconds interval() const
    {
        return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(seconds));
    }
};

std::string socketOf(const Options& options)
{
    std::string socket = statusSocketFor(options.socket);
    if (!socket.empty()) return socket;
    throw CommandFailure(ExitStatus::Usage, "no status socket is known: --socket names that of qel serve "
                                            "--status-socket");
}

ExitStatus runClose(const Options& options)
{
    const auto answer = askServer(socketOf(options), "close " + options.close, kTimeout);
    if (options.json) {
        printJson(std::cout, answer);
        return ExitStatus::Done;
    }
    for (const auto& session : answer.at("closed")) {
        std::cout << "closed: " << printable(session.at("name").get<std::string>()) << " on partition "
                  << session.at("partition") << ", connection " << session.at("connection") << '\n';
    }
    return ExitStatus::Done;
}

ExitStatus runBreak(const Options& options)
{
    const auto answer = askServer(socketOf(options), "break " + options.breakTo, kTimeout);
    if (options.json) {
        printJson(std::cout, answer);
    } else {
        std::cout << "sent a break to partition " << answer.at("partition") << '\n';
    }
    return ExitStatus::Done;
}

void printReport(std::ostream& os, const Options& options, const std::string& socket)
{
    const StatusReport report = askStatus(socket, options.watches ? kWatchTimeout : kTimeout);
    if (!options.json && !options.metrics) return printStatus(os, report);
    if (options.metrics) return printMetrics(os, report);
    if (!options.watches) return printJson(os, toJson(report));
    os << toJson(report).dump(-1, ' ', true, nlohmann::ordered_json::error_handler_t::replace) << '\n';
}

/// The report for a screen; while there is no server, why.
std::string screenText(const Options& options, const std::string& socket)
{
    std::ostringstream text;
    try {
        printReport(text, options, socket);
    } catch (const CommandFailure& failure) {
        text.str({});
        text << failure.what() << "\ntrying again\n";
    }
    return text.str() + "\nq leaves\n";
}

/// Without a terminal: one report after the other, until the server is gone or a signal ends it.
[[noreturn]] void printForever(const Options& options, const std::string& socket)
{
    for (bool isFirst = true;; isFirst = false) {
        if (!isFirst && !options.json) std::cout << '\n';
        printReport(std::cout, options, socket);
        std::cout << std::flush;
        flushOutput();
        static_cast<void>(::poll(nullptr, 0, static_cast<int>(options.interval().count())));
    }
}

ExitStatus runWatch(const Options& options)
{
    const std::string socket = socketOf(options);
    if (::isatty(STDOUT_FILENO) == 0 || options.json) printForever(options, socket);
    static_cast<void>(askStatus(socket, kTimeout)); // a wrong path is an error, not something to watch
    StatusScreen screen(STDIN_FILENO, STDOUT_FILENO);
    screen.run([&] { return screenText(options, socket); }, options.interval());
    return ExitStatus::Done;
}

ExitStatus runStatus(const Options& options)
{
    if (!options.close.empty()) return runClose(options);
    if (!options.breakTo.empty()) return runBreak(options);
    if (options.watches) return runWatch(options);
    printReport(std::cout, options, socketOf(options));
    return ExitStatus::Done;
}

} // namespace

CLI::App& addStatusCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "status", "Ask a server on this machine who is on, and what has passed");
    const auto options = std::make_shared<Options>();
    command.add_option("--socket", options->socket, "The status socket of the server")->type_name("PATH");
    addJsonOption(command, options->json);
    CLI::Option* const metrics =
        command.add_flag("--prometheus", options->metrics, "Print metrics in the text format of Prometheus")
            ->excludes(findOption(command, "json"));
    CLI::Option* const watch = command
                                   .add_option("--watch", options->seconds,
                                               "Print again every so many seconds, 2 by default: as a screen on a "
                                               "terminal, otherwise as lines")
                                   ->type_name("[SECONDS]")
                                   ->expected(0, 1)
                                   ->check(numberIn(0.1, 3600))
                                   ->excludes(metrics);
    CLI::Option* const close =
        command.add_option("--close", options->close, "End another's session: by console, or by partition")
            ->type_name("CONSOLE|PARTITION[/CONNECTION]")
            ->excludes(metrics)
            ->excludes(watch);
    command.add_option("--break", options->breakTo, "Send a break through the line of a partition")
        ->type_name("PARTITION")
        ->excludes(metrics)
        ->excludes(watch)
        ->excludes(close);
    command.footer(kFooter);
    command.callback([&action, options, watch] {
        options->watches = watch->count() > 0;
        if (options->seconds <= 0) options->seconds = kUsualSeconds; // --watch without a number
        action = [options] { return runStatus(*options); };
    });
    return command;
}

} // namespace qel::tool
