#include "server/Connection.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/StreamFailure.hpp"

#include <poll.h>
#include <utility>

namespace qel::protocol {

namespace {

/// Reports that the peer has closed its side, even while earlier data is still unread.
PollFd hangUpOf(int descriptor)
{
    PollFd fd(descriptor, PollEvents::Error);
    fd.mFd.events |= POLLRDHUP;
    return fd;
}

} // namespace

Connection::Connection(HypervisorEngine& hypervisor, std::unique_ptr<Stream> stream, int descriptor, std::string peer,
                       ConnectionLimits limits, std::function<void()> onEnd)
    : Outbox(limits.queueBytes), mHypervisor(hypervisor), mStream(std::move(stream)), mHangUp(hangUpOf(descriptor)),
      mPeer(std::move(peer)), mLimits(limits), mOnEnd(std::move(onEnd)), mMessages(*mStream, messageRegistry())
{}

Connection::~Connection()
{
    if (!mEnded) abort();
    if (mReader.joinable()) mReader.join();
    if (mWriter.joinable()) mWriter.join();
}

void Connection::start()
{
    mHandshake = TimeProvider::steady() + mLimits.handshake;
    mStream->setReadDeadline(mLimits.handshake);
    Peer peer;
    peer.address = mPeer;
    mId = mHypervisor.connect(*this, std::move(peer));
    try {
        mWriter = std::thread([this] { pWrite(); });
        mReader = std::thread([this] { pRead(); });
    } catch (...) {
        mHypervisor.disconnect(mId);
        abandon();
        mEnded = true;
        throw;
    }
}

void Connection::abort()
{
    abandon();
    pCloseStream();
}

void Connection::dumpStatistics(std::ostream& os) const
{
    os << "Queue of console " << mId << ", " << mPeer << ":\n";
    Outbox::dumpStatistics(os, Indent(2, ' '));
}

void Connection::resumeReading() { mWake.interrupt(); }

void Connection::pRead() noexcept
{
    try {
        pReceiveAll();
    } catch (const QelMessageValidationException& error) {
        logLine(LogLevel::Warn, "console ", mId, ": closed for a malformed frame: ", error.what());
    } catch (const StreamIOException& error) {
        pReport(error);
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "console ", mId, ": ", explain(error));
    }
    pFinish();
}

void Connection::pReceiveAll()
{
    bool identified = false;
    bool mayRead = true;
    while (mayRead || pAwaitReceive()) {
        const std::unique_ptr<QelMessage> message = mMessages.read();
        const Received received = mHypervisor.receive(mId, *message);
        const ConsoleState state = received.state;
        mayRead = received.mayReadNext;
        // The hypervisor closes the connection and ignores further messages. The console may still take what is queued
        // for it, within the linger time.
        if (state == ConsoleState::Closing && !waitUntilWritten(mLimits.linger)) abort();
        if (!identified && state == ConsoleState::Identified) {
            identified = true;
            mHandshake = PollDeadline();
            mStream->clearReadDeadline();
        }
    }
}

/// Waits until the hypervisor takes another message. @return false: the console has hung up
bool Connection::pAwaitReceive()
{
    while (!mHypervisor.mayReceive(mId)) {
        const PollSet set{mWake.getPollFd(), mHangUp};
        const auto now = TimeProvider::steady();
        if (mHandshake.isExpired(now)) throw StreamIOException("I/O deadline");
        const PollResult result = set.wait(mHandshake.getTimeout(now));
        if (result.contains(mWake.getPollFd())) mWake.eoi();
        if (result.contains(mHangUp)) return false;
    }
    return true;
}

/// The end of the reader: the hypervisor forgets the console, and the queued messages go out within the linger time.
void Connection::pFinish()
{
    mHypervisor.disconnect(mId);
    finish();
    if (!waitUntilWritten(mLimits.linger)) abort();
    mEnded = true;
    mOnEnd();
}

void Connection::pReport(const StreamIOException& error) const
{
    if (isDeadline(error)) {
        logLine(LogLevel::Warn, "console ", mId, ": closed, it did not introduce itself in time");
    } else {
        logLine(LogLevel::Info, "console ", mId, ": ", explain(error));
    }
}

/// A message that waited for room is in the queue: the reader and the serial thread may have held back for it.
void Connection::pOnRoom()
{
    resumeReading();
    mHypervisor.outputDrained();
}

void Connection::pWrite() noexcept
{
    try {
        pSendAll();
    } catch (const StreamIOException& error) {
        logLine(LogLevel::Info, "console ", mId, ": ", explain(error));
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "console ", mId, ": ", explain(error));
    }
    abandon();
    pCloseStream(); // wakes the reader
    setWritten();
}

void Connection::pSendAll()
{
    while (const std::unique_ptr<QelMessage> message = take())
        mMessages.write(*message);
}

void Connection::pCloseStream() noexcept
{
    try {
        mStream->close();
    } catch (const std::exception& error) {
        logLine(LogLevel::Warn, "console ", mId, ": cannot close: ", explain(error));
    }
}

} // namespace qel::protocol
