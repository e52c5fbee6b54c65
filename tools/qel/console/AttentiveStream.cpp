#include "console/AttentiveStream.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <cerrno>
#include <exception>
#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

namespace qel::tool {

namespace {

using std::chrono::milliseconds;

/// Throws the error of a transfer unless it is worth another attempt.
void requireRetry(PosixErrorCode code, const char* transfer)
{
    if (code == EAGAIN || code == EINTR) return;
    try {
        throw PosixError(code, transfer);
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException(transfer));
    }
}

} // namespace

std::size_t AttentiveStream::read(char* buffer, std::size_t length)
{
    for (;;) {
        const milliseconds timeout = mReadDeadline.getEffectiveTimeout();
        const ssize_t count = ::recv(getSocket().getFd(), buffer, length, MSG_DONTWAIT);
        if (count >= 0) return static_cast<std::size_t>(count);
        requireRetry(PosixErrorCode(errno), "socket stream receive failure");
        pAwait(PollEvents::Read, timeout);
    }
}

void AttentiveStream::write(const char* buffer, std::size_t length)
{
    while (length > 0) {
        const milliseconds timeout = mWriteDeadline.getEffectiveTimeout();
        const ssize_t count = ::send(getSocket().getFd(), buffer, length, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (count >= 0) {
            buffer += count;
            length -= static_cast<std::size_t>(count);
            continue;
        }
        requireRetry(PosixErrorCode(errno), "socket stream send failure");
        pAwait(PollEvents::Write, timeout);
    }
}

void AttentiveStream::throwAwayUnsent() noexcept
{
    int unsent = 0;
    if (::ioctl(getSocket().getFd(), SIOCOUTQNSD, &unsent) != 0 || unsent == 0) return;
    const linger atOnce{1, 0};
    static_cast<void>(::setsockopt(getSocket().getFd(), SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce)));
}

void AttentiveStream::pAwait(PollEvents events, milliseconds timeout) const
{
    if (mCut != StreamDeadline::NoDeadline) {
        const auto left = std::chrono::ceil<milliseconds>(mCut - TimeProvider::steady());
        const milliseconds cut = std::max(left, milliseconds::zero());
        timeout = timeout < milliseconds::zero() ? cut : std::min(timeout, cut);
    }
    const PollFd own(getSocket().getFd(), events);
    PollSet set(own);
    if (mAttendant != nullptr) set += mAttendant->attended();
    const PollResult ready = set.wait(timeout);
    if (ready.getResults().empty() || ready.contains(own)) return; // empty: a signal came
    if (!ready.anyReady()) throw StreamIOException("I/O deadline");
    if (!mAttendant->attend(ready)) throw StreamIOException("the wait was given up");
}

} // namespace qel::tool
