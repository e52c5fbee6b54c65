#pragma once

#include <qel/common/stats/QelMessageLatencyBuckets.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>
#include <qel/protocol/Peer.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace qel::protocol {

/// Why a connection ended before its console was connected: before its version request was granted.
enum class ConnectionRefusal : unsigned int {
    TooManyHandshakes,   ///< ServerOptions::maxHandshakes
    TooManyFromAddress,  ///< ServerOptions::maxHandshakesPerAddress
    TooManyConsoles,     ///< ServerOptions::maxConsoles were connected, or the server stops
    NotInTime,           ///< ServerOptions::handshakeTimeout
    Malformed,           ///< it sent something else than the protocol allows, such as no request for TLS
    CertificateRejected, ///< its certificate was not accepted, or it did not accept the server's
    NotPinned,           ///< ServerOptions::pins
    RequestRefused,      ///< its version request was answered with a status that closes the connection
    Left,                ///< it closed the connection, or the connection broke
    Other                ///< a failure on this machine or in TLS; the log says which
};
constexpr std::size_t kConnectionRefusals = 10;

/// One word for a reason, such as "certificate". Thread safety: any thread.
QEL_PROTOCOL_EXPORT const char* refusalWord(ConnectionRefusal reason) noexcept;

/// The messages for one console or for all. Lengths are those of whole frames.
struct QueueState {
    QelMessageCount pending;          ///< on their way at this moment, those that wait for room in the queue included
    QelMessageCount sent;             ///< that have left the queue
    QelMessageCount dropped;          ///< broadcasts that found no room
    std::uint64_t mostBytes = 0;      ///< the most that was in the queue at a time; of all: the most of any console
    QelMessageLatencyBuckets latency; ///< from entering the queue to leaving it
};

/// A console that is connected, or a connection that has not got so far.
struct ConnectedConsole {
    Peer peer;                                   ///< id 0: it is in the TLS handshake, and only its address is known
    bool isIdentified = false;                   ///< its version request has been granted
    std::chrono::system_clock::time_point since; ///< when it connected
    QelMessageCount received;
    QueueState queue;
};

/// What a server does at one moment, and has done since it was made: see Server::state().
struct ServerState {
    std::chrono::system_clock::time_point since;
    std::vector<ConnectedConsole> consoles; ///< in the order of connecting
    std::uint64_t accepted = 0;             ///< connections, those that were refused included
    /// By ConnectionRefusal.
    std::array<std::uint64_t, kConnectionRefusals> refused{};

    // Of all connections, those that have ended included.
    QelMessageCount received;
    QueueState queues;
};

} // namespace qel::protocol
