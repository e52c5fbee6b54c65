#pragma once

#include "transport/TransportOptions.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <cstdint>
#include <string>

namespace qel::tool {

/// The identity of this console. A hypervisor refuses a second console with the same type and id.
struct IdentityOptions {
    std::uint32_t toolType = 1;
    std::string toolId; ///< at most 32 bytes; empty: "qel-" and the process id
};

/// How to reach the server.
struct ConnectOptions {
    std::string endpoint; ///< as IPEndpoint takes it
    TransportOptions transport;
    double timeoutSeconds = 10; ///< for connecting and all responses together
    IdentityOptions identity;

    std::chrono::milliseconds timeout() const;
};

/// Adds --connect, --timeout, --tool-type, --tool-id and the options of the transport.
void addConnectOptions(CLI::App& app, ConnectOptions& options);

/// The identity with the defaults filled in.
IdentityOptions completeIdentity(const IdentityOptions& options);

} // namespace qel::tool
