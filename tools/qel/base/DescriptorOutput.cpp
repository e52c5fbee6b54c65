#include "base/DescriptorOutput.hpp"

#include <qel/common/util/PosixError.hpp>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <unistd.h>

namespace qel::tool {

namespace {

/// poll() reports a terminal as writable when it has room for one byte. A longer write could block while SignalWatch
/// blocks the termination signals, so the terminal is opened with O_NONBLOCK.
/// @return none when the descriptor is not a terminal, or cannot be opened
UniqueFd openTerminal(int descriptor)
{
    unsigned int number = 0;
    const bool isMaster = ::ioctl(descriptor, TIOCGPTN, &number) == 0; // opening that would make a new terminal
    if (isMaster || ::isatty(descriptor) != 1) return UniqueFd();
    const std::string path = "/proc/self/fd/" + std::to_string(descriptor);
    return UniqueFd(::open(path.c_str(), O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
}

} // namespace

DescriptorOutput::DescriptorOutput(int descriptor)
    : mOwn(openTerminal(descriptor)), mDescriptor(mOwn.get() >= 0 ? mOwn.get() : descriptor)
{}

void DescriptorOutput::append(const char* data, std::size_t length)
{
    if (length == 0) return;
    mKept.append(data, length);
    mEndsLine = mKept.back() == '\n';
}

PollFd DescriptorOutput::getPollFd() const { return PollFd(mDescriptor, PollEvents::Write); }

void DescriptorOutput::writeSome()
{
    std::size_t written = 0;
    while (written < mKept.size() && pIsReady()) {
        const std::size_t count = pWrite(mKept.data() + written, mKept.size() - written);
        if (count == 0) break;
        written += count;
    }
    mKept.erase(0, written);
}

void DescriptorOutput::drop()
{
    if (isEmpty()) return;
    mKept.clear();
    mEndsLine = false; // unknown
}

void DescriptorOutput::flush()
{
    while (!isEmpty()) {
        static_cast<void>(PollSet(getPollFd()).wait());
        writeSome();
    }
}

/// A terminal says so itself: it is not written to in a way that waits.
bool DescriptorOutput::pIsReady() const { return mOwn.get() >= 0 || PollSet(getPollFd()).poll().anyReady(); }

/// @return the number of bytes written; 0: none at the moment
std::size_t DescriptorOutput::pWrite(const char* data, std::size_t length) const
{
    const ssize_t count = ::write(mDescriptor, data, std::min<std::size_t>(length, PIPE_BUF));
    const int error = errno;
    if (count >= 0) return static_cast<std::size_t>(count);
    if (error == EAGAIN || error == EINTR) return 0;
    throw PosixError(error, "cannot write to standard output");
}

} // namespace qel::tool
