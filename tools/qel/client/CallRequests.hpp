#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>

#include "base/Answer.hpp"
#include "base/FrameLimits.hpp"

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

/// @file
/// The requests that "qel call" can send and how their responses read. Nothing here does any input or output.

namespace qel::tool {

/// One request: the message, and what to make of the response to it.
struct CallRequest {
    std::string name; ///< as on the command line
    std::unique_ptr<QelMessage>
        message;               ///< null: the version request that opens every connection is the request itself
    bool needsSession = false; ///< the hypervisor session must be open

    /// Reads the response, whose status is zero.
    /// @throws QelMessageValidationException  the response is not what its identity promises
    std::function<Answer(const QelMessage&)> describe;
};

/// To whom a broadcast goes.
struct BroadcastAddress {
    std::uint8_t type = 0; ///< 1: to one tool, the one named by the other two
    std::uint32_t toolType = 0;
    std::string toolId;
};

CallRequest versionRequest();
CallRequest capabilitiesRequest(const QelCapabilities& offered);
CallRequest limitsRequest();
CallRequest timeRequest();
CallRequest maxSessionsRequest();
CallRequest getModeRequest();
CallRequest setModeRequest(std::uint8_t mode, const std::string& mtms);
CallRequest getMetadataRequest();
CallRequest setMetadataRequest(const std::string& metadata);
/// @param text  at most kMaxBroadcast bytes
/// @throws QelMessageValidationException  the address is one that no broadcast can be built for
CallRequest broadcastRequest(const BroadcastAddress& address, const std::string& text);

} // namespace qel::tool
