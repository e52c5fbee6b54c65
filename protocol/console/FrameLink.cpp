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

} // namespace

void FrameLink::Input::begin(milliseconds frameTimeout)
{
    mFrameTimeout = frameTimeout;
    mHasBegun = hasBytes();
    if (mHasBegun) mStream.setReadDeadline(frameTimeout);
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
    if (!mIsDirect) mStream.setReadDeadline(mFrameTimeout);
}

FrameLink::FrameLink(ConnectedStream connected, const std::string& server, milliseconds frameTimeout,
                     CloseSwitch& closeSwitch)
    : mStream(std::move(connected.stream)), mReadAhead(connected.readAhead),
      mTls(mReadAhead == nullptr ? nullptr : static_cast<SSLStream*>(mStream.get())), mDescriptor(connected.descriptor),
      mServer(server), mFrameTimeout(frameTimeout), mCloseSwitch(closeSwitch), mInput(*mStream, mTls != nullptr),
      mMessages(mInput, messageRegistry())
{
    mCloseSwitch.watch(mStream.get());
}

FrameLink::~FrameLink() { mCloseSwitch.watch(nullptr); }

void FrameLink::send(const QelMessage& message, TimePoint end)
{
    if (mSendFailure) std::rethrow_exception(mSendFailure);
    mStream->setWriteDeadline(pFrameTime(timeLeft(end)));
    try {
        mMessages.write(message);
    } catch (const StreamIOException& error) {
        pFailSending(error);
    }
}

std::unique_ptr<QelMessage> FrameLink::receive(TimePoint begin, TimePoint end)
{
    if (mReceiveFailure) std::rethrow_exception(mReceiveFailure);
    try {
        const milliseconds left = timeLeft(begin);
        const milliseconds frameTime = pFrameTime(begin == end ? left : timeLeft(end));
        mInput.begin(frameTime);
        if (mTls == nullptr) {
            if (!mInput.hasBegun()) mStream->setReadDeadline(left);
        } else if (!mInput.hasBegun()) {
            if (!mTls->hasPending() && !mReadAhead->awaitBytes(left)) return nullptr;
            mStream->setReadDeadline(frameTime);
        }
        return mMessages.read();
    } catch (const StreamIOException& error) {
        if (mTls == nullptr && !mInput.hasBegun() && isDeadline(error)) return nullptr;
        fail(pFailure(error));
    } catch (const QelMessageValidationException& error) {
        fail(failureOf([&] {
            std::throw_with_nested(
                ProtocolBroken(std::string("the peer broke the protocol: ") + error.what(), mServer));
        }));
    }
}

FrameLink::Ready FrameLink::await(bool wantsToReceive, TimePoint end)
{
    if (mDescriptor < 0) return {true, false};
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

void FrameLink::fail(std::exception_ptr failure)
{
    mReceiveFailure = failure;
    if (!mSendFailure) mSendFailure = failure;
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

void FrameLink::leave() noexcept
{
    mSendFailure = mReceiveFailure = std::make_exception_ptr(Error("this console has left", mServer));
    try {
        if (mDescriptor >= 0) {
            static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
            pAwaitEnd();
        }
        mStream->close();
    } catch (const std::exception& error) {
        logLine(LogLevel::Debug, "while leaving: ", explain(error));
    }
}

void FrameLink::pAwaitEnd()
{
    std::array<char, 4096> rest;
    mStream->setReadDeadline(kMaxFarewell);
    while (mStream->read(rest.data(), rest.size()) > 0)
        continue;
}

/// How long a message may take when so much time is left for it.
milliseconds FrameLink::pFrameTime(milliseconds left) const
{
    if (left < milliseconds::zero()) return mFrameTimeout;
    return std::max(std::min(left, mFrameTimeout), kShortestWait);
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
