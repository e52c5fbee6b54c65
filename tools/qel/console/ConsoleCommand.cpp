#include "console/ConsoleCommand.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"
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
#include <sstream>
#include <string>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr double kMaxLinger = 24 * 60 * 60;

/// Termination, suspension and continuation.
constexpr std::initializer_list<int> kSignals{SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGCONT};

constexpr const char* kFooter = R"(
On a terminal, "~." at the start of a line leaves the session and "~?" lists the other commands. Input that is not a
terminal is sent as it is: echo 'uname -srm' | qel console ... PARTITION. At the end of such input the console sends an
end-of-file character (control-D), repeats it after each second without output, and prints all output until the
partition's command ends. The output includes the echo of the input if the partition echoes it, as terminals do.

Exit status: 0 the command ended, or you left; 1 a request was refused, the server has the wrong certificate, or another
console took the session; 2 usage error; 3 cannot connect; 4 failure on this machine; 5 the server broke the protocol;
6 timeout; 7 the server shut down or the connection was lost.)";

struct ConsoleOptions {
    ConnectOptions connect;
    LogOptions log;
    ConsoleSession::Address address;
    bool force = false;
    bool noEof = false;
    std::string escape = "~";
    std::optional<double> lingerSeconds;

    InputOptions inputOptions() const;
};

/// True for caret notation, such as "^[" for escape.
bool isControlText(const std::string& text)
{
    return text.size() == 2 && text[0] == '^' && text[1] >= '@' && text[1] <= '_';
}

/// @param text  "none", one character, or a control character in caret notation
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

InputOptions ConsoleOptions::inputOptions() const
{
    InputOptions options;
    options.escape = parseEscape(escape);
    options.sendsEnd = !noEof;
    if (lingerSeconds) {
        options.linger =
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(*lingerSeconds));
    }
    return options;
}

ConsoleLoop::Outcome join(ConsoleSession& session, ConsoleScreen& screen, TerminalMode& mode,
                          const InputOptions& options)
{
    // Signals are watched only while the terminal may have to be restored. At all other times they end this process at
    // once.
    SignalWatch signals(kSignals);
    ConsoleLoop loop(session, screen, STDIN_FILENO, mode, signals, options);
    return loop.run();
}

/// Runs the session from opening to closing.
ConsoleLoop::Outcome runSession(ClientConnection& connection, ConsoleSession& session, ConsoleScreen& screen,
                                TerminalMode& mode, const ConsoleOptions& options)
{
    try {
        session.open(options.force);
        const ConsoleLoop::Outcome outcome = join(session, screen, mode, options.inputOptions());
        // After a signal the process ends without further requests; the hypervisor closes its sessions.
        if (outcome.reason != ConsoleLoop::ExitReason::Signal) session.close();
        connection.leave();
        return outcome;
    } catch (...) {
        connection.leave();
        throw;
    }
}

/// Ends this process by the signal that SignalWatch held back, so that its parent sees the signal as the reason.
[[noreturn]] void endBy(int signal)
{
    static_cast<void>(::raise(signal));
    throw CommandFailure(ExitStatus::Failed, "signal " + std::to_string(signal) + " did not end this process");
}

ExitStatus conclude(const ConsoleLoop::Outcome& outcome, const ConsoleSession& session, ConsoleScreen& screen,
                    const TerminalMode& mode)
{
    switch (outcome.reason) {
    case ConsoleLoop::ExitReason::Signal:
        endBy(outcome.signal);
    case ConsoleLoop::ExitReason::Left:
        screen.output().writeSome();
        if (mode.isTerminal()) screen.say("left partition " + std::to_string(session.getAddress().partition));
        return ExitStatus::Done;
    case ConsoleLoop::ExitReason::Ended:
        screen.output().flush();
        screen.say(session.describeEnd());
        return exitStatusOf(session.getEnd());
    default:
        screen.output().flush();
        return ExitStatus::Done;
    }
}

std::string timeoutText(const ConnectOptions& options)
{
    std::ostringstream text;
    text << "timed out after " << options.timeoutSeconds << " s (--timeout): ";
    return text.str();
}

ExitStatus runConsole(const ConsoleOptions& options)
{
    startLogging(options.log, "qel-console.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // the terminal must be restored even when the output is closed
    TerminalMode mode(STDIN_FILENO);
    ConsoleScreen screen(STDOUT_FILENO, std::cerr, ::isatty(STDERR_FILENO) == 1, mode);
    const auto connection = connectConsole(options.connect);
    try {
        ConsoleSession session(*connection, options.address, options.connect.timeout(), screen);
        const ConsoleLoop::Outcome outcome = runSession(*connection, session, screen, mode, options);
        return conclude(outcome, session, screen, mode);
    } catch (const StreamIOException& error) {
        if (exitStatusOf(error) != ExitStatus::DeadlinePassed) throw;
        throw CommandFailure(ExitStatus::DeadlinePassed, timeoutText(options.connect) + explain(error));
    }
}

void addEscape(CLI::App& command, ConsoleOptions& options)
{
    command
        .add_option("--escape", options.escape,
                    "On a terminal: the character that begins a command at the start of a line; ^X means a control "
                    "character")
        ->type_name("CHAR|none")
        ->check(CLI::Validator(checkEscape, ""))
        ->capture_default_str();
}

void addInputOptions(CLI::App& command, ConsoleOptions& options)
{
    command.add_flag("--no-eof", options.noEof, "Do not send an end-of-file character at the end of the input");
    command
        .add_option("--linger", options.lingerSeconds,
                    "After the end of the input, leave once the partition has sent nothing for this long; the "
                    "end-of-file character is then sent only once (default: wait for the command to end)")
        ->type_name("SECONDS")
        ->check(numberIn(0.0, kMaxLinger));
}

} // namespace

CLI::App& addConsoleCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "console", "Connect the terminal to the serial console of a partition");
    const auto options = std::make_shared<ConsoleOptions>();
    command.add_option("partition", options->address.partition, "Partition id")
        ->required()
        ->type_name("PARTITION")
        ->transform(integerIn(0, 65535));
    addConnectOptions(command, options->connect);
    describeOption(command, "--timeout",
                   "Timeout in seconds: one for connecting and opening the session, then one for each response and "
                   "for each message once it has begun");
    command.add_option("--connection", options->address.connection, "Serial connection of the partition")
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
