#pragma once

#include "base/ExitStatus.hpp"
#include "transport/TransportOptions.hpp"

#include <chrono>
#include <string>

namespace qel::tool {

/// What "qel proxy --replay" does.
struct ReplayPlan {
    std::string file;
    std::string server;
    TransportOptions transport;
    std::chrono::milliseconds timeout{10000}; ///< for each answer
    bool json = false;
};

/// Replays each connection of a recording over a connection of its own, one after another, and prints how the answers
/// differ.
/// @return Done when all answers are as recorded, else Refused
ExitStatus runReplay(const ReplayPlan& plan);

} // namespace qel::tool
