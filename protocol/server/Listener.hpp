#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/Poll.hpp>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace qel::protocol {

/// The sockets on which a server listens. They pause together when a connection could not be accepted for want of
/// descriptors or memory.
/// Thread safety: one thread owns it.
class Listener {
public:
    /// Before the next attempt, unless resume() comes first.
    static constexpr std::chrono::milliseconds kPause{1000};

    /// @param endpoints  port 0 lets the system choose one
    /// @param descriptors  of sockets that listen already; duplicated
    /// @throws CannotListen  "cannot listen on ENDPOINT: ...", "cannot listen on descriptor N: ..."
    explicit Listener(const std::vector<IPEndpoint>& endpoints, const std::vector<int>& descriptors = {});
    ~Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    /// In the order of construction, with the ports that the system has chosen. @throws PosixError
    std::vector<IPEndpoint> endpoints() const;

    /// Adds what to wait for.
    void addTo(PollSet& set) const;

    /// The end of the pause; disabled: there is none.
    const PollDeadline& pausedUntil() const noexcept { return mPausedUntil; }

    /// Accepts a connection on one socket that is ready, a different one each time.
    /// @return empty: none is ready, or the connection is gone already
    /// @throws PosixError  no descriptor or memory is left for it; the next attempt comes after the pause
    std::optional<Socket> accept(const PollResult& ready);

    /// Pauses, because what has been accepted cannot be served.
    void pause();

    /// Ends the pause: descriptors may be free again.
    void resume() noexcept { mPausedUntil = PollDeadline(); }

private:
    std::vector<Socket> mSockets;
    std::size_t mNext = 0; // the socket to ask first
    PollDeadline mPausedUntil;
};

} // namespace qel::protocol
