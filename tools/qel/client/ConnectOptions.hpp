#pragma once

#include "transport/TransportOptions.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <cstdint>
#include <string>

namespace qel::tool {

/// How this process introduces itself to the hypervisor. Two consoles with the same type and id are one console to it,
/// and the second is turned away.
struct IdentityOptions {
    std::uint32_t toolType = 1;
    std::string toolId; ///< at most 32 bytes; empty: "qel-" and the process id
};

/// How to reach the hypervisor end.
struct ConnectOptions {
    std::string endpoint; ///< as IPEndpoint takes it
    TransportOptions transport;
    double timeoutSeconds = 10; ///< for connecting and the answers to all requests together
    IdentityOptions identity;

    std::chrono::milliseconds timeout() const;
};

/// Adds --connect, --timeout, --tool-type, --tool-id and the options of the transport.
void addConnectOptions(CLI::App& app, ConnectOptions& options);

/// The identity with the defaults filled in.
IdentityOptions completeIdentity(const IdentityOptions& options);

} // namespace qel::tool
