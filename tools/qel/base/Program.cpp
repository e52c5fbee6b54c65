#include "base/Program.hpp"

#include "base/Failures.hpp"
#include "base/UsageErrors.hpp"

#include <cerrno>
#include <cstdio>
#include <exception>
#include <fcntl.h>
#include <iostream>
#include <new>
#include <string>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr const char* kName = "qel";
constexpr const char* kDescription = "Server and console of the QEL management protocol";
constexpr const char* kVersionText = "qel " QEL_PROGRAM_VERSION;

ExitStatus report(const std::exception& error) noexcept
{
    if (dynamic_cast<const std::bad_alloc*>(&error) == nullptr) {
        try {
            std::cerr << "qel: " << userMessage(error) << std::endl;
            return exitStatusOf(error);
        } catch (const std::exception&) { // no memory for the reason
        }
    }
    static_cast<void>(std::fputs("qel: out of memory\n", stderr)); // allocates nothing
    return ExitStatus::Failed;
}

ExitStatus parseAndRun(AddCommands addCommands, int argc, const char* const* argv)
{
    CLI::App app(kDescription, kName);
    Action action;
    addStandardFlags(app);
    app.require_subcommand(1);
    addCommands(app, action);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        if (error.get_exit_code() != 0) {
            std::cerr << "qel: " << usageMessage(app, error) << std::endl;
            return ExitStatus::Usage;
        }
        app.exit(error); // prints the help or the version
        flushOutput();
        return ExitStatus::Done;
    }
    const ExitStatus status = action ? action() : ExitStatus::Usage;
    flushOutput();
    return status;
}

} // namespace

void addStandardFlags(CLI::App& app)
{
    app.set_help_flag("-h,--help", "Print this help and exit");
    app.set_version_flag("--version", kVersionText);
}

void addJsonOption(CLI::App& app, bool& json)
{
    app.add_flag("--json", json, "Print one JSON document instead of text");
}

CLI::App& addCommand(CLI::App& parent, const char* name, const char* description)
{
    CLI::App* const command = parent.add_subcommand(name, description);
    addStandardFlags(*command);
    return *command;
}

int runProgram(AddCommands addCommands, int argc, const char* const* argv) noexcept
{
    reserveStandardDescriptors();
    ExitStatus status = ExitStatus::Failed;
    try {
        status = parseAndRun(addCommands, argc, argv);
    } catch (const std::exception& error) {
        status = report(error);
    }
    return static_cast<int>(status);
}

void reserveStandardDescriptors() noexcept
{
    for (int descriptor = STDIN_FILENO; descriptor <= STDERR_FILENO; ++descriptor) {
        if (::fcntl(descriptor, F_GETFD) != -1) continue;
        // open() returns the lowest free descriptor, which is this one. The access mode is the wrong one on purpose:
        // using the descriptor fails, as it did while it was closed.
        static_cast<void>(::open("/dev/null", descriptor == STDIN_FILENO ? O_WRONLY : O_RDONLY));
    }
}

void flushOutput()
{
    std::cout.flush();
    if (std::cout && std::fflush(stdout) == 0) return;
    throw CommandFailure(ExitStatus::Failed, "cannot write to standard output");
}

} // namespace qel::tool
