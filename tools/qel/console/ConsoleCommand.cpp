#include "console/ConsoleCommand.hpp"

#include <qel/common/io/StreamIOException.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"
#include "base/Text.hpp"
#include "client/ClientConnection.hpp"
#include "client/ConnectOptions.hpp"
#include "console/ConsoleLoop.hpp"
#include "console/ConsoleScreen.hpp"
#include "console/ConsoleSession.hpp"
#include "console/EscapeFilter.hpp"

#include <csignal>
#include <initializer_list>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr double kLongestLinger = 24 * 60 * 60;

/// Those that ask a program to end, and those about stopping and going on.
constexpr std::initializer_list<int> kSignals{SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGCONT};

constexpr const char* kFooter = R"(
On a terminal, "~." at the start of a line leaves and "~?" lists what else there is. Anything but a terminal is sent as
it is: echo 'uname -srm' | qel console ... PARTITION. When such an input ends, the partition is told by an end-of-file
character (control-D), again after every second of silence, and everything it puts out is printed until its command
ends. The output contains the echo of the input if the partition echoes it, as terminals do.

Exit status: 0 the command ended, or you left; 1 refused, or the hypervisor end is not who it should be, or another
console took the session; 2 usage; 3 cannot connect; 4 something failed on this machine; 5 the hypervisor end broke the
protocol; 6 it did not answer in time; 7 it shut down or the connection was lost.)";

struct ConsoleOptions {
    ConnectOptions connect;
    LogOptions log;
    ConsoleSession::Address address;
    bool force = false;
    bool noEof = false;
    std::string escape = "~";
    std::optional<double> lingerSeconds;

    ConsoleManners manners() const;
};

/// "^" and the character that a control character is typed with, "^[" for escape.
bool isControlText(const std::string& text)
{
    return text.size() == 2 && text[0] == '^' && text[1] >= '@' && text[1] <= '_';
}

/// "none", a character, or "^" and the one of a control character.
std::optional<char> parseEscape(const std::string& text)
{
    if (text == "none") return std::nullopt;
    constexpr int kControlBits = 0x1F;
    if (isControlText(text)) return static_cast<char>(text[1] & kControlBits);
    return text.at(0);
}

std::string checkEscape(std::string& text)
{
    if (text == "none") return {};
    const bool isPrintable = text.size() == 1 && text[0] > ' ' && text[0] < '\x7F';
    if (!isPrintable && !isControlText(text)) {
        return tool::quoted(text) + " is not one printable character, ^ and a character from @ to _, or none";
    }
    if (EscapeFilter::isCommandCharacter(*parseEscape(text)))
        return tool::quoted(text) + " is a command after the escape character";
    return {};
}

ConsoleManners ConsoleOptions::manners() const
{
    ConsoleManners manners;
    manners.escape = parseEscape(escape);
    manners.tellsEnd = !noEof;
    if (lingerSeconds) {
        manners.linger =
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(*lingerSeconds));
    }
    return manners;
}

ConsoleLoop::Outcome join(ConsoleSession& session, ConsoleScreen& screen, TerminalMode& mode,
                          const ConsoleManners& manners)
{
    // Signals are watched for only while there is a terminal to be put back: at all other times they end this process
    // at once, whatever it waits for.
    SignalWatch signals(kSignals);
    ConsoleLoop loop(session, screen, STDIN_FILENO, mode, signals, manners);
    return loop.run();
}

/// The session from its beginning to its end.
ConsoleLoop::Outcome attend(ClientConnection& connection, ConsoleSession& session, ConsoleScreen& screen,
                            TerminalMode& mode, const ConsoleOptions& options)
{
    try {
        session.open(options.force);
        const ConsoleLoop::Outcome outcome = join(session, screen, mode, options.manners());
        // Whoever is told to end does so without asking for anything; the hypervisor closes what is left behind.
        if (outcome.departure != ConsoleLoop::Departure::Signal) session.close();
        connection.leave();
        return outcome;
    } catch (...) {
        connection.leave();
        throw;
    }
}

/// Ends this process by a signal that it had only postponed, so that whoever started it sees why it ended.
[[noreturn]] void endBy(int signal)
{
    static_cast<void>(::raise(signal));
    throw CommandFailure(ExitStatus::Failed, "signal " + std::to_string(signal) + " did not end this process");
}

ExitStatus conclude(const ConsoleLoop::Outcome& outcome, const ConsoleSession& session, ConsoleScreen& screen,
                    const TerminalMode& mode)
{
    switch (outcome.departure) {
    case ConsoleLoop::Departure::Signal:
        endBy(outcome.signal);
    case ConsoleLoop::Departure::Left:
        screen.output().writeSome();
        if (mode.isTerminal()) screen.say("left partition " + std::to_string(session.getAddress().partition));
        return ExitStatus::Done;
    case ConsoleLoop::Departure::Ended:
        screen.output().flush();
        screen.say(describe(session.getEnd()));
        return exitStatusOf(session.getEnd());
    default:
        screen.output().flush();
        return ExitStatus::Done;
    }
}

ExitStatus runConsole(const ConsoleOptions& options)
{
    startLogging(options.log, "qel-console.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // nobody reads the output: still the terminal is to be put back
    TerminalMode mode(STDIN_FILENO);
    ConsoleScreen screen(STDOUT_FILENO, std::cerr, ::isatty(STDERR_FILENO) == 1, mode);
    try {
        const auto connection = connectConsole(options.connect);
        ConsoleSession session(*connection, options.address, options.connect.timeout(), screen);
        const ConsoleLoop::Outcome outcome = attend(*connection, session, screen, mode, options);
        return conclude(outcome, session, screen, mode);
    } catch (const StreamIOException& error) {
        throw CommandFailure(exitStatusOf(error), "connection lost: " + explain(error));
    }
}

void addEscape(CLI::App& command, ConsoleOptions& options)
{
    command
        .add_option("--escape", options.escape,
                    "On a terminal: the character that begins a command to this program at the start of a line; ^X for "
                    "a control character")
        ->type_name("CHAR|none")
        ->check(CLI::Validator(checkEscape, ""))
        ->capture_default_str();
}

void addInputOptions(CLI::App& command, ConsoleOptions& options)
{
    command.add_flag("--no-eof", options.noEof,
                     "Do not tell the partition that the input, which is no terminal, has ended");
    command
        .add_option("--linger", options.lingerSeconds,
                    "Leave when the partition has been silent for so long after the end of the input, which it is then "
                    "told only once; wait for its command to end unless given")
        ->type_name("SECONDS")
        ->check(numberIn(0.0, kLongestLinger));
}

} // namespace

CLI::App& addConsoleCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "console", "Join the serial console of a partition to the terminal");
    const auto options = std::make_shared<ConsoleOptions>();
    command.add_option("partition", options->address.partition, "The partition's id")
        ->required()
        ->type_name("PARTITION")
        ->transform(integerIn(0, 65535));
    addConnectOptions(command, options->connect);
    command.get_option("--timeout")
        ->description("Seconds for connecting and opening the session together, and then for each answer and for each "
                      "message that has begun");
    command.add_option("--connection", options->address.connection, "Number of the serial connection")
        ->type_name("N")
        ->transform(integerIn(0, 65535))
        ->capture_default_str();
    command.add_flag("--force", options->force, "Take the session from the console that holds it");
    addEscape(command, *options);
    addInputOptions(command, *options);
    options->log.usual = LogLevel::Warn;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.footer(kFooter);
    command.callback([&action, options] {
        checkTransport(options->connect.transport, options->connect.endpoint);
        action = [options] { return runConsole(*options); };
    });
    return command;
}

} // namespace qel::tool
