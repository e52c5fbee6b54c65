#include "console/ConsoleSession.hpp"

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"

#include <algorithm>
#include <tuple>

namespace qel::tool {

namespace {

template <typename T>
bool hasIdentityOf(const QelMessage& message)
{
    return std::make_tuple(static_cast<unsigned short>(message.getFunction()),
                           static_cast<unsigned short>(message.getOperation()),
                           message.getClassification()) == T::getMessageID();
}

/// The message as a T; null when it is another message.
/// @throws CommandFailure  ProtocolBroken: it has the identity of a T, but its payload is malformed
template <typename T>
const T* as(const QelMessage& message)
{
    const auto* typed = dynamic_cast<const T*>(&message);
    if (typed == nullptr && hasIdentityOf<T>(message)) {
        throw CommandFailure(ExitStatus::ProtocolBroken,
                             "the peer broke the protocol: malformed notice " + toString(message.getLogID()));
    }
    return typed;
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
    case SessionEnd::ConnectionClosed:
        break;
    }
    return "the server closed the connection";
}

ExitStatus exitStatusOf(SessionEnd end)
{
    switch (end) {
    case SessionEnd::None:
    case SessionEnd::CommandEnded:
        return ExitStatus::Done;
    case SessionEnd::Taken:
        return ExitStatus::Refused;
    default:
        return ExitStatus::ClosedByPeer;
    }
}

ConsoleSession::ConsoleSession(ClientConnection& connection, Address address, std::chrono::milliseconds timeout,
                               Receiver& receiver)
    : mConnection(connection), mAddress(address), mTimeout(timeout), mReceiver(receiver)
{
    mConnection.setNoticeHandler([this](const QelMessage& message) { pHandleNotice(message); });
}

ConsoleSession::~ConsoleSession() { mConnection.setNoticeHandler(nullptr); }

void ConsoleSession::open(bool force)
{
    openHypervisorSession(mConnection);
    static_cast<void>(mConnection.require(
        "open serial session", QelMessageVirtualSerialOpenReq(mAddress.partition, mAddress.connection, force),
        pSubject()));
    mIsSerialOpen = true;
    static_cast<void>(mConnection.require(
        "set up serial session", QelMessageVirtualSerialSetupSessionReq(mAddress.partition, mAddress.connection),
        pSubject()));
}

void ConsoleSession::send(std::string& typed)
{
    const std::size_t length = std::min(typed.size(), kMaxData);
    mConnection.setDeadline(mTimeout);
    mConnection.send(QelMessageVirtualSerialDataToOsAsync(mAddress.partition, mAddress.connection,
                                                          static_cast<std::uint16_t>(length), typed.data()));
    typed.erase(0, length);
}

void ConsoleSession::receive()
{
    mConnection.setDeadline(mTimeout);
    pHandle(*mConnection.receive());
}

void ConsoleSession::close()
{
    if (mEnd == SessionEnd::ShutDown || mEnd == SessionEnd::ConnectionClosed) return;
    mConnection.setDeadline(mTimeout);
    if (mIsSerialOpen) {
        const QelMessageVirtualSerialCloseReq request(mAddress.partition, mAddress.connection, false);
        const auto response = mConnection.exchange(request);
        // The session may have ended while the request was on its way; its notice then came before the response.
        if (mIsSerialOpen && response->getStatus() != QelMessageStatusNoError) {
            throw RequestRefused("close serial session", *response, pSubject());
        }
        mIsSerialOpen = false;
        if (mEnd == SessionEnd::ShutDown) return;
    }
    mConnection.setDeadline(mTimeout);
    static_cast<void>(mConnection.require("close session", QelMessageInterfaceCmpCloseKrogSessionReq()));
}

std::string ConsoleSession::describeEnd() const
{
    if (mEnd != SessionEnd::CommandEnded) return describe(mEnd);
    return "session closed: " + describe(mCommandEnd);
}

/// What the requests are about, for RequestRefused.
std::string ConsoleSession::pSubject() const { return "partition " + std::to_string(mAddress.partition); }

void ConsoleSession::pHandle(const QelMessage& message)
{
    if (as<QelMessageKrogConnectionClosedAsync>(message) != nullptr) {
        mIsSerialOpen = false;
        mEnd = SessionEnd::ConnectionClosed;
        return;
    }
    if (message.getClassification() == QelMessageClassification::Response) {
        throw CommandFailure(ExitStatus::ProtocolBroken,
                             "the peer broke the protocol: a response to a request that was not sent");
    }
    pHandleNotice(message);
}

void ConsoleSession::pHandleNotice(const QelMessage& message)
{
    if (const auto* data = as<QelMessageVirtualSerialDataToDaxAsync>(message)) {
        if (pIsOurs(*data)) return mReceiver.onOutput(data->getSerialData(), data->getSerialDataLength());
    } else if (const auto* closed = as<QelMessageVirtualSerialSessionClosedAsync>(message)) {
        if (pIsOurs(*closed)) return pEndSession(*closed);
    } else if (const auto* broadcast = as<QelMessageDaxBroadcastOutboundAsync>(message)) {
        return mReceiver.onBroadcast(*broadcast);
    }
    logLine(LogLevel::Warn, "ignored ", message.getLogID());
}

void ConsoleSession::pEndSession(const QelMessageVirtualSerialSessionClosedAsync& notice)
{
    using Notice = QelMessageVirtualSerialSessionClosedAsync;
    mIsSerialOpen = false;
    switch (notice.getCloseReason()) {
    case Notice::CloseReasonForceClose:
        mEnd = SessionEnd::Taken;
        break;
    case Notice::CloseReasonQelShutdown:
        mEnd = SessionEnd::ShutDown;
        break;
    case Notice::CloseReasonReadFailure:
        mEnd = SessionEnd::CommandEnded;
        mCommandEnd = commandEndFrom(notice.getStatusDetail());
        break;
    case Notice::CloseReasonWriteFailure:
        mEnd = SessionEnd::WriteFailure;
        break;
    default:
        mEnd = SessionEnd::Unknown;
        break;
    }
}

/// True while the session is open and the notice is about it.
template <typename T>
bool ConsoleSession::pIsOurs(const T& notice) const
{
    return mIsSerialOpen && notice.getLpId() == mAddress.partition &&
           notice.getVssConnectionNumber() == mAddress.connection;
}

} // namespace qel::tool
