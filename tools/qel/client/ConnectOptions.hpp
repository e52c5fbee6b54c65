#pragma once

#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>

#include "base/Library.hpp"
#include "transport/TransportOptions.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <string>

namespace qel::tool {

/// How to reach the server.
struct ConnectOptions {
    std::string server; ///< as ServerAddress::parse() takes it
    TransportOptions transport;
    double timeoutSeconds = 10; ///< for connecting and all responses together
    Identity identity;

    std::chrono::milliseconds timeout() const;
};

/// Adds --connect, --timeout, --tool-type, --tool-id and the options of the transport.
void addConnectOptions(CLI::App& app, ConnectOptions& options);

/// Checks that the options select TLS or --plain, and --plain for a loopback address only. The addresses of a host name
/// are checked when it is looked up. Call it in the parser's callback, where its exception becomes a usage error.
/// @throws CLI::ValidationError
void checkConnect(const ConnectOptions& options);

/// What the library needs to connect. Reads the credentials.
/// @throws FileIOError, CredentialsUnusable  the credentials cannot be used
ConsoleOptions libraryOptions(const ConnectOptions& options);

/// Connects within the timeout. Each request and each message of the console has the timeout too.
/// @throws CommandFailure  Usage: --plain, and the host name has an address that is not a loopback address
/// @throws FileIOError, CredentialsUnusable  the credentials cannot be used
/// @throws Error  as the constructor of Console
Console connectConsole(const ConnectOptions& options);

/// The rest of a timeout for several steps together; 0 when it has passed.
std::chrono::milliseconds timeLeft(std::chrono::steady_clock::time_point end);

} // namespace qel::tool
