#include "console/SerialState.hpp"

#include <algorithm>
#include <cstring>

namespace qel::protocol {

namespace {

using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;

SessionEnd endFrom(ClosedNotice::CloseReason reason)
{
    switch (reason) {
    case ClosedNotice::CloseReasonForceClose:
        return SessionEnd::Taken;
    case ClosedNotice::CloseReasonQelShutdown:
        return SessionEnd::ShutDown;
    case ClosedNotice::CloseReasonReadFailure:
        return SessionEnd::CommandEnded;
    case ClosedNotice::CloseReasonWriteFailure:
        return SessionEnd::WriteFailure;
    default:
        return SessionEnd::Unknown;
    }
}

} // namespace

const char* describe(SessionEnd end)
{
    switch (end) {
    case SessionEnd::None:
        return "session open";
    case SessionEnd::CommandEnded:
        return "session closed: the command ended";
    case SessionEnd::Taken:
        return "session closed: taken or closed by another console";
    case SessionEnd::ShutDown:
        return "session closed: the server shut down";
    case SessionEnd::WriteFailure:
        return "session closed: the partition takes no input";
    case SessionEnd::Unknown:
        return "session closed: unknown reason";
    case SessionEnd::Closed:
        return "session closed";
    case SessionEnd::ConnectionClosed:
        break;
    }
    return "the server closed the connection";
}

void SerialState::append(const char* data, std::size_t length)
{
    if (mTaken > mOutput.size() / 2) { // moves fewer bytes than have been read since the last time
        mOutput.erase(0, mTaken);
        mTaken = 0;
    }
    mOutput.append(data, length);
}

std::size_t SerialState::take(char* buffer, std::size_t length) noexcept
{
    const std::size_t count = std::min(length, unreadBytes());
    if (count > 0) std::memcpy(buffer, mOutput.data() + mTaken, count);
    mTaken += count;
    if (mTaken == mOutput.size()) {
        mOutput.clear();
        mTaken = 0;
    }
    return count;
}

void SerialState::finish(SessionEnd reason) noexcept
{
    isOpen = false;
    if (end == SessionEnd::None) end = reason;
}

void SerialState::finish(const ClosedNotice& notice)
{
    finish(endFrom(notice.getCloseReason()));
    if (end == SessionEnd::CommandEnded) commandEnd = commandEndFrom(notice.getStatusDetail());
}

} // namespace qel::protocol
