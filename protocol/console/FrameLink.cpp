#include "console/FrameLink.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/Guard.hpp"
#include "base/StreamFailure.hpp"
#include "transport/TlsAlert.hpp"

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

/// One thread reads and writes, and says itself when to flush.
BufferedStreamOptions bufferOptions()
{
    BufferedStreamOptions options;
    options.gatherBytes = FrameLink::kGatherBytes;
    return options;
}

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

/// Takes one of the steps of leaving.
template <typename F>
void attempt(F step) noexcept
{
    try {
        step();
    } catch (...) {
        logCurrentAt(LogLevel::Debug, "while leaving");
    }
}

/// How long a message may take that begins now.
milliseconds frameTime(milliseconds frameTimeout, TimePoint end)
{
    const milliseconds left = timeToTry(end);
    return left < milliseconds::zero() ? frameTimeout : std::min(left, frameTimeout);
}

} // namespace

void FrameLink::Input::begin(std::size_t count) noexcept
{
    mFirst = 0;
    mLast = count;
}

std::size_t FrameLink::Input::read(char* buffer, std::size_t length)
{
    const std::size_t count = pTake(buffer, length);
    return count != 0 ? count : mStream.read(buffer, length);
}

void FrameLink::Input::fill(char* buffer, std::size_t length)
{
    const std::size_t count = pTake(buffer, length);
    if (count < length) mStream.fill(buffer + count, length - count);
}

std::size_t FrameLink::Input::pTake(char* buffer, std::size_t length) noexcept
{
    const std::size_t count = std::min(length, mLast - mFirst);
    std::memcpy(buffer, mBytes.data() + mFirst, count);
    mFirst += count;
    return count;
}

FrameLink::FrameLink(ConnectedStream connected, const std::string& server, milliseconds frameTimeout,
                     CloseSwitch& closeSwitch)
    : mStream(std::move(connected.stream)), mReadAhead(connected.readAhead),
      mTls(mReadAhead == nullptr ? nullptr : static_cast<SSLStream*>(mStream.get())), mDescriptor(connected.descriptor),
      mReadiness(connected.readiness), mServer(server), mFrameTimeout(frameTimeout), mCloseSwitch(closeSwitch),
      mHasLeft(std::make_exception_ptr(Error("this console has left", mServer))), mBuffered(*mStream, bufferOptions()),
      mInput(mBuffered), mMessages(mInput, messageRegistry())
{
    mCloseSwitch.watch(mStream.get());
}

FrameLink::~FrameLink() { mCloseSwitch.watch(nullptr); }

void FrameLink::send(const QelMessage& message, TimePoint end)
{
    if (mSendFailure) std::rethrow_exception(mSendFailure);
    mStream->setWriteDeadline(frameTime(mFrameTimeout, end));
    try {
        mGathered = 0;
        mMessages.write(message);
        mBuffered.flush();
    } catch (const StreamIOException& error) {
        pFailSending(error);
    }
}

void FrameLink::gather(const QelMessage& message)
{
    if (mSendFailure) std::rethrow_exception(mSendFailure);
    mMessages.write(message);
    mGathered += message.msgLength();
}

void FrameLink::flush(TimePoint end)
{
    if (mGathered == 0) return;
    if (mSendFailure) std::rethrow_exception(mSendFailure);
    mStream->setWriteDeadline(frameTime(mFrameTimeout, end));
    try {
        mGathered = 0;
        mBuffered.flush();
    } catch (const StreamIOException& error) {
        pFailSending(error);
    }
}

std::unique_ptr<QelMessage> FrameLink::receive(TimePoint begin, TimePoint end)
{
    requireReceiving();
    try {
        if (!pBegin(begin, end)) return nullptr;
        mStream->setReadDeadline(frameTime(mFrameTimeout, end));
        return mMessages.read();
    } catch (const StreamIOException& error) {
        pFail(pFailure(error));
    } catch (const QelMessageValidationException& error) {
        pFail(failureOf([&] {
            std::throw_with_nested(
                ProtocolBroken(std::string("the peer broke the protocol: ") + error.what(), mServer));
        }));
    }
}

/// Waits for the first bytes of a message. @return false: none came in time
bool FrameLink::pBegin(TimePoint begin, TimePoint end)
{
    const std::optional<std::size_t> count = mTls == nullptr ? pReadFirst(begin, end) : pReadFirstOverTls(begin);
    if (count == 0) throw StreamIOException("EOF");
    if (count) mInput.begin(*count);
    return count.has_value();
}

/// @return the number of bytes in mInput.firstBytes(), 0 at the end of the stream; none: not in time
std::optional<std::size_t> FrameLink::pReadFirst(TimePoint begin, TimePoint end)
{
    auto& bytes = mInput.firstBytes();
    if (mBuffered.hasPending()) return mBuffered.read(bytes.data(), bytes.size());
    milliseconds wait = timeLeft(begin);
    if (wait == milliseconds::zero() && mDescriptor >= 0) {
        // The stream itself would wait for at least a tick of the system's timers.
        if (!pIsReadable()) return std::nullopt;
        wait = frameTime(mFrameTimeout, end); // nothing is waited for; a deadline that stays costs no system call
    }
    mStream->setReadDeadline(wait);
    try {
        return mBuffered.read(bytes.data(), bytes.size());
    } catch (const StreamIOException& error) {
        if (!isDeadline(error)) throw;
        return std::nullopt;
    }
}

/// The same; the end of a deadline must not meet the TLS stream, which could not go on.
std::optional<std::size_t> FrameLink::pReadFirstOverTls(TimePoint begin)
{
    auto& bytes = mInput.firstBytes();
    for (;;) {
        if (hasPending()) {
            mReadAhead->setWaiting(false);
            const std::size_t count = mBuffered.read(bytes.data(), bytes.size());
            mReadAhead->setWaiting(true);
            if (count != 0) return count;
            mIsStarved = true;
        }
        if (mReadAhead->hasEnded()) return 0;
        const milliseconds wait = timeLeft(begin);
        if (wait == milliseconds::zero() && !pIsReadable()) return std::nullopt;
        if (!mReadAhead->awaitBytes(wait)) return std::nullopt;
        mIsStarved = false;
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
    return !mIsStarved && (mBuffered.hasPending() || (mReadAhead != nullptr && mReadAhead->hasBytes()));
}

std::string FrameLink::certificateAlert() const
{
    return mTls == nullptr ? std::string() : protocol::certificateAlert(*mTls);
}

PollFd FrameLink::getPollFd(PollEvents events) const
{
    return mDescriptor < 0 ? PollFd::Ignore : PollFd(mDescriptor, events);
}

void FrameLink::leave(TimePoint end) noexcept
{
    const TimePoint farewell = std::min(end, deadlineIn(kMaxFarewell));
    attempt([&] {
        if (mGathered != 0 && isUsable() && await(false, farewell).send) flush(farewell);
    });
    mSendFailure = mReceiveFailure = mHasLeft;
    attempt([&] {
        if (pEndOutput()) pAwaitEnd(farewell);
    });
    attempt([&] { mStream->close(); });
}

/// False when reading from the stream certainly waits.
bool FrameLink::pIsReadable() const
{
    return mDescriptor < 0 || PollSet(PollFd(mDescriptor, PollEvents::Read)).poll().anyReady();
}

/// @return false: the stream has no way to end one direction alone
bool FrameLink::pEndOutput() noexcept
{
    if (mDescriptor >= 0) {
        static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
    } else if (mReadiness != nullptr) {
        mReadiness->endOutput();
    }
    return canTell();
}

void FrameLink::pAwaitEnd(TimePoint end)
{
    std::array<char, 4096> rest;
    mStream->setReadDeadline(timeLeft(end));
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
