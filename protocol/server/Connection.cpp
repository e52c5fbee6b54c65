#include "server/Connection.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/Guard.hpp"
#include "base/StreamFailure.hpp"
#include "base/Threads.hpp"
#include "server/QuietLog.hpp"

#include <cstring>
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

/// Puts what belongs below the messages on top of the lowest stream.
/// @param records  set to what is below TLS
std::unique_ptr<Stream> protect(std::unique_ptr<WireStream> wire, SSLServerContext* context, RecordStream*& records)
{
    if (context == nullptr) return wire;
    auto below = std::make_unique<RecordStream>(std::move(wire));
    records = below.get();
    return std::make_unique<SSLStream>(*context, std::move(below));
}

/// For what has been received and not been handed to the hypervisor, and for a batch that is being sent.
constexpr BufferedStreamOptions kBuffers{Outbox::kBatchBytes, Outbox::kBatchBytes, false};

} // namespace

Connection::Connection(const ConnectionServices& services, ServedStream stream, SSLServerContext* context,
                       HandshakePlaces::Place place)
    : Connection(services, stream, std::make_unique<WireStream>(std::move(stream.stream), stream.descriptor), context,
                 std::move(place))
{}

Connection::Connection(const ConnectionServices& services, ServedStream& stream, std::unique_ptr<WireStream> wire,
                       SSLServerContext* context, HandshakePlaces::Place place)
    : Outbox(services.limits.queueBytes), mServices(services), mAddress(std::move(stream.address)),
      mSource(std::move(stream.source)), mBlamed(mSource), mHangUp(hangUpOf(stream.descriptor)),
      mPlace(std::move(place)), mClear(wire->below()), mWire(*wire),
      mStream(protect(std::move(wire), context, mRecords)), mBuffered(*mStream, kBuffers), mFrames(mBuffered),
      mMessages(mFrames, messageRegistry()), mName(mAddress)
{
    if (context == nullptr) return;
    auto& tls = static_cast<SSLStream&>(*mStream);
    mAdmission.emplace(mServices.hypervisor, mClear, stream.descriptor, tls, mWake, mServices.pins);
}

Connection::~Connection()
{
    if (!mEnded) abort();
    // The thread that is joined may start the next one, so they are joined in the order in which they start.
    pJoinHandshake();
    std::thread reader;
    {
        const MutexLock lock(mThreadsMutex);
        reader.swap(mReader);
    }
    if (reader.joinable()) reader.join();
    if (mWriter.joinable()) mWriter.join();
    retire();
}

void Connection::start()
{
    mHandshake = TimeProvider::steady() + mServices.limits.handshake;
    const LogThrottle::Scope scope(mServices.throttle, mSource);
    try {
        if (mAdmission) {
            const MutexLock lock(mThreadsMutex);
            mHandshaker = startThread([this] { pHandshake(); });
        } else {
            pConnect({}); // here, so that connections are numbered in the order in which they came
            pStartReader();
        }
    } catch (...) {
        pFinish();
        throw;
    }
}

void Connection::stop()
{
    if (mAdmission) mAdmission->stop();
}

void Connection::abort() noexcept
{
    abandon();
    pClose();
}

bool Connection::dumpStatistics(std::ostream& os) const
{
    const ConsoleId id = mId;
    if (id == 0) return false;
    os << "Queue of console " << id << ", " << mAddress << ":\n";
    Outbox::dumpStatistics(os, Indent(2, ' '));
    return true;
}

ConnectedConsole Connection::state() const
{
    ConnectedConsole state;
    state.peer.id = mId;
    state.peer.address = mAddress;
    state.since = mSince;
    state.received.mCount = mReceivedMessages.load(std::memory_order_relaxed);
    state.received.mBytes = mReceivedBytes.load(std::memory_order_relaxed);
    state.queue = queueState();
    return state;
}

void Connection::resumeReading()
{
    if (mHeldBack) mWake.interrupt();
}

void Connection::pConnect(const PeerIdentity& identity)
{
    Peer peer;
    static_cast<PeerIdentity&>(peer) = identity;
    peer.address = mAddress;
    peer.isProtected = mAdmission.has_value();
    mId = mServices.hypervisor.connect(*this, std::move(peer));
    mName = "console " + std::to_string(mId);
    if (!identity.fingerprint.empty()) mBlamed += ", SHA-256 " + identity.fingerprint;
}

void Connection::pHandshake() noexcept
{
    const LogThrottle::Scope scope(mServices.throttle, mSource);
    try {
        pAdmit();
        pStartReader();
    } catch (...) {
        pReportFailure();
        pFinish();
    }
}

void Connection::pAdmit()
{
    const PeerIdentity identity = mAdmission->run(mHandshake);
    logLine(LogLevel::Info, mAddress, ": over TLS: ", describePeer(identity));
    pConnect(identity);
}

void Connection::pStartReader()
{
    const MutexLock lock(mThreadsMutex);
    mReader = startThread([this] { pRead(); });
}

/// Frees the stack of the handshake, as soon as there is a reader to do so.
void Connection::pJoinHandshake() noexcept
{
    std::thread handshaker;
    {
        const MutexLock lock(mThreadsMutex);
        handshaker.swap(mHandshaker);
    }
    if (handshaker.joinable()) handshaker.join();
}

void Connection::pRead() noexcept
{
    const LogThrottle::Scope scope(mServices.throttle, mBlamed);
    pJoinHandshake();
    try {
        mWriter = startThread([this] { pWrite(); });
        limitTo(*mStream, mHandshake);
        mStream->clearWriteDeadline();
        pReceiveAll();
    } catch (...) {
        pReportFailure();
    }
    pFinish();
}

void Connection::pReceiveAll()
{
    startReading();
    mWire.onRead([this] { sendOwn(); });
    bool mayRead = true;
    while (mayRead || pAwaitReceive()) {
        // What has been caused goes out before the reader waits. The stream says so too, but inside TLS, where sending
        // needs memory of the stack that this thread would keep.
        if (!mBuffered.hasPending()) sendOwn();
        mFrames.beginFrame();
        const std::unique_ptr<QelMessage> message = mMessages.read();
        pCountReceived(*message);
        const Received received = pHandOver(*message);
        mayRead = received.mayReadNext;
        // The hypervisor closes the connection and ignores further messages. The console may still take what is queued
        // for it, within the linger time.
        if (received.state == ConsoleState::Closing) {
            pCountRefusal(ConnectionRefusal::RequestRefused);
            if (!waitUntilWritten(mServices.limits.linger)) abort();
        }
        if (received.state == ConsoleState::Identified && !mHandshake.isDisabled()) pOnIdentified();
    }
    pCountRefusal(ConnectionRefusal::Left);
}

/// Without an instruction that locks: no other thread writes these.
void Connection::pCountReceived(const QelMessage& message) noexcept
{
    constexpr auto kRelaxed = std::memory_order_relaxed;
    mReceivedMessages.store(mReceivedMessages.load(kRelaxed) + 1, kRelaxed);
    mReceivedBytes.store(mReceivedBytes.load(kRelaxed) + message.msgLength(), kRelaxed);
}

/// What the message causes for one other console goes out on this thread, unless the next message is waiting already.
Received Connection::pHandOver(const QelMessage& message)
{
    const DeferredWakeUps wakeUps(mBuffered.hasPending() ? DeferredWakeUps::How::Wake
                                                         : DeferredWakeUps::How::SendForOne);
    return mServices.hypervisor.receive(mId, message);
}

void Connection::pOnIdentified()
{
    mHandshake = PollDeadline();
    mPlace.release();
    mFrames.limitFrames(mServices.limits.frame);
    if (mRecords != nullptr) mRecords->limitRecords(mServices.limits.frame);
}

/// Waits until the hypervisor takes another message. @return false: the console has hung up
bool Connection::pAwaitReceive()
{
    sendOwn();
    mHeldBack = true; // before the question: what changes the answer afterwards interrupts the wait
    while (!mServices.hypervisor.mayReceive(mId)) {
        if (mClosed) {
            mWhy = DisconnectReason::Lost;
            return false;
        }
        const PollSet set{mWake.getPollFd(), mHangUp};
        const auto now = TimeProvider::steady();
        if (mHandshake.isExpired(now)) throw StreamIOException("I/O deadline");
        const PollResult result = set.wait(mHandshake.getTimeout(now));
        if (result.contains(mWake.getPollFd())) mWake.eoi();
        if (result.contains(mHangUp)) return false;
    }
    mHeldBack = false;
    return true;
}

/// The end of the reader: the hypervisor forgets the console, and the queued messages go out within the linger time.
void Connection::pFinish() noexcept
{
    if (mId != 0) {
        runGuarded([this] { mServices.hypervisor.disconnect(mId, mWhy); }, mName);
    }
    if (mWriter.joinable()) {
        finish();
        if (!waitUntilWritten(mServices.limits.linger)) abort();
    } else {
        abort();
    }
    mPlace.release(); // not earlier: until here it has taken its threads
    mEnded = true;
    mServices.ended.interrupt();
}

/// Logs the exception that is being handled.
void Connection::pReportFailure() noexcept
{
    mWhy = DisconnectReason::Failure;
    pCountRefusal(currentRefusal());
    try {
        throw;
    } catch (const QelMessageValidationException& error) {
        mWhy = DisconnectReason::Protocol;
        logQuietly(LogLevel::Warn, mName, ": closed for a malformed frame: ", error.what());
    } catch (const StreamIOException& error) {
        pReport(error);
    } catch (const Error& error) {
        logQuietly(LogLevel::Warn, mName, ": refused: ", error.what());
    } catch (...) {
        logCurrent(mName);
    }
}

/// Counts the connection as refused unless its console has been connected.
void Connection::pCountRefusal(ConnectionRefusal reason) noexcept
{
    if (mHandshake.isDisabled() || std::exchange(mIsCounted, true)) return;
    mServices.refusals.count(reason);
}

void Connection::pReport(const StreamIOException& error) noexcept
{
    mWhy = pReasonOf(error);
    if (!isDeadline(error)) return logQuietly(LogLevel::Info, mName, ": ", Explained{error});
    logQuietly(LogLevel::Warn, mName, ": closed, it did not ",
               mHandshake.isDisabled() ? "finish a message" : "introduce itself", " in time");
}

DisconnectReason Connection::pReasonOf(const StreamIOException& error) const noexcept
{
    if (isDeadline(error)) return DisconnectReason::Timeout;
    const bool isEnd = std::strcmp(error.what(), "EOF") == 0 && !mFrames.isInFrame();
    return isEnd && !mClosed ? DisconnectReason::Closed : DisconnectReason::Lost;
}

void Connection::pBeginBatch(bool mayWait)
{
    mWire.setMayWait(mayWait);
    if (mayWait) mWire.sendRest();
}

void Connection::pGather(const QelMessage& message) { mMessages.write(message); }

bool Connection::pSendBatch()
{
    mBuffered.flush();
    return !mWire.hasRest();
}

/// A message that waited for room is in the queue: the reader and the serial thread may have held back for it.
void Connection::pOnRoom()
{
    resumeReading();
    mServices.hypervisor.outputDrained();
}

void Connection::pWrite() noexcept
{
    const LogThrottle::Scope scope(mServices.throttle, mBlamed);
    try {
        while (sendNext())
            continue;
    } catch (...) {
        pReportSendFailure();
    }
    abort(); // wakes the reader
    setWritten();
}

/// On the thread of another console.
void Connection::pOnSendFailure() noexcept
{
    const LogThrottle::Scope scope(mServices.throttle, mBlamed);
    pReportSendFailure();
    abort();
}

/// Logs the exception that is being handled.
void Connection::pReportSendFailure() const noexcept
{
    try {
        throw;
    } catch (const StreamIOException& error) {
        logQuietly(LogLevel::Info, mName, ": ", Explained{error});
    } catch (...) {
        logCurrent(mName);
    }
}

/// On any thread. The name belongs to the connection's own threads, so that of the log is the address here.
void Connection::pClose() noexcept
{
    mClosed = true;
    try {
        mStream->close();
    } catch (const std::exception& error) {
        logQuietly(LogLevel::Warn, mAddress, ": cannot close: ", Explained{error});
    } catch (...) { // of a stream of the user's own
        logCurrent(mAddress, ": cannot close");
    }
    runGuarded([this] { mWake.interrupt(); }, mAddress);
}

} // namespace qel::protocol
