#include "console/ConsoleCommand.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/UsageErrors.hpp"
#include "client/ConnectOptions.hpp"
#include "console/ConsoleRun.hpp"
#include "console/ConsoleTexts.hpp"
#include "console/EscapeFilter.hpp"
#include "console/Profiles.hpp"
#include "console/TypedText.hpp"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr double kMaxLinger = 24 * 60 * 60;
constexpr double kMaxKeepAlive = 24 * 60 * 60;
constexpr std::size_t kMaxCommand = 2048; // a terminal takes lines of 4095 bytes, and quotes take room

constexpr const char* kFooter = R"(
On a terminal, "~." at the start of a line leaves the session and "~?" lists the other commands. Input that is not a
terminal is sent as it is: echo 'uname -srm' | qel console ... PARTITION. At the end of such input the console sends an
end-of-file character (control-D), repeats it after each second without output, and prints all output until the
partition's command ends. The output includes the echo of the input if the partition echoes it, as terminals do.

A server that is used often gets a profile, and its partitions names: see qel list --help.

--send, --expect and --exec are done in the order in which they are given, instead of reading the input, and the console
leaves after the last one: qel console ... --send '\r' --expect 'login:' 3. In TEXT, \r, \n, \t, \e, \\ and \xHH stand
for the characters that they usually mean. A regular expression is a POSIX extended one.

Exit status: 0 the command ended with 0, or you left; 1 a request was refused, the server has the wrong certificate, or
another console took the session; 2 usage error; 3 cannot connect; 4 failure on this machine; 5 the server broke the
protocol; 6 timeout; 7 the server shut down or the connection was lost; 8 the partition's command failed, or --send and
--expect could not be finished. With --exec: the exit status of the first command that failed, or 0; when the console
itself has failed, the above and 240, such as 243 for cannot connect, except for 2.)";

struct CommandOptions {
    std::string target; ///< the partition as it was given
    ConsoleRunOptions run;
    LogOptions log;
    bool noEof = false;
    double keepAliveSeconds = 15;
    std::string escape = "~";
    std::string stamps;
    std::optional<double> lingerSeconds;
    std::vector<std::string> sends, expects, commands; // see stepsOf()

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
        return filled(texts::kNotAnEscape, {tool::quoted(text)});
    }
    if (EscapeFilter::isCommandCharacter(*parseEscape(text)))
        return filled(texts::kEscapeIsCommand, {tool::quoted(text)});
    return {};
}

std::chrono::milliseconds inMilliseconds(double seconds)
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(seconds));
}

InputOptions CommandOptions::inputOptions() const
{
    InputOptions options;
    options.escape = parseEscape(escape);
    options.keepAlive = inMilliseconds(keepAliveSeconds);
    const bool isWatching = run.watch || run.serial.connection != 0; // and its input is not passed on
    options.sendsEnd = !noEof && !isWatching;
    options.partitionName = run.name;
    if (lingerSeconds) options.linger = inMilliseconds(*lingerSeconds);
    return options;
}

std::string checkTarget(std::string& text)
{
    constexpr std::uint64_t kMaxPartition = 65535;
    const bool isName = namesProfile(text) || text.find_first_of("-0123456789") != 0;
    return isName ? std::string() : integerIn(0, kMaxPartition)(text); // for names see findPartition()
}

/// Reads the partition, and the profile that the command line names.
void findPartition(CLI::App& command, CommandOptions& options)
{
    if (namesProfile(options.target)) {
        options.run.partition = applyProfile(options.target, readProfiles(profilesPath()), command);
        options.run.name = options.target;
    } else if (const auto number = parseInteger(options.target)) {
        options.run.partition = static_cast<std::uint16_t>(*number);
    } else {
        failNoPartition(options.target, readProfiles(profilesPath()));
    }
}

TimeStamps::Style styleOf(const std::string& name)
{
    if (name == "iso") return TimeStamps::Style::Iso;
    return name == "delta" ? TimeStamps::Style::Delta : TimeStamps::Style::Off;
}

/// The steps in the order in which they were given.
std::vector<ScriptStep> stepsOf(const CLI::App& command, const CommandOptions& options)
{
    using Kind = ScriptStep::Kind;
    std::vector<ScriptStep> steps;
    std::size_t sends = 0;
    std::size_t expects = 0;
    std::size_t commands = 0;
    for (const CLI::Option* option : command.parse_order()) {
        if (option->check_lname("send")) steps.push_back({Kind::Send, *parseTypedText(options.sends.at(sends++))});
        if (option->check_lname("expect")) steps.push_back({Kind::Expect, options.expects.at(expects++)});
        if (option->check_lname("exec")) steps.push_back({Kind::Exec, options.commands.at(commands++)});
    }
    return steps;
}

/// With --exec the exit status is that of the command. Those of this program are then moved out of its way, to where
/// hardly any command has its own.
ExitStatus besideCommand(ExitStatus own)
{
    constexpr int kOffset = 240;
    return ExitStatus{kOffset + static_cast<int>(own)};
}

ExitStatus runCommands(ConsoleRun& run)
{
    try {
        const ExitStatus own = run.run();
        return own == ExitStatus::Done ? ExitStatus{run.commandStatus().value_or(0)} : besideCommand(own);
    } catch (const std::bad_alloc&) {
        throw;
    } catch (const std::exception& error) {
        throw CommandFailure(besideCommand(exitStatusOf(error)), userMessage(error));
    }
}

ExitStatus runConsole(const CommandOptions& options)
{
    startLogging(options.log, "qel-console.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // the terminal must be restored even when the output is closed
    ConsoleRun run(options.run);
    return options.commands.empty() ? run.run() : runCommands(run);
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
    command.add_flag("--no-eof", options.noEof, "Do not send an end-of-file character at the end of the input");
    command
        .add_option("--linger", options.lingerSeconds,
                    "After the end of the input, leave once the partition has sent nothing for this long; the "
                    "end-of-file character is then sent only once (default: wait for the command to end)")
        ->type_name("SECONDS")
        ->check(numberIn(0.0, kMaxLinger));
}

void addSessionOptions(CLI::App& command, CommandOptions& options)
{
    CLI::Option* const connection = command.add_option("--connection", options.run.serial.connection,
                                                       "Serial connection of the partition: 0 types, 1 to 15 watch");
    connection->type_name("N")->transform(integerIn(0, 65535))->capture_default_str();
    CLI::Option* const force =
        command.add_flag("--force", options.run.serial.force, "Take the session from the console that holds it");
    command.add_flag("--watch", options.run.watch, "Watch what the partition puts out, and type nothing")
        ->excludes(connection)
        ->excludes(force);
    command.add_flag("--reconnect", options.run.reconnect,
                     "When the connection is lost, connect again, after 1 second at first and 30 at most");
    command
        .add_option("--keepalive", options.keepAliveSeconds,
                    "Say so when the server has sent nothing for this long; it is asked for the time of day before. 0: "
                    "do not ask")
        ->type_name("SECONDS")
        ->check(numberIn(0.0, kMaxKeepAlive))
        ->capture_default_str();
}

void addFileOptions(CLI::App& command, CommandOptions& options)
{
    command.add_option("--log", options.run.log, "Append the output of the partition to this file, as it is")
        ->type_name("FILE");
    command
        .add_option("--log-strip", options.run.logStrip,
                    "Append the output to this file without control sequences, with --timestamps in front of each line")
        ->type_name("FILE");
    command
        .add_option("--timestamps", options.stamps,
                    "The time in front of each line: in UTC, or since the line before; ~t changes it")
        ->type_name("iso|delta")
        ->check(oneOf({"iso", "delta"}));
    command.add_option("--record", options.run.record, "Record the output in this file, in the format asciicast v2")
        ->type_name("FILE");
}

void addScriptOptions(CLI::App& command, CommandOptions& options)
{
    command.add_option("--send", options.sends, "Type this text; may be repeated, as the next two")
        ->type_name("TEXT")
        ->allow_extra_args(false)
        ->check(CLI::Validator(checkTypedText, ""));
    command.add_option("--expect", options.expects, "Wait until the output matches; at most --timeout")
        ->type_name("REGEX")
        ->allow_extra_args(false)
        ->check(CLI::Validator(checkPattern, ""));
    command
        .add_option("--exec", options.commands,
                    "Run a command with sh -c at the shell of the partition, print only its output, and end with its "
                    "exit status; at most --timeout")
        ->type_name("COMMAND")
        ->allow_extra_args(false)
        ->check(textUpTo(kMaxCommand));
}

/// One file for two purposes would be emptied by a recording, or written to by both.
void checkFiles(const ConsoleRunOptions& run)
{
    const std::pair<const char*, const std::string&> files[] = {
        {"--log", run.log}, {"--log-strip", run.logStrip}, {"--record", run.record}};
    for (const auto* file = std::begin(files); file != std::end(files); ++file) {
        const auto* const same =
            std::find_if(std::begin(files), file, [file](const auto& other) { return other.second == file->second; });
        if (same != file && !file->second.empty())
            throw CommandFailure(ExitStatus::Usage, filled(texts::kSameFile, {same->first, file->first}));
    }
}

/// The help has many options; each group is what a user looks for at a time.
void groupOptions(CLI::App& command)
{
    static const std::pair<const char*, std::vector<const char*>> kGroups[] = {
        {"Session", {"connection", "force", "watch", "reconnect", "keepalive", "escape", "no-eof", "linger"}},
        {"Files", {"log", "log-strip", "timestamps", "record"}},
        {"Without a person", {"send", "expect", "exec"}},
        {"Log of this program", {"log-dir", "log-level", "log-size"}},
    };
    for (const auto& group : kGroups) {
        for (const char* name : group.second)
            findOption(command, name)->group(group.first);
    }
}

} // namespace

CLI::App& addConsoleCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "console", "Connect the terminal to the serial console of a partition");
    const auto options = std::make_shared<CommandOptions>();
    command.add_option("partition", options->target, "Partition id, or a name from the profiles, as qel list shows it")
        ->required()
        ->type_name("PARTITION|PROFILE/PARTITION")
        ->transform(CLI::Validator(checkTarget, ""));
    addConnectOptions(command, options->run.connect);
    findOption(command, "connect")->required(false); // a profile may give it
    describeOption(command, "--timeout",
                   "Timeout in seconds: one for connecting and opening the session, then one for each response, for "
                   "each message once it has begun, and for --expect and --exec");
    addSessionOptions(command, *options);
    addEscape(command, *options);
    addInputOptions(command, *options);
    addFileOptions(command, *options);
    addScriptOptions(command, *options);
    options->log.usual = LogLevel::Warn;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    groupOptions(command);
    command.footer(kFooter);
    command.callback([&action, &command, options] {
        findPartition(command, *options);
        checkConnect(options->run.connect);
        checkFiles(options->run);
        options->run.input = options->inputOptions();
        options->run.stamps = styleOf(options->stamps);
        options->run.steps = stepsOf(command, *options);
        action = [options] { return runConsole(*options); };
    });
    return command;
}

} // namespace qel::tool
