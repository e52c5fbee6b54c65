#include "base/SignalWatch.hpp"

#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <sys/signalfd.h>
#include <unistd.h>

namespace qel::tool {

SignalWatch::SignalWatch(std::initializer_list<int> signals)
{
    sigset_t set;
    ::sigemptyset(&set);
    for (const int number : signals)
        ::sigaddset(&set, number);
    mFd = UniqueFd(::signalfd(-1, &set, SFD_NONBLOCK | SFD_CLOEXEC));
    if (mFd.get() < 0) throw PosixError(errno, "cannot watch for signals");
    ::pthread_sigmask(SIG_BLOCK, &set, &mPrevious);
}

SignalWatch::~SignalWatch() { ::pthread_sigmask(SIG_SETMASK, &mPrevious, nullptr); }

PollFd SignalWatch::getPollFd() const { return PollFd(mFd.get(), PollEvents::Read); }

int SignalWatch::take()
{
    signalfd_siginfo info{};
    const ssize_t count = ::read(mFd.get(), &info, sizeof(info));
    return count == static_cast<ssize_t>(sizeof(info)) ? static_cast<int>(info.ssi_signo) : 0;
}

} // namespace qel::tool
