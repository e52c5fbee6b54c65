#include "console/FrameLink.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/StreamFailure.hpp"

#include <algorithm>
#include <array>
#include <cstring>
#include <stdexcept>
#include <sys/socket.h>
#include <utility>

namespace qel::protocol {

namespace {

using std::chrono::milliseconds;

constexpr milliseconds kMaxFarewell(1000);
constexpr milliseconds kShortestWait(1);

template <typename F>
std::exception_ptr failureOf(F fail)
{
    try {
        fail();
    } catch (...) {
        return std::current_exception();
    }
    return nullptr;
}

/// How long a message may take that begins now.
milliseconds frameTime(milliseconds frameTimeout, TimePoint end)
{
    const milliseconds left = timeLeft(end);
    if (left < milliseconds::zero()) return frameTimeout;
    return std::max(std::min(left, frameTimeout), kShortestWait);
}

} // namespace

void FrameLink::Input::begin(milliseconds frameTimeout, TimePoint end)
{
    mFrameTimeout = frameTimeout;
    mEnd = end;
    mHasBegun = hasBytes();
    if (mHasBegun) mStream.setReadDeadline(frameTime(frameTimeout, end));
}

std::size_t FrameLink::Input::read(char* buffer, std::size_t length)
{
    if (mIsDirect) {
        const std::size_t count = mStream.read(buffer, length);
        pNote(count);
        return count;
    }
    if (!hasBytes() && !pFill()) return 0;
    const std::size_t count = std::min(length, mLast - mFirst);
    std::memcpy(buffer, mBuffer.data() + mFirst, count);
    mFirst += count;
    return count;
}

/// @return false: the end of the stream
bool FrameLink::Input::pFill()
{
    mFirst = mLast = 0;
    mLast = mStream.read(mBuffer.data(), mBuffer.size());
    pNote(mLast);
    return hasBytes();
}

/// Begins the message with its first bytes.
void FrameLink::Input::pNote(std::size_t count)
{
    if (mHasBegun || count == 0) return;
    mHasBegun = true;
    if (!mIsDirect) mStream.setReadDeadline(frameTime(mFrameTimeout, mEnd));
}

FrameLink::FrameLink(ConnectedStream connected, const std::string& server, milliseconds frameTimeout,
                     CloseSwitch& closeSwitch)
    : mStream(std::move(connected.stream)), mReadAhead(connected.readAhead),
      mTls(mReadAhead == nullptr ? nullptr : static_cast<SSLStream*>(mStream.get())), mDescriptor(connected.descriptor),
      mReadiness(connected.readiness), mServer(server), mFrameTimeout(frameTimeout), mCloseSwitch(closeSwitch),
      mInput(*mStream, mTls != nullptr), mMessages(mInput, messageRegistry())
{
    mCloseSwitch.watch(mStream.get());
}

FrameLink::~FrameLink() { mCloseSwitch.watch(nullptr); }

void FrameLink::send(const QelMessage& message, TimePoint end)
{
    if (mSendFailure) std::rethrow_exception(mSendFailure);
    mStream->setWriteDeadline(frameTime(mFrameTimeout, end));
    try {
        mMessages.write(message);
    } catch (const StreamIOException& error) {
        pFailSending(error);
    }
}

std::unique_ptr<QelMessage> FrameLink::receive(TimePoint begin, TimePoint end)
{
    requireReceiving();
    try {
        const milliseconds left = timeLeft(begin);
        // The stream would wait for at least a tick of the system's timers.
        if (left == milliseconds::zero() && !pHasInput()) return nullptr;
        mInput.begin(mFrameTimeout, end);
        if (mTls == nullptr) {
            if (!mInput.hasBegun()) mStream->setReadDeadline(left);
        } else if (!mInput.hasBegun()) {
            if (!mTls->hasPending() && !mReadAhead->awaitBytes(left)) return nullptr;
            mStream->setReadDeadline(frameTime(mFrameTimeout, end));
        }
        return mMessages.read();
    } catch (const StreamIOException& error) {
        if (mTls == nullptr && !mInput.hasBegun() && isDeadline(error)) return nullptr;
        pFail(pFailure(error));
    } catch (const QelMessageValidationException& error) {
        pFail(failureOf([&] {
            std::throw_with_nested(
                ProtocolBroken(std::string("the peer broke the protocol: ") + error.what(), mServer));
        }));
    }
}

Ready FrameLink::await(bool wantsToReceive, TimePoint end)
{
    if (!canTell()) return {true, false};
    if (mDescriptor < 0) {
        const bool isPending = wantsToReceive && hasPending();
        Ready ready = mReadiness->awaitReady(wantsToReceive, isPending ? milliseconds::zero() : timeLeft(end));
        ready.receive |= isPending;
        return ready;
    }
    const PollFd output(mDescriptor, PollEvents::Write);
    PollSet set(output);
    const PollFd input(mDescriptor, PollEvents::Read);
    if (wantsToReceive) set += input;
    for (;;) {
        if (wantsToReceive && hasPending()) return {set.poll().contains(output), true};
        const PollResult result = set.wait(timeLeft(end));
        const Ready ready{result.contains(output), wantsToReceive && result.contains(input)};
        if (ready.send || ready.receive || TimeProvider::steady() >= end) return ready;
    }
}

void FrameLink::fail(const std::exception_ptr& failure) noexcept
{
    mReceiveFailure = failure;
    if (!mSendFailure) mSendFailure = failure;
}

void FrameLink::pFail(const std::exception_ptr& failure)
{
    fail(failure);
    std::rethrow_exception(failure);
}

bool FrameLink::hasPending() const
{
    return mInput.hasBytes() || (mTls != nullptr && (mReadAhead->hasBytes() || mTls->hasPending()));
}

PollFd FrameLink::getPollFd(PollEvents events) const
{
    return mDescriptor < 0 ? PollFd::Ignore : PollFd(mDescriptor, events);
}

void FrameLink::leave(TimePoint end) noexcept
{
    mSendFailure = mReceiveFailure = std::make_exception_ptr(Error("this console has left", mServer));
    try {
        if (mDescriptor >= 0) {
            static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
            pAwaitEnd(end);
        }
        mStream->close();
    } catch (const std::exception& error) {
        logLine(LogLevel::Debug, "while leaving: ", explain(error));
    }
}

/// False when there is certainly nothing to receive at the moment.
bool FrameLink::pHasInput() const
{
    return mDescriptor < 0 || hasPending() || PollSet(PollFd(mDescriptor, PollEvents::Read)).poll().anyReady();
}

void FrameLink::pAwaitEnd(TimePoint end)
{
    std::array<char, 4096> rest;
    mStream->setReadDeadline(timeLeft(std::min(end, deadlineIn(kMaxFarewell))));
    while (mStream->read(rest.data(), rest.size()) > 0)
        continue;
}

/// The frame may have been sent in part.
void FrameLink::pFailSending(const StreamIOException& error)
{
    mSendFailure = pFailure(error);
    if (mTls != nullptr) mReceiveFailure = mSendFailure;
    std::rethrow_exception(mSendFailure);
}

std::exception_ptr FrameLink::pFailure(const StreamIOException& error) const
{
    if (mCloseSwitch.isClosed()) return std::make_exception_ptr(Error("this console is closed", mServer));
    return failureOf([&] { throwStreamFailure(error, mServer); });
}

} // namespace qel::protocol
