#pragma once

#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/PeerPins.hpp>

#include "base/Library.hpp"
#include "certificates/CredentialFiles.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <optional>
#include <string>

/// @file
/// The options that say how connections are protected. They are the same for clients and for the server.

namespace qel::tool {

/// TLS, with credentials from a directory or from three files, or no protection.
struct TransportOptions {
    bool plain = false;    ///< no TLS
    std::string directory; ///< holds the credentials of `name`
    std::string name;
    CredentialPaths files; ///< used when `directory` is empty
    KeyPermissions permissions = KeyPermissions::OwnerOnly;
    PeerPins pins;
    double handshakeSeconds = 10; ///< from the TCP connection to the granted version request

    std::chrono::milliseconds handshakeTimeout() const;

    /// The files of the credentials. Not for plain connections.
    CredentialPaths paths() const;
};

/// Adds --credentials, --name, --cert, --key, --root, --peer-name, --peer-fingerprint, --insecure-permissions,
/// --handshake-timeout and --plain. Combinations that contradict each other are usage errors.
void addTransportOptions(CLI::App& app, TransportOptions& options);

/// Checks that the options select TLS or --plain, and --plain for a loopback address only. Call it in the parser's
/// callback, where its exception becomes a usage error.
/// @throws CLI::ValidationError
void checkTransport(const TransportOptions& options, const std::string& endpoint);

/// The two parts of it.
void checkCredentials(const TransportOptions& options);
void checkPlain(const TransportOptions& options, const std::string& endpoint);

/// The line for the user when --plain is refused.
std::string plainRefusal(const std::string& server);

/// Reads the credentials from their files as they are now.
/// @return none for a plain connection
/// @throws FileIOError, CredentialsUnusable  as Credentials::fromFiles()
std::optional<Credentials> loadCredentials(const TransportOptions& options);

} // namespace qel::tool
