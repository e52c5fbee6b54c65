#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/protocol/FrameLimits.hpp>

#include "base/Answer.hpp"
#include "base/Library.hpp"

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

/// @file
/// The requests of "qel call" and the contents of their responses. No input or output happens here.

namespace qel::tool {

/// One request and how to read its response.
struct CallRequest {
    std::string name;                    ///< as on the command line
    std::unique_ptr<QelMessage> message; ///< null: the version request, which every connection begins with anyway
    bool needsSession = false;           ///< the hypervisor session must be open

    /// Reads a response with status zero.
    /// @throws QelMessageValidationException, ProtocolBroken  the payload is malformed
    std::function<Answer(const QelMessage&)> describe;
};

/// The addressees of a broadcast.
struct BroadcastAddress {
    std::uint8_t type = 0; ///< 1: the console with this tool type and id; others: all consoles
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
/// @throws QelMessageValidationException  type 1 without a tool id
CallRequest broadcastRequest(const BroadcastAddress& address, const std::string& text);

} // namespace qel::tool
