#pragma once

#include <qel/common/net/IPEndpoint.hpp>

#include "TransportOptions.hpp"

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

/// Adds --json.
void addJsonOption(CLI::App& app, bool& json);

/// Accepts the text of an endpoint: "127.0.0.1:4711", "[::1]:4711".
CLI::Validator endpointValidator();

/// Accepts the text of a capability set, as QelCapabilities takes it: up to 32 characters 0 and 1.
CLI::Validator capabilityValidator();

/// Accepts the name of a file that is to be read, unless there is none of that name. A file that cannot be reached or
/// read is no wrong command line: that shows when it is opened.
CLI::Validator fileValidator();

/// Accepts a number from one to the other, both included, and nothing that is no number, such as "nan".
CLI::Validator numberBetween(double least, double most);

/// For options that take whole numbers: a number from one to the other, both included, in decimal or, behind "0x", in
/// hexadecimal digits. Zeros in front mean nothing, so that 010 is ten here as it is everywhere else on a command line.
/// To be used with transform(): the parser itself would take 010 for an octal number.
CLI::Validator wholeNumberBetween(std::uint64_t least, std::uint64_t most);

/// 127.0.0.0/8, ::1, and the former as an IPv4-mapped IPv6 address.
bool isLoopback(const IPAddress& address);

/// The identity with the defaults filled in.
IdentityOptions completeIdentity(const IdentityOptions& options);

} // namespace qel::tool
