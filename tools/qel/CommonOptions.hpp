#pragma once

#include <qel/common/net/IPEndpoint.hpp>

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
    std::string endpoint;       ///< as IPEndpoint takes it
    bool plain = false;         ///< the connection may go unprotected
    double timeoutSeconds = 10; ///< for connecting and the answers to all requests together
    IdentityOptions identity;

    std::chrono::milliseconds timeout() const;
};

/// Adds --connect, --plain, --timeout, --tool-type and --tool-id.
void addConnectOptions(CLI::App& app, ConnectOptions& options);

/// Adds --json.
void addJsonOption(CLI::App& app, bool& json);

/// Adds --plain, for the end that listens as well as for the one that connects.
void addPlainOption(CLI::App& app, bool& plain);

/// Accepts the text of an endpoint: "127.0.0.1:4711", "[::1]:4711".
CLI::Validator endpointValidator();

/// The endpoint, if the options allow a connection to it: --plain must be given, and the address be a loopback one.
/// Meant for the parser's callbacks, where its exception becomes a usage error.
/// @throws CLI::ValidationError  the options do not allow it
IPEndpoint checkedEndpoint(const std::string& endpoint, bool plain);

/// 127.0.0.0/8, ::1, and the former as an IPv4-mapped IPv6 address.
bool isLoopback(const IPAddress& address);

/// The identity with the defaults filled in.
IdentityOptions completeIdentity(const IdentityOptions& options);

} // namespace qel::tool
