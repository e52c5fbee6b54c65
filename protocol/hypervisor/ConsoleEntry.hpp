#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/DisconnectReason.hpp>
#include <qel/protocol/Peer.hpp>

#include "hypervisor/ConsoleLink.hpp"

#include <chrono>
#include <cstdint>
#include <optional>
#include <utility>

namespace qel::protocol {

/// Numbers the connections of a server in the order of connecting, from 1. No number is used twice.
using ConsoleId = std::uint64_t;

/// The state of a connection. docs/connection.md has the table of what is answered in which state.
enum class ConsoleState {
    Connected,  ///< not identified yet
    Identified, ///< its version request was granted
    Closing     ///< its connection is being closed: further messages are ignored
};

/// The hypervisor's entry for one connection. The hypervisor owns it and guards it with its lock.
struct ConsoleEntry {
    ConsoleEntry(Peer from, ConsoleLink& to) : peer(std::move(from)), link(to) {}

    Peer peer;         ///< its tool type and id are taken once it is identified
    ConsoleLink& link; ///< outlives the entry: see HypervisorEngine::connect()
    ConsoleState state = ConsoleState::Connected;
    bool sessionOpen = false; ///< the hypervisor session
    bool announced = false;   ///< Hypervisor::onConnected() has been called

    std::chrono::steady_clock::time_point heardAt; ///< its newest message that counts; used with an idle limit only
    std::optional<DisconnectReason> end;           ///< why the hypervisor has ended the connection; empty: it has not
    PollDeadline cutAt;                            ///< of a console that is let go: to take what is queued for it
};

} // namespace qel::protocol
