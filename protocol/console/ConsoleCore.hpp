#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>

#include "base/TimeLeft.hpp"
#include "console/CloseSwitch.hpp"
#include "console/Connector.hpp"
#include "console/Exchange.hpp"
#include "console/FrameLink.hpp"
#include "console/SerialState.hpp"

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qel::protocol {

/// What came of sending a message that had to wait.
enum class Sending {
    Done,
    NotWanted, ///< not any more
    Late,      ///< the peer took nothing in time; the connection is as good as before
};

/// When a request is sent.
enum class SendTime {
    Now,
    WithOthers, ///< before this console waits for anything, or when there is no room to gather more
};

/// What a Console does; shared by the console, its sessions and its pending responses. See Console for the rules.
/// Thread safety: one thread, except close().
class ConsoleCore {
public:
    using TypedHandler = std::function<bool(const QelMessage&)>; ///< false: the notice is malformed

    /// Checks the options; connects nothing.
    /// @param needsAddress  the options must name a server to connect to
    ConsoleCore(const ConsoleOptions& options, bool needsAddress);

    // Connections.

    /// Connects and introduces this console, again and again if the options say so.
    void connect(TimePoint end);
    /// The same over a given stream, once.
    void adopt(std::unique_ptr<Stream> stream, int descriptor, TimePoint end);
    void reconnect(TimePoint end);
    void leave() noexcept;
    /// Any thread.
    void close() noexcept { mCloseSwitch.close(); }
    /// The console is destroyed: closes the connection for good.
    void dispose() noexcept;

    // What is known.

    const std::string& server() const noexcept { return mServer; }
    std::chrono::milliseconds requestTimeout() const noexcept { return mRequestTimeout; }
    const PeerIdentity& peer() const noexcept { return mPeer; }
    bool isProtected() const noexcept { return mIsProtected; }
    const QelMessageGetEnclTypeAndInterfaceVersionRsp& version() const;
    PollFd getPollFd(PollEvents events) const;
    bool hasPending() const;

    // Messages.

    /// Sends a request and waits for its response, whatever its status. A request whose wait fails is abandoned.
    /// @param action  what the response means, also when it comes too late; must not outlive what it uses
    std::unique_ptr<QelMessage> exchange(const QelMessage& request, TimePoint end, Exchanges::Action action = {});
    /// exchange() for a request that must be granted. @throws StatusError
    std::unique_ptr<QelMessage> require(const QelMessage& request, TimePoint end, Exchanges::Action action = {});
    /// Sends a request. Returns without having sent it when the connection ends while others are received; the exchange
    /// has failed then.
    /// @param exchange  made for this request; borrowed until it is done or abandoned
    void start(const QelMessage& request, Exchange& exchange, TimePoint end, SendTime when,
               Exchanges::Action action = {});
    /// Waits for the response to a request.
    std::unique_ptr<QelMessage> finish(Exchange& exchange, TimePoint end);
    void abandon(const Exchange& exchange) noexcept { mExchanges.abandon(exchange); }
    void send(const QelMessage& notice, TimePoint end);
    /// Sends a message; receives others while the peer takes nothing.
    /// @param isWanted  asked before each wait
    Sending sendAmongOthers(const QelMessage& message, TimePoint end, const std::function<bool()>& isWanted);
    [[noreturn]] void throwNotTaken() const;

    /// Sends what was gathered; receives and handles one message. @return false: none began in time
    bool receiveOne(TimePoint begin, TimePoint end);

    void onNotice(const QelMessageRegistry::Identifier& identity, TypedHandler handler);
    void onOtherNotice(Console::NoticeHandler handler);

    // Sessions.

    void openSession(TimePoint end);
    void closeSession(TimePoint end);
    std::shared_ptr<SerialState> openSerial(std::uint16_t partition, const SerialOptions& options, TimePoint end);
    void closeSerial(const std::shared_ptr<SerialState>& state, TimePoint end);
    /// Closes the session without waiting, and forgets it.
    void dropSerial(const std::shared_ptr<SerialState>& state) noexcept;

private:
    void pConnectOnce(TimePoint end);
    void pUse(ConnectedStream connected, TimePoint handshakeEnd);
    void pIntroduce(TimePoint end);
    void pDisconnect(const std::exception_ptr& failure) noexcept;
    FrameLink& pLink();

    void pSend(const QelMessage& message, TimePoint end);
    void pFlush();
    bool pIsQuiet() const noexcept { return mSerials.empty() && mExchanges.isQuiet(); }
    Ready pAwaitTurn(TimePoint end);
    std::unique_ptr<QelMessage> pReceive(TimePoint begin, TimePoint end);
    void pFailExchanges() noexcept;

    void pHandleResponse(std::unique_ptr<QelMessage> response);
    void pHandleOpened(const std::shared_ptr<SerialState>& state, const QelMessage& response) noexcept;
    void pEndSerials(SessionEnd reason) noexcept;
    void pSendClose(const SerialState& state) noexcept;
    bool pHandleSerial(const QelMessage& message);
    bool pHandleTyped(const QelMessage& message);
    void pHandleNotice(const QelMessage& message);
    bool pHandleEnd(const QelMessage& message);
    void pFail(const std::exception_ptr& failure) noexcept;
    [[noreturn]] void pBreak(const std::string& reason);
    void pForget(const SerialState& state) noexcept;
    const SerialState* pFullSerial() const noexcept;

    const std::string mServer;
    const Identity mIdentity;
    const std::chrono::milliseconds mRequestTimeout;
    const std::chrono::milliseconds mFrameTimeout;
    const std::chrono::milliseconds mHandshakeTimeout;
    const std::optional<Backoff> mRetry;
    const bool mIsConnector;          // false: the stream was given
    const std::exception_ptr mClosed; // what calls throw after close(); made beforehand, since dispose() cannot fail
    Connector mConnector;
    CloseSwitch mCloseSwitch;

    std::unique_ptr<FrameLink> mLink; // null: not connected
    std::exception_ptr mUnusable;     // why there is no connection
    PeerIdentity mPeer;
    bool mIsProtected = false;
    std::unique_ptr<QelMessage> mVersion; // the response; null only before the first introduction
    Exchanges mExchanges;
    std::map<QelMessageRegistry::Identifier, std::shared_ptr<const TypedHandler>> mHandlers;
    std::shared_ptr<const Console::NoticeHandler> mOtherHandler;
    std::vector<std::shared_ptr<SerialState>> mSerials;
    bool mIsSessionOpen = false; // the hypervisor session
    bool mIsReconnecting = false;
    bool mIsStuck = false; // the peer has not taken what was gathered
};

} // namespace qel::protocol
