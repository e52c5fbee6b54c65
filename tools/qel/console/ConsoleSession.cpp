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

/// The message as a T; null when it is something else.
/// @throws CommandFailure  ProtocolBroken: it says that it is a T, and is none
template <typename T>
const T* as(const QelMessage& message)
{
    const auto* typed = dynamic_cast<const T*>(&message);
    if (typed == nullptr && hasIdentityOf<T>(message)) {
        throw CommandFailure(ExitStatus::ProtocolBroken, "malformed notice " + toString(message.getLogID()));
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
        return "session closed: read failure, the command has ended";
    case SessionEnd::Taken:
        return "session closed: force close by another console";
    case SessionEnd::ShutDown:
        return "session closed: shutdown of the hypervisor end";
    case SessionEnd::WriteFailure:
        return "session closed: write failure, the partition takes no input";
    case SessionEnd::Unknown:
        return "session closed: unknown reason";
    case SessionEnd::ConnectionClosed:
        break;
    }
    return "the hypervisor closed the connection";
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
        "open serial session", QelMessageVirtualSerialOpenReq(mAddress.partition, mAddress.connection, force)));
    mIsSerialOpen = true;
    static_cast<void>(mConnection.require(
        "set up serial session", QelMessageVirtualSerialSetupSessionReq(mAddress.partition, mAddress.connection)));
}

void ConsoleSession::send(std::string& typed)
{
    const std::size_t length = std::min(typed.size(), kMostData);
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
        // A session that ended while the request was on its way has nothing left to close; its notice came first.
        if (mIsSerialOpen && response->getStatus() != QelMessageStatusNoError) {
            throw RequestRefused("close serial session", *response);
        }
        mIsSerialOpen = false;
        if (mEnd == SessionEnd::ShutDown) return;
    }
    mConnection.setDeadline(mTimeout);
    static_cast<void>(mConnection.require("close session", QelMessageInterfaceCmpCloseKrogSessionReq()));
}

void ConsoleSession::pHandle(const QelMessage& message)
{
    if (as<QelMessageKrogConnectionClosedAsync>(message) != nullptr) {
        mIsSerialOpen = false;
        mEnd = SessionEnd::ConnectionClosed;
        return;
    }
    if (message.getClassification() == QelMessageClassification::Response) {
        throw CommandFailure(ExitStatus::ProtocolBroken, "response to a request that was not made");
    }
    pHandleNotice(message);
}

void ConsoleSession::pHandleNotice(const QelMessage& message)
{
    if (const auto* data = as<QelMessageVirtualSerialDataToDaxAsync>(message)) {
        if (pIsOurs(*data)) return mReceiver.onOutput(data->getSerialData(), data->getSerialDataLength());
    } else if (const auto* closed = as<QelMessageVirtualSerialSessionClosedAsync>(message)) {
        if (pIsOurs(*closed)) return pEnd(*closed);
    } else if (const auto* broadcast = as<QelMessageDaxBroadcastOutboundAsync>(message)) {
        return mReceiver.onBroadcast(*broadcast);
    }
    logLine(LogLevel::Warn, "ignored ", message.getLogID());
}

void ConsoleSession::pEnd(const QelMessageVirtualSerialSessionClosedAsync& notice)
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
        break;
    case Notice::CloseReasonWriteFailure:
        mEnd = SessionEnd::WriteFailure;
        break;
    default:
        mEnd = SessionEnd::Unknown;
        break;
    }
}

/// False also before the session is open and after it has ended.
template <typename T>
bool ConsoleSession::pIsOurs(const T& notice) const
{
    return mIsSerialOpen && notice.getLpId() == mAddress.partition &&
           notice.getVssConnectionNumber() == mAddress.connection;
}

} // namespace qel::tool
