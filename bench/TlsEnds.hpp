#pragma once

#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/security/SSLTypes.hpp>

#include "Loopback.hpp"

#include <functional>
#include <memory>

/// @file
/// TLS connections for the contests, ours and OpenSSL's own. All of them use the same certificates and the same
/// settings: TLS 1.3, mutual authentication, no tickets, no session cache.

namespace qel::bench {

/// Credentials of both ends. They are made on first use, since that takes a second.
const SSLCredentials& clientCredentials();
const SSLCredentials& serverCredentials();

/// Throws unless a call of OpenSSL has succeeded.
void checkCall(bool succeeded, const char* call);

/// A context made with OpenSSL alone, with the same settings as ours.
SSL_CTX_PTR rawContext(const SSLCredentials& credentials);

/// Runs the far end's part on a thread of its own, while the near end's runs here.
void bothEnds(const std::function<void()>& near, const std::function<void()>& far);

/// Our contexts.
struct OurContexts {
    OurContexts();
    SSLClientContext client;
    SSLServerContext server;
};

/// A connection of ours over loopback.
struct OurTlsPair {
    /// @param contexts  needed only here
    OurTlsPair(OurContexts& contexts, TcpPair&& pair);
    void handshake();

    std::unique_ptr<SSLStream> near;
    std::unique_ptr<SSLStream> far;
};

/// The same contexts made with OpenSSL alone.
struct RawContexts {
    RawContexts();
    SSL_CTX_PTR client;
    SSL_CTX_PTR server;
};

/// OpenSSL on the two descriptors of a connection over loopback.
struct RawTlsPair {
    /// @param contexts  needed only here
    /// @param pair      must outlive this
    RawTlsPair(const RawContexts& contexts, const TcpPair& pair);
    /// The handshake, and one byte each way, as ours does.
    void handshake();

    SSL_PTR near;
    SSL_PTR far;
};

void rawWrite(SSL* connection, const char* buffer, std::size_t length);
/// Reads exactly so many bytes.
void rawRead(SSL* connection, char* buffer, std::size_t length);

} // namespace qel::bench
