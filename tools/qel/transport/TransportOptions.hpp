#pragma once

#include <qel/common/security/SSLContext.hpp>

#include "certificates/CredentialFiles.hpp"
#include "transport/PeerPins.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <memory>
#include <string>

/// @file
/// How a connection is protected, as the command line says it: the same options for those that connect and for the one
/// that listens.

namespace qel::tool {

/// Either TLS, with credentials in a directory or in three files, or nothing at all.
struct TransportOptions {
    bool plain = false;    ///< the connection goes unprotected
    std::string directory; ///< holds the credentials of `name`
    std::string name;
    CredentialPaths files; ///< meant unless there is a directory
    KeyPermissions permissions = KeyPermissions::OwnerOnly;
    PeerPins pins;
    double handshakeSeconds = 10; ///< from the connection to a granted version request

    std::chrono::milliseconds handshakeTimeout() const;

    /// Where the credentials lie. Not for a plain connection.
    CredentialPaths paths() const;
};

/// Adds --credentials, --name, --cert, --key, --root, --peer-name, --peer-fingerprint, --insecure-permissions,
/// --handshake-timeout and --plain. What of them cannot go together is a usage error.
void addTransportOptions(CLI::App& app, TransportOptions& options);

/// Looks whether a way was chosen, and may be used for an endpoint: TLS for any, --plain for loopback addresses only.
/// Meant for the parser's callbacks, where its exception becomes a usage error.
/// @throws CLI::ValidationError
void checkTransport(const TransportOptions& options, const std::string& endpoint);

/// Makes a TLS configuration from the credentials that the files hold at this moment.
/// @return null for a plain connection
/// @throws FileIOError  a file cannot be read
/// @throws CommandFailure  Refused: a file does not hold what it should, others may read the key, or the certificate
///                         and the key do not belong together
std::unique_ptr<SSLClientContext> makeClientContext(const TransportOptions& options);
std::unique_ptr<SSLServerContext> makeServerContext(const TransportOptions& options);

} // namespace qel::tool
