#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include "LogLine.hpp"
#include "LoggedError.hpp"
#include "util/Timeout.hpp"

#include <cerrno>
#include <ostream>
#include <sys/eventfd.h>
#include <unistd.h>

namespace qel {

std::chrono::milliseconds PollDeadline::getTimeout(time_point now) const noexcept
{
    if (isDisabled()) return PollSet::TIMEOUT_INFINITE;
    if (isExpired(now)) return std::chrono::milliseconds(0);
    return timeLeft(now, mDeadline);
}

int PollDeadline::compare(const PollDeadline& other) const noexcept
{
    if (isDisabled()) return other.isDisabled() ? 0 : 1;
    if (other.isDisabled()) return -1;
    if (mDeadline == other.mDeadline) return 0;
    return mDeadline > other.mDeadline ? 1 : -1;
}

PollSet::PollSet(const PollFd& fd) : mFds{fd} {}

PollSet::PollSet(std::initializer_list<PollFd> fds) : mFds(fds) {}

PollSet& PollSet::operator+=(const PollFd& fd)
{
    mFds.push_back(fd);
    return *this;
}

PollSet& PollSet::operator+=(const PollSet& other)
{
    const std::size_t count = other.mFds.size(); // the other set may be this one, which grows
    mFds.reserve(mFds.size() + count);           // so that push_back does not move the entry that it copies
    for (std::size_t i = 0; i < count; ++i)
        mFds.push_back(other.mFds[i]);
    return *this;
}

PollSet PollSet::operator+(const PollFd& fd) const { return PollSet(*this) += fd; }

PollSet PollSet::operator+(const PollSet& other) const { return PollSet(*this) += other; }

PollResult PollSet::wait(std::chrono::milliseconds timeout) const
{
    PollResult result(mFds);
    if (mFds.empty()) return result;

    logLine(LogLevel::Debug, "Starting poll wait with timeout of ", decFormat(timeout.count()), " ms ", result);
    errno = 0;
    const int ready = ::poll(reinterpret_cast<pollfd*>(result.mResults.data()), result.mResults.size(),
                             static_cast<int>(timeout.count()));
    if (ready < 0) {
        const PosixErrorCode code(errno);
        if (code == EINTR) {
            logLine(LogLevel::Debug, "Poll wait for events ", *this, " interrupted");
            return PollResult();
        }
        logLine(LogLevel::Error, "Poll wait for events ", *this, " failed: ", code);
        throw PosixError(code, "poll() failed");
    }
    logLine(LogLevel::Debug, "Completed poll wait ", result);
    return result;
}

PollResult PollSet::wait() const { return wait(TIMEOUT_INFINITE); }

PollResult PollSet::poll() const { return wait(std::chrono::milliseconds(0)); }

PollResult::PollResult(const std::vector<PollFd>& results) : mResults(results) {}

bool PollResult::contains(const PollFd& fd) const noexcept
{
    for (const PollFd& entry : mResults) {
        const short seen = static_cast<short>(fd.mFd.events & entry.mFd.revents);
        if (entry.mFd.fd == fd.mFd.fd && seen > 0) return true;
    }
    return false;
}

bool PollResult::containsAnyOf(const PollSet& set) const noexcept
{
    if (set.mFds.empty()) return true;
    for (const PollFd& fd : set.mFds) {
        if (contains(fd)) return true;
    }
    return false;
}

bool PollResult::anyReady() const noexcept
{
    for (const PollFd& entry : mResults) {
        if (entry.mFd.revents != 0) return true;
    }
    return false;
}

PollInterrupt::PollInterrupt() : mEventFd(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC))
{
    // Deliberately below -1: the -1 of a failed eventfd is kept, and interrupt() and eoi() report it.
    if (mEventFd < -1) throwLogged(errno, "Failed to open eventfd");
}

PollInterrupt::~PollInterrupt() { ::close(mEventFd); }

void PollInterrupt::interrupt()
{
    // EAGAIN: the counter is full, so an interrupt is pending already.
    if (::eventfd_write(mEventFd, 1) != 0 && errno != EAGAIN) throwLogged(errno, "eventfd write failed");
}

void PollInterrupt::eoi()
{
    eventfd_t count = 0;
    // EAGAIN: nothing is pending.
    if (::eventfd_read(mEventFd, &count) != 0 && errno != EAGAIN) throwLogged(errno, "eventfd read failed");
}

std::ostream& operator<<(std::ostream& os, const PollFd& fd)
{
    const std::ios_base::fmtflags flags = os.flags();
    os << "(fd=" << decFormat(fd.mFd.fd) << ", mask=" << hexFormat(fd.mFd.events)
       << ", results=" << hexFormat(fd.mFd.revents) << ')';
    os.flags(flags);
    return os;
}

std::ostream& operator<<(std::ostream& os, const PollSet& set) { return os << '[' << join(set.mFds, ", ") << ']'; }

std::ostream& operator<<(std::ostream& os, const PollResult& result)
{
    return os << '[' << join(result.mResults, ", ") << ']';
}

} // namespace qel
