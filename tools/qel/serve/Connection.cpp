#include "serve/Connection.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/MessageRegistry.hpp"

#include <poll.h>
#include <utility>

namespace qel::tool {

namespace {

/// Reports that the other end has closed its side, even while data it sent before is still unread.
PollFd hangUpOf(int descriptor)
{
    PollFd fd(descriptor, PollEvents::Error);
    fd.mFd.events |= POLLRDHUP;
    return fd;
}

} // namespace

Connection::Connection(Hypervisor& hypervisor, std::unique_ptr<Stream> stream, int descriptor, std::string peer,
                       ConnectionLimits limits, std::function<void()> onEnd)
    : mHypervisor(hypervisor), mStream(std::move(stream)), mHangUp(hangUpOf(descriptor)), mPeer(std::move(peer)),
      mLimits(limits), mOnEnd(std::move(onEnd)), mMessages(*mStream, messageRegistry()),
      mOutbox([this] { pTellRoom(); }, limits.queueBytes)
{}

Connection::~Connection()
{
    if (!mEnded) abort();
    if (mReader.joinable()) mReader.join();
    if (mFeeder.joinable()) mFeeder.join();
    if (mWriter.joinable()) mWriter.join();
}

void Connection::start()
{
    mHandshake = TimeProvider::steady() + mLimits.handshake;
    mStream->setReadDeadline(mLimits.handshake);
    mId = mHypervisor.connect(*this, mPeer);
    try {
        mWriter = std::thread([this] { pWrite(); });
        mFeeder = std::thread([this] { pFeed(); });
        mReader = std::thread([this] { pRead(); });
    } catch (...) {
        mHypervisor.disconnect(mId);
        mOutbox.abandon();
        mEnded = true;
        throw;
    }
}

void Connection::abort()
{
    mOutbox.abandon();
    pCloseStream();
}

void Connection::dumpStatistics(std::ostream& os) const
{
    os << "Queue of console " << mId << ", " << mPeer << ":\n";
    mOutbox.dumpStatistics(os, Indent(2, ' '));
}

void Connection::post(std::unique_ptr<QelMessage> message) { mOutbox.post(std::move(message)); }

void Connection::postSerial(std::unique_ptr<QelMessage> message) { mOutbox.postSerial(std::move(message)); }

bool Connection::offer(std::unique_ptr<QelMessage> message) { return mOutbox.offer(std::move(message)); }

bool Connection::hasRoom() const { return mOutbox.hasRoom(); }

bool Connection::hasSerialRoom() const { return mOutbox.hasSerialRoom(); }

void Connection::resumeReading() { mWake.interrupt(); }

void Connection::finish() { mOutbox.finish(); }

void Connection::pRead() noexcept
{
    try {
        pReceiveAll();
    } catch (const QelMessageValidationException& error) {
        logLine(LogLevel::Warn, "console ", mId, ": closed for a broken frame: ", error.what());
    } catch (const StreamIOException& error) {
        pReport(error);
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "console ", mId, ": ", explain(error));
    }
    pEnd();
}

void Connection::pReceiveAll()
{
    bool introduced = false;
    while (pWaitForTurn()) {
        const std::unique_ptr<QelMessage> message = mMessages.read();
        const ConsoleState state = mHypervisor.receive(mId, *message);
        // It is sent away, and nothing it sends is looked at any more. It may take what is queued for it, but not hold
        // its connection by not taking it.
        if (state == ConsoleState::Closing && !mOutbox.waitUntilWritten(mLimits.linger)) abort();
        if (!introduced && state == ConsoleState::Identified) {
            introduced = true;
            mHandshake = PollDeadline();
            mStream->clearReadDeadline();
        }
    }
}

/// @return false: there is nobody left to read from
bool Connection::pWaitForTurn()
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

/// The reader's last act: the hypervisor forgets the console, and what it still has for it may go out.
void Connection::pEnd()
{
    mHypervisor.disconnect(mId);
    mOutbox.finish();
    if (!mOutbox.waitUntilWritten(mLimits.linger)) abort();
    mEnded = true;
    mOnEnd();
}

void Connection::pReport(const StreamIOException& error) const
{
    if (exitStatusOf(error) == ExitStatus::DeadlinePassed) {
        logLine(LogLevel::Warn, "console ", mId, ": closed, it did not introduce itself in time");
    } else {
        logLine(LogLevel::Info, "console ", mId, ": ", explain(error));
    }
}

void Connection::pFeed() noexcept
{
    try {
        mOutbox.feed();
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "console ", mId, ": ", explain(error));
        abort(); // what it had in hand is lost
    }
}

/// Something that waited for room is in the queue: whoever held back for it may go on.
void Connection::pTellRoom()
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
    mOutbox.abandon();
    pCloseStream(); // wakes the reader
    mOutbox.setWritten();
}

void Connection::pSendAll()
{
    while (const std::unique_ptr<QelMessage> message = mOutbox.take())
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

} // namespace qel::tool
