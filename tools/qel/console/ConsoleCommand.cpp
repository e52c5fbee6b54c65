#include "console/ConsoleCommand.hpp"

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/SerialSession.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/RefusalReason.hpp"
#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"
#include "client/ConnectOptions.hpp"
#include "console/ConsoleConnection.hpp"
#include "console/ConsoleLoop.hpp"
#include "console/ConsoleScreen.hpp"
#include "console/ConsoleTexts.hpp"
#include "console/EscapeFilter.hpp"
#include "console/MessageStream.hpp"

#include <chrono>
#include <csignal>
#include <cstdint>
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
constexpr double kMaxKeepAlive = 24 * 60 * 60;

/// How long a person waits for the server when leaving.
constexpr std::chrono::milliseconds kFarewell{90};

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

struct CommandOptions {
    ConnectOptions connect;
    LogOptions log;
    std::uint16_t partition = 0;
    SerialOptions serial;
    bool noEof = false;
    std::string escape = "~";
    std::optional<double> lingerSeconds;
    double keepAliveSeconds = 15;

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

InputOptions CommandOptions::inputOptions() const
{
    InputOptions options;
    options.escape = parseEscape(escape);
    options.keepAlive =
        std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(keepAliveSeconds));
    options.sendsEnd = !noEof;
    if (lingerSeconds) {
        options.linger =
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(*lingerSeconds));
    }
    return options;
}

/// Closes the serial session and the hypervisor session, as far as they are open, and the connection. A person at a
/// terminal does not wait for a server that does not answer.
/// @param requestTimeout  for each response, if there is no terminal
void close(ConsoleConnection& connection, SerialSession& session, ConsoleScreen& screen, const TerminalMode& mode,
           std::chrono::milliseconds requestTimeout)
{
    Console& console = connection.console();
    const auto end = TimeProvider::steady() + (mode.isTerminal() ? kFarewell : requestTimeout);
    if (mode.isTerminal()) connection.stream().cutAt(end);
    try {
        session.close(timeLeft(end));
        screen.showOutput(session);
        if (session.getEnd() != SessionEnd::ShutDown && session.getEnd() != SessionEnd::ConnectionClosed)
            console.closeSession(mode.isTerminal() ? timeLeft(end) : requestTimeout);
    } catch (const std::exception& error) {
        if (!mode.isTerminal()) throw;
        logLine(LogLevel::Debug, "while leaving: ", explain(error));
    }
    console.leave();
}

/// The exit status of this command when its session ended this way.
ExitStatus exitStatusOf(SessionEnd end)
{
    switch (end) {
    case SessionEnd::None:
    case SessionEnd::Closed:
    case SessionEnd::CommandEnded:
        return ExitStatus::Done;
    case SessionEnd::Taken:
        return ExitStatus::Refused;
    default:
        return ExitStatus::ClosedByPeer;
    }
}

/// Ends this process by the signal that SignalWatch held back, so that its parent sees the signal as the reason.
[[noreturn]] void endBy(int signal)
{
    static_cast<void>(::raise(signal));
    throw CommandFailure(ExitStatus::Failed, "signal " + std::to_string(signal) + " did not end this process");
}

std::string leftText(const CommandOptions& options, const ConsoleLoop::Outcome& outcome)
{
    const std::string text = filled(texts::kLeft, {std::to_string(options.partition)});
    if (outcome.thrownAway == 0) return text;
    return text + filled(texts::kThrownAway, {std::to_string(outcome.thrownAway)});
}

ExitStatus conclude(const ConsoleLoop::Outcome& outcome, SessionEnd end, const std::string& endText,
                    const CommandOptions& options, ConsoleScreen& screen, const TerminalMode& mode)
{
    switch (outcome.reason) {
    case ConsoleLoop::ExitReason::Signal:
        endBy(outcome.signal);
    case ConsoleLoop::ExitReason::Left:
        screen.output().writeSome();
        screen.output().drop(); // nobody waits for the screen
        if (mode.isTerminal()) screen.say(leftText(options, outcome));
        return ExitStatus::Done;
    case ConsoleLoop::ExitReason::Ended:
        screen.say(endText);
        return exitStatusOf(end);
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

/// Runs the session from opening to closing.
/// @param openEnd  by when it must be open
ExitStatus runSession(ConsoleConnection& connection, ConsoleScreen& screen, TerminalMode& mode,
                      const CommandOptions& options, std::chrono::steady_clock::time_point openEnd)
{
    SerialSession session = connection.console().openSerial(options.partition, options.serial, timeLeft(openEnd));
    ConsoleLoop::Outcome outcome;
    {
        // Signals are watched only while the terminal may have to be restored. At all other times they end this process
        // at once.
        SignalWatch signals(kSignals);
        ConsoleLoop loop(screen, STDIN_FILENO, mode, signals, options.inputOptions());
        outcome = loop.run(connection.console(), session, &connection.stream());
    }
    const SessionEnd end = session.getEnd();
    const std::string endText = session.describeEnd();
    if (outcome.reason == ConsoleLoop::ExitReason::Signal) {
        // The process ends without further requests; the hypervisor closes its sessions.
        if (mode.isTerminal()) connection.stream().cutAt(TimeProvider::steady() + kFarewell);
        connection.console().leave();
    } else {
        close(connection, session, screen, mode, options.connect.timeout());
    }
    return conclude(outcome, end, endText, options, screen, mode);
}

void addHandlers(Console& console, ConsoleScreen& screen)
{
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
        [&screen](const QelMessageDaxBroadcastOutboundAsync& broadcast) { screen.showBroadcast(broadcast); });
    console.onOtherNotice([](const QelMessage& notice) { logLine(LogLevel::Warn, "ignored ", notice.getLogID()); });
}

ExitStatus runConsole(const CommandOptions& options)
{
    startLogging(options.log, "qel-console.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // the terminal must be restored even when the output is closed
    TerminalMode mode(STDIN_FILENO);
    MessageStream messages(STDERR_FILENO);
    ConsoleScreen screen(STDOUT_FILENO, messages, ::isatty(STDERR_FILENO) == 1, mode);
    const auto openEnd = TimeProvider::steady() + options.connect.timeout();
    ConsoleConnection connection(options.connect, openEnd);
    addHandlers(connection.console(), screen);
    const auto leave = [&] {
        if (mode.isTerminal()) connection.stream().cutAt(TimeProvider::steady() + kFarewell);
        connection.console().leave();
    };
    try {
        return runSession(connection, screen, mode, options, openEnd);
    } catch (const StatusError& refusal) {
        leave();
        throw CommandFailure(ExitStatus::Refused,
                             refusalText(refusal.getResponse(), "partition " + std::to_string(options.partition)));
    } catch (const DeadlinePassed& error) {
        leave();
        throw CommandFailure(ExitStatus::DeadlinePassed, timeoutText(options.connect) + error.what());
    } catch (...) {
        leave();
        throw;
    }
}

void addEscape(CLI::App& command, CommandOptions& options)
{
    command
        .add_option("--escape", options.escape,
                    "On a terminal: the character that begins a command at the start of a line; ^X means a control "
                    "character")
        ->type_name("CHAR|none")
        ->check(CLI::Validator(checkEscape, ""))
        ->capture_default_str();
}

void addInputOptions(CLI::App& command, CommandOptions& options)
{
    command
        .add_option("--keepalive", options.keepAliveSeconds,
                    "Say so when the server has sent nothing for this long; it is asked for the time of day before. 0: "
                    "do not ask")
        ->type_name("SECONDS")
        ->check(numberIn(0.0, kMaxKeepAlive))
        ->capture_default_str();
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
    const auto options = std::make_shared<CommandOptions>();
    command.add_option("partition", options->partition, "Partition id")
        ->required()
        ->type_name("PARTITION")
        ->transform(integerIn(0, 65535));
    addConnectOptions(command, options->connect);
    describeOption(command, "--timeout",
                   "Timeout in seconds: one for connecting and opening the session, then one for each response and "
                   "for each message once it has begun");
    command.add_option("--connection", options->serial.connection, "Serial connection of the partition")
        ->type_name("N")
        ->transform(integerIn(0, 65535))
        ->capture_default_str();
    command.add_flag("--force", options->serial.force, "Take the session from the console that holds it");
    addEscape(command, *options);
    addInputOptions(command, *options);
    options->log.usual = LogLevel::Warn;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.footer(kFooter);
    command.callback([&action, options] {
        checkConnect(options->connect);
        action = [options] { return runConsole(*options); };
    });
    return command;
}

} // namespace qel::tool
