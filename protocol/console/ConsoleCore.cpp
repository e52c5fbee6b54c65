#include "console/ConsoleCore.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Guard.hpp"
#include "base/MessageKind.hpp"
#include "console/BackoffDelays.hpp"

#include <algorithm>
#include <random>
#include <sstream>
#include <stdexcept>
#include <unistd.h>
#include <utility>

namespace qel::protocol {

namespace {

using std::chrono::milliseconds;

// The versions that this console reports. The hypervisor does not check them.
constexpr std::uint32_t kInterfaceVersion = 1;
constexpr std::uint16_t kMajorVersion = 1;
constexpr std::uint16_t kMinorVersion = 0;

template <typename T>
bool isA(const std::exception& error)
{
    return dynamic_cast<const T*>(&error) != nullptr;
}

/// True when waiting may help.
bool isTemporary(const Error& error, bool isProtected)
{
    if (const auto* refusal = dynamic_cast<const StatusError*>(&error)) {
        return refusal->getStatus() == QelMessageStatusTooManyConnections ||
               refusal->getStatus() == QelMessageStatusDaxAlreadyConnected;
    }
    if (isA<TurnedAway>(error)) return isProtected; // otherwise the server accepts only TLS
    return isA<NameNotResolved>(error) || isA<CannotConnect>(error) || isA<ClosedByPeer>(error) ||
           isA<DeadlinePassed>(error);
}

/// What the stream said about a lost connection; empty when the connection was not lost.
std::string lossOf(const Error& error)
{
    try {
        std::rethrow_if_nested(error);
    } catch (const StreamIOException& cause) {
        return explain(cause);
    } catch (...) {
        return {};
    }
    return {};
}

std::string noResponseText(const Exchange& exchange)
{
    std::ostringstream text;
    text << "the peer did not answer in time: no response to request " << hexFormat(exchange.function) << '/'
         << hexFormat(exchange.operation);
    return text.str();
}

void requireSendable(const QelMessage& message, bool isRequest, const char* name)
{
    const bool isRightKind = (message.getClassification() == QelMessageClassification::Request) == isRequest;
    if (!isRightKind || message.getClassification() == QelMessageClassification::Response) {
        throw std::invalid_argument(std::string(name) + ": the message is not a " + name);
    }
    if (message.msgLength() > QelMessage::MtuMax) {
        throw std::invalid_argument(std::string(name) + ": longer than a frame may be");
    }
}

} // namespace

Identity completeIdentity(const Identity& identity)
{
    Identity complete = identity;
    if (complete.toolId.empty()) complete.toolId = "qel-" + std::to_string(::getpid());
    return complete;
}

ConsoleCore::ConsoleCore(const ConsoleOptions& options, bool needsAddress)
    : mServer(options.server), mIdentity(completeIdentity(options.identity)), mRequestTimeout(options.requestTimeout),
      mFrameTimeout(std::min(options.frameTimeout, kLongestWait)),
      mHandshakeTimeout(std::min(options.handshakeTimeout, kLongestWait)), mRetry(options.retry),
      mIsConnector(needsAddress), mClosed(std::make_exception_ptr(Error("this console is closed", mServer))),
      mConnector(options, needsAddress)
{}

void ConsoleCore::connect(TimePoint end)
{
    BackoffDelays delays(mRetry.value_or(Backoff()), std::random_device()());
    for (unsigned int attempt = 1;; ++attempt) {
        TimePoint next;
        try {
            return pConnectOnce(end);
        } catch (const Error& error) {
            if (mCloseSwitch.isClosed()) break;
            const bool isLast =
                !mRetry || attempt == mRetry->attempts || !isTemporary(error, mConnector.isProtecting());
            const milliseconds wait = delays.next();
            next = deadlineIn(wait);
            if (isLast || next >= end) throw;
            logLine(LogLevel::Info, error.what(), "; next attempt in ", decFormat(wait.count()), " ms");
        }
        if (!mCloseSwitch.sleepUntil(next)) break;
    }
    throw Error("this console is closed", mServer);
}

void ConsoleCore::adopt(std::unique_ptr<Stream> stream, int descriptor, TimePoint end)
{
    TimePoint handshakeEnd;
    pUse(mConnector.adopt(std::move(stream), descriptor, end, mCloseSwitch, handshakeEnd), handshakeEnd);
}

void ConsoleCore::reconnect(TimePoint end)
{
    if (!mIsConnector) throw std::logic_error("reconnect: the stream was given to the console");
    if (mCloseSwitch.isClosed()) throw Error("this console is closed", mServer);
    if (mIsReconnecting) return; // a handler that is called in the introduction
    if (mLink != nullptr && mLink->isUsable()) mLink->leave(end);
    pDisconnect(std::make_exception_ptr(ClosedByPeer("the connection has been replaced by another one", mServer)));
    pEndSerials(SessionEnd::ConnectionClosed);
    mIsReconnecting = true;
    try {
        connect(end);
    } catch (...) {
        mIsReconnecting = false;
        mUnusable = std::current_exception();
        throw;
    }
    mIsReconnecting = false;
}

void ConsoleCore::leave() noexcept
{
    if (mLink == nullptr) return;
    mLink->leave(TimePoint::max());
    pFailExchanges();
}

void ConsoleCore::dispose() noexcept
{
    mCloseSwitch.close();
    pDisconnect(mClosed);
    // A handler may own a session, which owns this object.
    const auto handlers = std::move(mHandlers);
    const auto otherHandler = std::move(mOtherHandler);
    mHandlers.clear();
    mOtherHandler = nullptr;
}

const QelMessageGetEnclTypeAndInterfaceVersionRsp& ConsoleCore::version() const
{
    using Response = QelMessageGetEnclTypeAndInterfaceVersionRsp;
    const auto* const typed = dynamic_cast<const Response*>(mVersion.get());
    if (typed == nullptr) detail::throwMalformedResponse(*mVersion, typeid(Response).name(), mServer);
    return *typed;
}

PollFd ConsoleCore::getPollFd(PollEvents events) const
{
    if (mLink == nullptr) return PollFd::Ignore;
    PollFd fd = mLink->getPollFd(events);
    if (mIsStuck) fd.mFd.events |= static_cast<short>(PollEvents::Write);
    return fd;
}

bool ConsoleCore::hasPending() const
{
    return mLink != nullptr && (mLink->hasPending() || (mLink->hasGathered() && !mIsStuck && mLink->isUsable()));
}

std::unique_ptr<QelMessage> ConsoleCore::exchange(const QelMessage& request, TimePoint end, Exchanges::Action action)
{
    Exchange exchange(request);
    start(request, exchange, end, SendTime::Now, std::move(action));
    try {
        return finish(exchange, end);
    } catch (...) {
        abandon(exchange);
        throw;
    }
}

std::unique_ptr<QelMessage> ConsoleCore::require(const QelMessage& request, TimePoint end, Exchanges::Action action)
{
    std::unique_ptr<QelMessage> response = exchange(request, end, std::move(action));
    if (response->getStatus() != QelMessageStatusNoError) throw StatusError(*response, mServer);
    return response;
}

void ConsoleCore::start(const QelMessage& request, Exchange& exchange, TimePoint end, SendTime when,
                        Exchanges::Action action)
{
    requireSendable(request, true, "request");
    if (mExchanges.isFull()) throw LimitReached("too many requests are under way without a response", mServer);
    FrameLink& link = pLink();
    const bool isAlone = pIsQuiet() && !link.hasGathered();
    mExchanges.add(request, &exchange, std::move(action));
    try {
        if (when == SendTime::WithOthers && link.hasRoomFor(request)) {
            link.gather(request);
            return mExchanges.noteGathered();
        }
        if (isAlone) return pSend(request, end); // the peer has nothing to say, so it takes the request
        // It fails when a handler ends the connection; the next one does not know it.
        const auto isWanted = [&] { return exchange.failure == nullptr; };
        if (sendAmongOthers(request, end, isWanted) == Sending::Late) throwNotTaken();
    } catch (...) {
        mExchanges.remove(exchange);
        throw;
    }
}

std::unique_ptr<QelMessage> ConsoleCore::finish(Exchange& exchange, TimePoint end)
{
    while (!exchange.isDone()) {
        // A peer that goes on sending something else gains no time by it.
        const bool isLate = !receiveOne(end, end) || (!exchange.isDone() && hasPassed(end));
        if (isLate) throw DeadlinePassed(noResponseText(exchange), mServer);
    }
    if (exchange.failure) std::rethrow_exception(exchange.failure);
    if (exchange.isTaken) throw std::logic_error("the response has been taken");
    exchange.isTaken = true;
    return std::move(exchange.response);
}

void ConsoleCore::send(const QelMessage& notice, TimePoint end)
{
    requireSendable(notice, false, "notice");
    pSend(notice, end);
}

Sending ConsoleCore::sendAmongOthers(const QelMessage& message, TimePoint end, const std::function<bool()>& isWanted)
{
    while (isWanted()) {
        const Ready ready = pLink().await(pFullSerial() == nullptr, end);
        if (ready.send && pLink().hasGathered() && !pLink().hasRoomFor(message)) {
            pFlush(); // there is room for one long write
            continue;
        }
        if (ready.send) {
            pSend(message, end);
            return Sending::Done;
        }
        if (!ready.receive || hasPassed(end)) return Sending::Late;
        // What is there may be a part of a record of TLS: then room to send must not be waited for in vain.
        receiveOne(TimeProvider::steady(), TimePoint::max());
    }
    return Sending::NotWanted;
}

void ConsoleCore::throwNotTaken() const { throw DeadlinePassed("the peer did not take a message in time", mServer); }

bool ConsoleCore::receiveOne(TimePoint begin, TimePoint end)
{
    if (const SerialState* const full = pFullSerial()) {
        throw LimitReached("the session of partition " + std::to_string(full->partition) + " holds " +
                               std::to_string(full->unreadBytes()) + " bytes of output that nobody reads",
                           mServer);
    }
    std::unique_ptr<QelMessage> message;
    while (message == nullptr) {
        const Ready ready = pAwaitTurn(begin);
        if (!ready.send && !ready.receive) return false;
        // While something waits to be sent, only what has arrived is received.
        message = pReceive(ready.send ? begin : TimeProvider::steady(), end);
        if (message == nullptr && (ready.send || hasPassed(begin))) return false;
    }
    if (message->getClassification() != QelMessageClassification::Response) {
        pHandleNotice(*message);
    } else {
        pHandleResponse(std::move(message));
    }
    return true;
}

void ConsoleCore::onNotice(const QelMessageRegistry::Identifier& identity, TypedHandler handler)
{
    if (!handler) {
        mHandlers.erase(identity);
    } else {
        mHandlers[identity] = std::make_shared<const TypedHandler>(std::move(handler));
    }
}

void ConsoleCore::onOtherNotice(Console::NoticeHandler handler)
{
    mOtherHandler = handler ? std::make_shared<const Console::NoticeHandler>(std::move(handler)) : nullptr;
}

void ConsoleCore::openSession(TimePoint end)
{
    if (mIsSessionOpen) return;
    const auto response = exchange(QelMessageInterfaceCmpOpenKrogSessionReq(), end);
    // When an earlier request was given up, its grant may have come before this one's refusal.
    if (!mIsSessionOpen) throw StatusError(*response, mServer);
}

void ConsoleCore::closeSession(TimePoint end)
{
    if (!mIsSessionOpen) return;
    const auto response = exchange(QelMessageInterfaceCmpCloseKrogSessionReq(), end);
    if (mIsSessionOpen) throw StatusError(*response, mServer);
}

void ConsoleCore::pConnectOnce(TimePoint end)
{
    const TimePoint attemptEnd = std::min(end, deadlineIn(mRetry ? mHandshakeTimeout : kLongestWait));
    TimePoint handshakeEnd;
    ConnectedStream connected = mConnector.connect(attemptEnd, mCloseSwitch, handshakeEnd);
    handshakeEnd = std::min(end, handshakeEnd);
    pUse(std::move(connected), handshakeEnd);
}

void ConsoleCore::pUse(ConnectedStream connected, TimePoint handshakeEnd)
{
    mPeer = connected.peer;
    mLink = std::make_unique<FrameLink>(std::move(connected), mServer, mFrameTimeout, mCloseSwitch);
    mIsProtected = mLink->isProtected();
    try {
        pIntroduce(handshakeEnd);
    } catch (...) {
        pDisconnect(std::current_exception());
        throw;
    }
}

/// Sends the version request, which completes the handshake.
void ConsoleCore::pIntroduce(TimePoint end)
{
    const QelMessageGetEnclTypeAndInterfaceVersionReq request(kInterfaceVersion, mIdentity.toolType, kMajorVersion,
                                                              kMinorVersion, mIdentity.toolId);
    try {
        mVersion = require(request, end);
    } catch (const ClosedByPeer& error) {
        const std::string loss = lossOf(error);
        if (!mIsProtected || loss.empty()) throw;
        const std::string alert = mLink->certificateAlert();
        if (!alert.empty()) {
            std::throw_with_nested(CertificateRejected(CertificateRejected::Reason::OursByThem,
                                                       "the server refuses this console's certificate: " + alert,
                                                       mServer));
        }
        // A server that pins its consoles closes without a word, and so does one that crashes. Trying again is right
        // for the second and does no harm with the first.
        std::throw_with_nested(ClosedByPeer("the server closed the connection right after the TLS handshake; it may "
                                            "not accept this console's certificate: " +
                                                loss,
                                            mServer));
    }
}

/// Ends the connection at once. What depends on it fails.
void ConsoleCore::pDisconnect(const std::exception_ptr& failure) noexcept
{
    mLink.reset();
    mIsStuck = false;
    mUnusable = failure;
    mExchanges.failAll(failure);
    mIsSessionOpen = false;
    for (const auto& serial : mSerials)
        serial->isOpen = false;
}

FrameLink& ConsoleCore::pLink()
{
    if (mLink == nullptr) std::rethrow_exception(mUnusable);
    return *mLink;
}

void ConsoleCore::pSend(const QelMessage& message, TimePoint end)
{
    FrameLink& link = pLink();
    const bool hasGathered = link.hasGathered();
    try {
        link.send(message, end);
    } catch (...) {
        mExchanges.failGathered(std::current_exception());
        pFailExchanges();
        throw;
    }
    if (!hasGathered) return;
    mExchanges.noteSent();
    mIsStuck = false;
}

/// Sends what was gathered.
void ConsoleCore::pFlush()
{
    try {
        pLink().flush(TimePoint::max());
    } catch (...) {
        mExchanges.failGathered(std::current_exception());
        pFailExchanges();
        throw;
    }
    mExchanges.noteSent();
    mIsStuck = false;
}

/// Sends what was gathered as soon as the peer takes it, unless there is something to receive without waiting.
/// @return send: nothing is left to be sent; receive: something is, and something has arrived; neither: late
Ready ConsoleCore::pAwaitTurn(TimePoint end)
{
    FrameLink& link = pLink();
    if (!link.hasGathered() || !link.isUsable()) return {true, false};
    if (link.hasPending()) return {false, true};
    // A peer that has nothing to say takes them.
    const Ready ready = pIsQuiet() ? Ready{true, false} : link.await(true, end);
    mIsStuck = !ready.send;
    if (ready.send) pFlush();
    return ready;
}

std::unique_ptr<QelMessage> ConsoleCore::pReceive(TimePoint begin, TimePoint end)
{
    try {
        return pLink().receive(begin, end);
    } catch (...) {
        pFailExchanges();
        throw;
    }
}

/// Nothing can be received any more, if that is so: no request will be answered.
void ConsoleCore::pFailExchanges() noexcept
{
    if (mLink != nullptr && mLink->receiveFailure() != nullptr) mExchanges.failAll(mLink->receiveFailure());
}

void ConsoleCore::pHandleResponse(std::unique_ptr<QelMessage> response)
{
    // Also when no caller waits any more: the hypervisor has done it.
    const bool isGrant = response->getStatus() == QelMessageStatusNoError;
    const bool isOpened = isGrant && isKind<QelMessageInterfaceCmpOpenKrogSessionRsp>(*response);
    const bool isClosed = isGrant && isKind<QelMessageInterfaceCmpCloseKrogSessionRsp>(*response);
    if (const char* const mistake = mExchanges.deliver(std::move(response))) pBreak(mistake);
    if (isOpened) mIsSessionOpen = true;
    if (!isClosed) return;
    mIsSessionOpen = false;
    pEndSerials(SessionEnd::Closed);
}

/// @return whether there was a handler for the class
bool ConsoleCore::pHandleTyped(const QelMessage& message)
{
    const auto found = mHandlers.find(kindOf(message));
    if (found == mHandlers.end()) return false;
    const std::shared_ptr<const TypedHandler> handler = found->second; // it may replace itself
    if (!(*handler)(message)) pBreak("malformed notice " + toString(message.getLogID()));
    return true;
}

void ConsoleCore::pHandleNotice(const QelMessage& message)
{
    if (pHandleSerial(message)) return;
    const bool isEnd = pHandleEnd(message); // first: a handler may throw or connect anew
    const bool isHandled = pHandleTyped(message);
    if (isEnd) return pLink().requireReceiving();
    if (isHandled) return;
    const std::shared_ptr<const Console::NoticeHandler> handler = mOtherHandler;
    if (handler != nullptr) return (*handler)(message);
    logLine(LogLevel::Debug, "ignored ", message.getLogID());
}

/// @return whether the notice ends the connection
bool ConsoleCore::pHandleEnd(const QelMessage& message)
{
    if (isKind<QelMessageKrogConnectionClosedAsync>(message)) {
        pEndSerials(SessionEnd::ConnectionClosed);
        pFail(std::make_exception_ptr(ClosedByPeer("the server closed the connection", mServer)));
        return true;
    }
    if (isKind<QelMessageAbortHandshakeAsync>(message)) {
        const char* const reason = mIsProtected ? "the server turned this console away inside TLS"
                                                : "the server refused the connection: it accepts only TLS";
        pFail(std::make_exception_ptr(TurnedAway(reason, mServer)));
        return true;
    }
    return false;
}

/// Ends the connection, which stays there to say why.
void ConsoleCore::pFail(const std::exception_ptr& failure) noexcept
{
    if (mLink != nullptr) mLink->fail(failure);
    mExchanges.failAll(failure);
}

void ConsoleCore::pBreak(const std::string& reason)
{
    const auto failure = std::make_exception_ptr(ProtocolBroken("the peer broke the protocol: " + reason, mServer));
    pFail(failure);
    std::rethrow_exception(failure);
}

} // namespace qel::protocol
