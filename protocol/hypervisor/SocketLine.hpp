#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/SerialLine.hpp>
#include <qel/protocol/ServerAddress.hpp>
#include <qel/protocol/SocketLine.hpp>

#include "transport/BackgroundLookup.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <sys/socket.h>
#include <vector>

namespace qel::protocol {

/// An address that connect(2) takes.
struct SocketAddress {
    sockaddr_storage storage;
    socklen_t length; ///< bytes of the storage that count
};

/// The address of a socket at a path. @throws std::invalid_argument  as unixLine()
SocketAddress unixAddress(const std::string& path);

/// Whether a TCP socket is connected to itself. The system makes such a connection when nobody listens on a port of its
/// ephemeral range and it happens to choose this very port for the socket: to keep trying to connect is enough. It
/// would echo, and keep the real peer from listening.
bool isSelfConnected(int fd);

/// A serial line that is a stream socket; its public header says how it behaves.
/// Thread safety: that of a SerialLine.
class SocketLine final : public SerialLine {
public:
    /// How long coming up may take.
    struct Limits {
        std::chrono::milliseconds lookup{10000};  ///< until the resolver has answered
        std::chrono::milliseconds connect{10000}; ///< for all addresses together
    };

    /// The line to one of these addresses.
    /// @param name  of the peer, for texts
    /// @param addresses  at least one
    SocketLine(std::string name, std::vector<SocketAddress> addresses, Limits limits);

    /// The line to a host that is looked up whenever the line comes up.
    SocketLine(ServerAddress server, BackgroundLookup::Resolver resolver, Limits limits);

    ~SocketLine() override;
    SocketLine(const SocketLine&) = delete;
    SocketLine& operator=(const SocketLine&) = delete;

    void start(std::uint16_t partition) override;
    void stop() override;
    bool advance() override;
    bool wantsToWrite() const override;
    PollDeadline advanceAt() const override;
    ReadResult read(char* buffer, std::size_t length) override;
    std::size_t write(const char* data, std::size_t length) override;
    int descriptor() const override;
    std::string endReason() const override;

private:
    enum class State { Down, LookingUp, Connecting, Up, Ended };

    void pCheckLookup();
    void pCheckConnecting();
    void pConnectNext();
    bool pBeginConnect(const SocketAddress& address);
    void pUp();
    [[noreturn]] void pFail(const std::string& attempt, const std::string& reason);

    const std::string mName;                    // of the peer, for texts
    const std::optional<ServerAddress> mServer; // to look up; none: the addresses are fixed
    const BackgroundLookup::Resolver mResolver;
    const Limits mLimits;
    std::vector<SocketAddress> mAddresses;
    std::size_t mNext = 0; // of the addresses, to be tried next
    State mState = State::Down;
    std::optional<BackgroundLookup> mLookup; // kept until it answers: a resolver that hangs costs one thread, not many
    PollDeadline mDeadline;                  // of the look-up, or of connecting to one address
    UniqueFd mSocket;
    std::string mReason; // why it has ended, is about to, or why the last address failed
};

} // namespace qel::protocol
