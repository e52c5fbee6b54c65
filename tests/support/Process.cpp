#include "support/Process.hpp"

#include <qel/common/util/UniqueFd.hpp>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <spawn.h>
#include <sstream>
#include <stdexcept>
#include <sys/wait.h>
#include <unistd.h>

namespace qel::test {

namespace {

struct Pipe {
    Pipe()
    {
        if (::pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
    }
    std::array<int, 2> ends{-1, -1};
    int readEnd() const { return ends[0]; }
    int writeEnd() const { return ends[1]; }
};

std::vector<std::string> environmentWith(const std::map<std::string, std::string>& more)
{
    std::vector<std::string> all;
    for (char** entry = environ; *entry != nullptr; ++entry) {
        const std::string text = *entry;
        if (more.count(text.substr(0, text.find('='))) == 0) all.push_back(text);
    }
    for (const auto& entry : more)
        all.push_back(entry.first + "=" + entry.second);
    return all;
}

std::vector<char*> pointers(std::vector<std::string>& texts)
{
    std::vector<char*> result;
    for (std::string& text : texts)
        result.push_back(text.data());
    result.push_back(nullptr);
    return result;
}

/// The descriptors, out of the way of those that they are to become, and closed in other programs.
std::vector<UniqueFd> outOfTheWay(const std::vector<int>& descriptors)
{
    constexpr int kFrom = 100;
    std::vector<UniqueFd> copies;
    for (const int descriptor : descriptors)
        copies.emplace_back(::fcntl(descriptor, F_DUPFD_CLOEXEC, kFrom));
    return copies;
}

pid_t spawn(std::vector<std::string> arguments, std::vector<std::string> environment, const Pipe& input,
            const Pipe& output, const Pipe& errors, const std::vector<int>& descriptors)
{
    const std::vector<UniqueFd> copies = outOfTheWay(descriptors);
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    ::posix_spawn_file_actions_init(&actions);
    ::posix_spawnattr_init(&attributes);
    ::posix_spawn_file_actions_adddup2(&actions, input.readEnd(), STDIN_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, output.writeEnd(), STDOUT_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, errors.writeEnd(), STDERR_FILENO);
    for (std::size_t i = 0; i < copies.size(); ++i)
        ::posix_spawn_file_actions_adddup2(&actions, copies[i].get(), STDERR_FILENO + 1 + static_cast<int>(i));
    sigset_t none;
    ::sigemptyset(&none);
    ::posix_spawnattr_setsigmask(&attributes, &none);
    // Whatever this process ignores, as all that nohup(1) or a shell starts in the background does, would be ignored
    // there.
    sigset_t all;
    ::sigfillset(&all);
    ::posix_spawnattr_setsigdefault(&attributes, &all);
    ::posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    pid_t pid = -1;
    const int error = ::posix_spawn(&pid, arguments.at(0).c_str(), &actions, &attributes, pointers(arguments).data(),
                                    pointers(environment).data());
    ::posix_spawnattr_destroy(&attributes);
    ::posix_spawn_file_actions_destroy(&actions);
    if (error != 0) throw std::runtime_error("cannot start " + arguments.at(0) + ": " + std::strerror(error));
    return pid;
}

/// Reads what is there. @return false: the stream has ended
bool readSome(int fd, std::string& text)
{
    std::array<char, 65536> buffer;
    const ssize_t count = ::read(fd, buffer.data(), buffer.size());
    if (count > 0) text.assign(buffer.data(), static_cast<std::size_t>(count));
    return count > 0 || (count < 0 && errno == EINTR);
}

} // namespace

Process::Process(const std::vector<std::string>& arguments, const std::map<std::string, std::string>& environment,
                 const std::vector<int>& descriptors)
{
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // a process that does not read must not end the test
    const Pipe input;
    const Pipe output;
    const Pipe errors;
    mPid = spawn(arguments, environmentWith(environment), input, output, errors, descriptors);
    ::close(input.readEnd());
    ::close(output.writeEnd());
    ::close(errors.writeEnd());
    mInput = input.writeEnd();
    mOutput = output.readEnd();
    mErrors = errors.readEnd();
    mCollector = std::thread([this] { collect(); });
}

Process::~Process()
{
    if (!mReaped) {
        ::kill(mPid, SIGKILL);
        ::waitpid(mPid, nullptr, 0);
    }
    closeInput();
    mCollector.join();
    ::close(mOutput);
    ::close(mErrors);
}

void Process::writeInput(const std::string& bytes)
{
    std::size_t written = 0;
    while (written < bytes.size()) {
        const ssize_t count = ::write(mInput, bytes.data() + written, bytes.size() - written);
        if (count < 0 && errno == EPIPE) return; // it does not want to know
        if (count < 0) fail("cannot write to standard input");
        written += static_cast<std::size_t>(count);
    }
}

void Process::closeInput()
{
    if (mInput >= 0) ::close(mInput);
    mInput = -1;
}

void Process::signal(int number) const
{
    ::kill(mPid, number);
    if (number != SIGSTOP) return;
    siginfo_t info{};
    while (::waitid(P_PID, static_cast<id_t>(mPid), &info, WSTOPPED | WNOWAIT) != 0 && errno == EINTR) {
    }
}

std::string Process::output() const
{
    const std::lock_guard<std::mutex> lock(mMutex);
    return mOutputText;
}

std::string Process::errors() const
{
    const std::lock_guard<std::mutex> lock(mMutex);
    return mErrorText;
}

std::string Process::readLine()
{
    std::unique_lock<std::mutex> lock(mMutex);
    const auto hasLine = [this] { return mOutputText.find('\n', mLinesTaken) != std::string::npos; };
    mChanged.wait_for(lock, kDeadline, [&] { return hasLine() || mDrained; });
    if (!hasLine()) {
        lock.unlock();
        fail("no line");
    }
    const std::size_t end = mOutputText.find('\n', mLinesTaken);
    const std::string line = mOutputText.substr(mLinesTaken, end - mLinesTaken);
    mLinesTaken = end + 1;
    return line;
}

void Process::awaitOutput(const std::string& text) const { awaitText(&Process::mOutputText, text); }

void Process::awaitErrors(const std::string& text) const { awaitText(&Process::mErrorText, text); }

void Process::awaitText(const std::string Process::*stream, const std::string& text) const
{
    std::unique_lock<std::mutex> lock(mMutex);
    const auto hasText = [&] { return (this->*stream).find(text) != std::string::npos; };
    mChanged.wait_for(lock, kDeadline, [&] { return hasText() || mDrained; });
    const bool found = hasText();
    lock.unlock();
    if (!found) fail("'" + text + "' did not come");
}

Process::Result Process::wait()
{
    if (mReaped) return mResult;
    const auto end = std::chrono::steady_clock::now() + kDeadline;
    int status = 0;
    while (::waitpid(mPid, &status, WNOHANG) != mPid) {
        if (std::chrono::steady_clock::now() > end) fail("did not end");
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    mReaped = true;
    std::unique_lock<std::mutex> lock(mMutex);
    mChanged.wait_until(lock, end, [this] { return mDrained; });
    mResult.exitStatus = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    mResult.signal = WIFSIGNALED(status) ? WTERMSIG(status) : 0;
    mResult.output = mOutputText;
    mResult.errors = mErrorText;
    return mResult;
}

std::size_t Process::descriptors() const
{
    namespace fs = std::filesystem;
    const fs::path directory = "/proc/" + std::to_string(mPid) + "/fd";
    return static_cast<std::size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

std::size_t Process::children() const
{
    std::size_t children = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        std::ifstream stat(entry.path() / "stat");
        std::string text;
        if (!std::getline(stat, text)) continue; // not a process, or one that has just ended
        // After the name, which is in parentheses and may contain anything: the state and the parent. See proc(5).
        std::istringstream rest(text.substr(text.rfind(')') + 1));
        std::string state;
        pid_t parent = 0;
        rest >> state >> parent;
        if (parent == mPid) ++children;
    }
    return children;
}

std::size_t Process::residentBytes() const
{
    std::ifstream statm("/proc/" + std::to_string(mPid) + "/statm");
    std::size_t total = 0;
    std::size_t resident = 0;
    statm >> total >> resident;
    return resident * static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
}

void Process::collect()
{
    std::array<pollfd, 2> fds{pollfd{mOutput, POLLIN, 0}, pollfd{mErrors, POLLIN, 0}};
    const std::array<std::string Process::*, 2> texts{&Process::mOutputText, &Process::mErrorText};
    while (fds[0].fd >= 0 || fds[1].fd >= 0) {
        if (::poll(fds.data(), fds.size(), -1) < 0) continue;
        for (std::size_t i = 0; i < fds.size(); ++i) {
            if (fds[i].fd < 0 || fds[i].revents == 0) continue;
            std::string text;
            if (!readSome(fds[i].fd, text)) fds[i].fd = -1;
            const std::lock_guard<std::mutex> lock(mMutex);
            this->*texts[i] += text;
            mChanged.notify_all();
        }
    }
    const std::lock_guard<std::mutex> lock(mMutex);
    mDrained = true;
    mChanged.notify_all();
}

void Process::fail(const std::string& what) const
{
    std::ostringstream text;
    text << "process " << mPid << ": " << what << "\n--- output:\n" << output() << "\n--- errors:\n" << errors();
    throw std::runtime_error(text.str());
}

Process::Result run(const std::vector<std::string>& arguments, const std::string& input)
{
    Process process(arguments);
    process.writeInput(input);
    process.closeInput();
    return process.wait();
}

} // namespace qel::test
