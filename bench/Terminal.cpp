#include "Terminal.hpp"

#include <array>
#include <cerrno>
#include <csignal>
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <stdexcept>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <system_error>
#include <termios.h>
#include <unistd.h>

namespace qel::bench {

namespace {

using std::chrono::steady_clock;

constexpr int kSilence = 200; // milliseconds
constexpr char kKey = 'x';
constexpr std::chrono::seconds kDeadline(20);

[[noreturn]] void fail(const char* what) { throw std::system_error(errno, std::generic_category(), what); }

pid_t forkThis()
{
    const pid_t child = ::fork();
    if (child < 0) fail("fork");
    if (child == 0) ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    return child;
}

void end(pid_t process)
{
    ::kill(process, SIGKILL);
    while (::waitpid(process, nullptr, 0) < 0 && errno == EINTR)
        continue;
}

[[noreturn]] void execute(const std::vector<std::string>& command, int input, int output)
{
    std::vector<char*> arguments;
    for (const std::string& argument : command)
        arguments.push_back(const_cast<char*>(argument.c_str()));
    arguments.push_back(nullptr);
    const int nothing = ::open("/dev/null", O_RDWR);
    ::dup2(input < 0 ? nothing : input, STDIN_FILENO);
    ::dup2(output, STDOUT_FILENO);
    ::dup2(nothing, STDERR_FILENO);
    ::execvp(arguments[0], arguments.data());
    ::_exit(127);
}

std::string joined(const std::vector<std::string>& command)
{
    std::string text;
    for (const std::string& argument : command)
        text += argument + ' ';
    return text;
}

} // namespace

BusyCores::BusyCores()
{
    cpu_set_t allowed;
    CPU_ZERO(&allowed);
    if (::sched_getaffinity(0, sizeof(allowed), &allowed) != 0) fail("sched_getaffinity");
    int left = CPU_COUNT(&allowed) - 1; // the last one is for the caller
    for (int core = 0; core < CPU_SETSIZE && left > 0; ++core) {
        if (!CPU_ISSET(core, &allowed)) continue;
        --left;
        const pid_t child = forkThis();
        if (child != 0) {
            mSpinners.push_back(child);
            continue;
        }
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(core, &one);
        ::sched_setaffinity(0, sizeof(one), &one);
        // Not SCHED_IDLE: a core that does nothing else counts as idle, and is given those threads.
        static_cast<void>(::nice(19));
        for (volatile unsigned int turns = 0;; turns = turns + 1)
            continue;
    }
}

BusyCores::~BusyCores()
{
    for (const pid_t spinner : mSpinners)
        end(spinner);
}

double secondsToReceive(const std::vector<std::string>& command, std::size_t bytes)
{
    std::array<int, 2> pipe{};
    if (::pipe2(pipe.data(), O_CLOEXEC) != 0) fail("pipe2");
    const auto start = steady_clock::now();
    const pid_t child = forkThis();
    if (child == 0) execute(command, -1, pipe[1]);
    ::close(pipe[1]);
    std::array<char, 64 * 1024> buffer;
    std::size_t received = 0;
    ssize_t count = 0;
    while ((count = ::read(pipe[0], buffer.data(), buffer.size())) > 0 || (count < 0 && errno == EINTR))
        received += count > 0 ? static_cast<std::size_t>(count) : 0;
    const std::chrono::duration<double> seconds = steady_clock::now() - start;
    ::close(pipe[0]);
    end(child);
    if (received != bytes)
        throw std::runtime_error(joined(command) + "has written " + std::to_string(received) + " bytes");
    return seconds.count();
}

EchoedKeys::EchoedKeys(const std::vector<std::string>& command)
{
    termios raw = mTerminal.attributes();
    ::cfmakeraw(&raw);
    mTerminal.setAttributes(raw);
    mPid = forkThis();
    if (mPid == 0) {
        ::setsid();
        execute(command, mTerminal.slave(), mTerminal.slave());
    }
    std::string screen;
    const auto giveUp = steady_clock::now() + kDeadline;
    while (screen.find(kKey) == std::string::npos) {
        mTerminal.type({kKey});
        std::array<char, 1024> buffer;
        pollfd fd{mTerminal.master(), POLLIN, 0};
        if (::poll(&fd, 1, kSilence) > 0) {
            const ssize_t count = ::read(fd.fd, buffer.data(), buffer.size());
            if (count > 0) screen.append(buffer.data(), static_cast<std::size_t>(count));
        }
        if (steady_clock::now() < giveUp) continue;
        end(mPid);
        throw std::runtime_error(joined(command) + "does not come up, its terminal shows: " + screen);
    }
    pAwaitSilence();
}

EchoedKeys::~EchoedKeys() { end(mPid); }

double EchoedKeys::type() const
{
    char echo = 0;
    const auto start = steady_clock::now();
    if (::write(mTerminal.master(), &kKey, 1) != 1 || ::read(mTerminal.master(), &echo, 1) != 1) fail("terminal");
    const std::chrono::duration<double, std::micro> time = steady_clock::now() - start;
    if (echo != kKey) throw std::runtime_error("a key comes back as another one");
    return time.count();
}

void EchoedKeys::pAwaitSilence() const
{
    std::array<char, 1024> buffer;
    pollfd fd{mTerminal.master(), POLLIN, 0};
    while (::poll(&fd, 1, kSilence) > 0) {
        if (::read(fd.fd, buffer.data(), buffer.size()) <= 0) fail("terminal");
    }
}

} // namespace qel::bench
