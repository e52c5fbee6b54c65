#pragma once

#include "serve/ConsoleLink.hpp"

#include <cstdint>
#include <string>
#include <utility>

namespace qel::tool {

/// Numbers the connections of a server, in the order in which they came; no number comes twice.
using ConsoleId = std::uint64_t;

/// How far a connection has come. docs/connection.md has the table of what is answered in which state.
enum class ConsoleState {
    Connected,  ///< has not introduced itself
    Identified, ///< has, by a granted version request
    Closing     ///< is on its way out: nothing it sends is looked at any more
};

/// What the hypervisor knows about one connection. Belongs to the hypervisor and is guarded by its lock.
struct Console {
    Console(ConsoleId number, std::string from, ConsoleLink& to) : id(number), peer(std::move(from)), link(to) {}

    ConsoleId id;
    std::string peer;  ///< where it comes from, for the log
    ConsoleLink& link; ///< outlives the entry: see Hypervisor::connect()
    ConsoleState state = ConsoleState::Connected;
    std::uint32_t toolType = 0; ///< from here on: meaningful once it is identified
    std::string toolId;
    bool sessionOpen = false; ///< the hypervisor session
};

} // namespace qel::tool
