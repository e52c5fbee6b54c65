#include "support/PtyProcess.hpp"

#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sstream>
#include <stdexcept>
#include <sys/wait.h>
#include <unistd.h>

namespace qel::test {

namespace {

/// The leader of a session that opens a terminal gets it as its controlling one.
pid_t spawn(std::vector<std::string> arguments, const std::string& terminal)
{
    std::vector<char*> pointers;
    for (std::string& argument : arguments)
        pointers.push_back(argument.data());
    pointers.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    ::posix_spawn_file_actions_init(&actions);
    ::posix_spawnattr_init(&attributes);
    ::posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, terminal.c_str(), O_RDWR, 0);
    ::posix_spawn_file_actions_adddup2(&actions, STDIN_FILENO, STDOUT_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, STDIN_FILENO, STDERR_FILENO);
    sigset_t none;
    sigset_t all;
    ::sigemptyset(&none);
    ::sigfillset(&all);
    ::posix_spawnattr_setsigmask(&attributes, &none);
    ::posix_spawnattr_setsigdefault(&attributes, &all);
    constexpr int kFlags = POSIX_SPAWN_SETSID | POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
    ::posix_spawnattr_setflags(&attributes, static_cast<short>(kFlags));
    pid_t pid = -1;
    const int error = ::posix_spawn(&pid, pointers.at(0), &actions, &attributes, pointers.data(), environ);
    ::posix_spawnattr_destroy(&attributes);
    ::posix_spawn_file_actions_destroy(&actions);
    if (error != 0) throw std::runtime_error("cannot start " + arguments.at(0) + ": " + std::strerror(error));
    return pid;
}

} // namespace

PtyProcess::PtyProcess(const std::vector<std::string>& arguments)
{
    if (::pipe2(mStop, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
    mPid = spawn(arguments, mPty.name());
    mCollector = std::thread([this] { collect(); });
}

PtyProcess::~PtyProcess()
{
    if (!mReaped) {
        ::kill(mPid, SIGKILL);
        ::waitpid(mPid, nullptr, 0);
    }
    ::close(mStop[1]);
    mCollector.join();
    ::close(mStop[0]);
}

void PtyProcess::signal(int number) const
{
    if (::kill(mPid, number) != 0) fail("cannot be sent a signal");
}

void PtyProcess::await(const std::string& text)
{
    std::unique_lock<std::mutex> lock(mMutex);
    std::size_t found = std::string::npos;
    mChanged.wait_for(lock, kDeadline, [&] {
        found = mScreen.find(text, mSeen);
        return found != std::string::npos || mDrained;
    });
    if (found != std::string::npos) mSeen = found + text.size();
    lock.unlock();
    if (found == std::string::npos) fail("'" + text + "' did not come");
}

std::string PtyProcess::screen() const
{
    const std::lock_guard<std::mutex> lock(mMutex);
    return mScreen;
}

PtyProcess::Result PtyProcess::wait()
{
    if (mReaped) return mResult;
    const auto end = std::chrono::steady_clock::now() + kDeadline;
    int status = 0;
    while (::waitpid(mPid, &status, WNOHANG) != mPid) {
        if (std::chrono::steady_clock::now() > end) fail("did not end");
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    mReaped = true;
    mPty.closeSlave(); // so that the screen ends
    std::unique_lock<std::mutex> lock(mMutex);
    const bool isDrained = mChanged.wait_until(lock, end, [this] { return mDrained; });
    lock.unlock();
    if (!isDrained) fail("ended, but another process holds its terminal");
    mResult.exitStatus = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    mResult.signal = WIFSIGNALED(status) ? WTERMSIG(status) : 0;
    mResult.screen = screen();
    return mResult;
}

void PtyProcess::collect()
{
    std::array<pollfd, 2> fds{pollfd{mPty.master(), POLLIN, 0}, pollfd{mStop[0], POLLIN, 0}};
    for (;;) {
        if (::poll(fds.data(), fds.size(), -1) < 0) continue;
        if (fds[1].revents != 0) break;
        std::array<char, 4096> buffer;
        const ssize_t count = ::read(mPty.master(), buffer.data(), buffer.size());
        if (count <= 0) break;
        const std::lock_guard<std::mutex> lock(mMutex);
        mScreen.append(buffer.data(), static_cast<std::size_t>(count));
        mChanged.notify_all();
    }
    const std::lock_guard<std::mutex> lock(mMutex);
    mDrained = true;
    mChanged.notify_all();
}

void PtyProcess::fail(const std::string& what) const
{
    std::ostringstream text;
    text << "process " << mPid << ": " << what << "\n--- screen:\n" << screen();
    throw std::runtime_error(text.str());
}

} // namespace qel::test
