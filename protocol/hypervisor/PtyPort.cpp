#include "hypervisor/PtyPort.hpp"

#include <qel/common/util/PosixError.hpp>

#include "hypervisor/CommandEnvironment.hpp"

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <spawn.h>
#include <sys/ioctl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>

namespace qel::protocol {

namespace {

[[noreturn]] void fail(int error, const char* what) { throw PosixError(error, what); }

void check(int error, const char* what)
{
    if (error != 0) fail(error, what);
}

UniqueFd openMaster()
{
    UniqueFd master(::posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC));
    if (master.get() < 0) fail(errno, "cannot open a pseudo-terminal");
    if (::grantpt(master.get()) != 0) fail(errno, "cannot grant a pseudo-terminal");
    if (::unlockpt(master.get()) != 0) fail(errno, "cannot unlock a pseudo-terminal");
    if (::fcntl(master.get(), F_SETFL, O_RDWR | O_NONBLOCK) != 0) fail(errno, "cannot set up a pseudo-terminal");
    winsize size{};
    size.ws_row = 24;
    size.ws_col = 80;
    if (::ioctl(master.get(), TIOCSWINSZ, &size) != 0) fail(errno, "cannot size a pseudo-terminal");
    return master;
}

std::string slaveName(int master)
{
    std::array<char, 128> name{};
    check(::ptsname_r(master, name.data(), name.size()), "cannot name a pseudo-terminal");
    return name.data();
}

/// posix_spawn_file_actions_t with an owner.
struct SpawnActions {
    SpawnActions() { check(::posix_spawn_file_actions_init(&value), "cannot prepare a command"); }
    ~SpawnActions() { ::posix_spawn_file_actions_destroy(&value); }
    SpawnActions(const SpawnActions&) = delete;
    SpawnActions& operator=(const SpawnActions&) = delete;

    posix_spawn_file_actions_t value{};
};

/// posix_spawnattr_t with an owner.
struct SpawnAttributes {
    SpawnAttributes() { check(::posix_spawnattr_init(&value), "cannot prepare a command"); }
    ~SpawnAttributes() { ::posix_spawnattr_destroy(&value); }
    SpawnAttributes(const SpawnAttributes&) = delete;
    SpawnAttributes& operator=(const SpawnAttributes&) = delete;

    posix_spawnattr_t value{};
};

void setTerminal(SpawnActions& actions, const std::string& terminal)
{
    // A terminal that the leader of a new session opens becomes its controlling terminal.
    constexpr const char* kFailure = "cannot prepare the terminal of a command";
    check(::posix_spawn_file_actions_addopen(&actions.value, STDIN_FILENO, terminal.c_str(), O_RDWR, 0), kFailure);
    check(::posix_spawn_file_actions_adddup2(&actions.value, STDIN_FILENO, STDOUT_FILENO), kFailure);
    check(::posix_spawn_file_actions_adddup2(&actions.value, STDIN_FILENO, STDERR_FILENO), kFailure);
}

void setSignals(SpawnAttributes& attributes)
{
    // This program blocks and ignores signals for which a command expects the default action.
    constexpr const char* kFailure = "cannot prepare the signals of a command";
    constexpr int kFlags = POSIX_SPAWN_SETSID | POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
    sigset_t none;
    sigset_t all;
    ::sigemptyset(&none);
    ::sigfillset(&all);
    check(::posix_spawnattr_setsigmask(&attributes.value, &none), kFailure);
    check(::posix_spawnattr_setsigdefault(&attributes.value, &all), kFailure);
    check(::posix_spawnattr_setflags(&attributes.value, static_cast<short>(kFlags)), kFailure);
}

/// Starts the command on a terminal. Not by fork: the child would inherit locks that other threads of this program
/// hold, without the threads that release them.
pid_t spawn(const std::string& command, std::vector<std::string> environment, const std::string& terminal)
{
    SpawnActions actions;
    SpawnAttributes attributes;
    setTerminal(actions, terminal);
    setSignals(attributes);
    std::string shell = "/bin/sh";
    std::string option = "-c";
    std::string text = command;
    std::array<char*, 4> arguments{shell.data(), option.data(), text.data(), nullptr};
    std::vector<char*> variables;
    variables.reserve(environment.size() + 1);
    for (std::string& variable : environment)
        variables.push_back(variable.data());
    variables.push_back(nullptr);
    pid_t pid = -1;
    check(::posix_spawn(&pid, shell.c_str(), &actions.value, &attributes.value, arguments.data(), variables.data()),
          "cannot start a command");
    return pid;
}

bool isTransient(int error) { return error == EAGAIN || error == EINTR; }

} // namespace

PtyPort::PtyPort(std::string command, std::shared_ptr<ChildReaper> reaper, std::vector<std::string> environment)
    : mCommand(std::move(command)), mEnvironment(std::move(environment)), mReaper(std::move(reaper))
{}

PtyPort::~PtyPort() { stop(); }

void PtyPort::start(std::uint16_t partition)
{
    if (mMaster.get() >= 0) {
        if (!commandEnd()) return;
        stop();
    }
    UniqueFd master = openMaster();
    std::vector<std::string> environment = mEnvironment;
    setVariable(environment, "QEL_PARTITION=" + std::to_string(partition));
    mLeader = spawn(mCommand, std::move(environment), slaveName(master.get()));
    mMaster = std::move(master);
}

std::optional<CommandEnd> PtyPort::commandEnd()
{
    if (mLeader < 0) return CommandEnd();
    siginfo_t info{};
    // Without reaping it: while the process is there, its number cannot come to mean another process group, and stop()
    // can end what the command has left in its group.
    if (::waitid(P_PID, static_cast<id_t>(mLeader), &info, WEXITED | WNOHANG | WNOWAIT) != 0) {
        mLeader = -1; // the system has reaped it, as where SIGCHLD is ignored
        return CommandEnd();
    }
    if (info.si_pid == 0) return std::nullopt;
    CommandEnd end;
    end.kind = info.si_code == CLD_EXITED ? CommandEnd::Kind::Exited : CommandEnd::Kind::Killed;
    end.number = static_cast<std::uint8_t>(info.si_status);
    return end;
}

SerialLine::ReadResult PtyPort::read(char* buffer, std::size_t length)
{
    const ssize_t count = ::read(mMaster.get(), buffer, length);
    const int error = errno;
    if (count > 0) return {LineState::Data, static_cast<std::size_t>(count)};
    if (count < 0 && isTransient(error)) return {LineState::Idle, 0};
    return {LineState::Ended, 0}; // EIO once the command's side is closed and all output is read
}

std::size_t PtyPort::write(const char* data, std::size_t length)
{
    const ssize_t count = ::write(mMaster.get(), data, length);
    const int error = errno;
    if (count >= 0) return static_cast<std::size_t>(count);
    if (isTransient(error)) return 0;
    throw PosixError(error, "cannot write to the serial line");
}

int PtyPort::descriptor() const { return mMaster.get(); }

void PtyPort::stop()
{
    mMaster.reset(); // hangs up
    if (mLeader > 0) mReaper->adopt(mLeader);
    mLeader = -1;
}

} // namespace qel::protocol
