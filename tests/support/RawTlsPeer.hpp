#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLTypes.hpp>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace qel::test {

/// A TLS peer made of OpenSSL alone that can misbehave: the test chooses what it offers, and it can send hand-made
/// records.
///
/// All operations return silently when TLS or the stream ends; the end under test reports the failure. Exceptions of
/// the stream propagate. Thread safety: belongs to one thread at a time.
class RawTlsPeer {
public:
    enum Role { Client, Server };

    struct Options {
        const SSLCredentials* credentials = nullptr; ///< presented and trusted; null: presents nothing, trusts all
        int minimumVersion = TLS1_3_VERSION;
        int maximumVersion = TLS1_3_VERSION;
        std::size_t tickets = 0;  ///< that a server sends after the handshake
        bool verifiesPeer = true; ///< a server requires a certificate; a client verifies the server's
    };

    RawTlsPeer(Role role, const Options& options, std::unique_ptr<Stream> stream);
    ~RawTlsPeer();
    RawTlsPeer(const RawTlsPeer&) = delete;
    RawTlsPeer& operator=(const RawTlsPeer&) = delete;

    /// Begins the TLS handshake only: a client sends its offer.
    void beginHandshake();
    /// The TLS handshake alone, without the version byte. @return whether it succeeded
    bool handshake();
    /// Sends data, a record for each call; at most 16384 bytes.
    void write(const std::string& data);
    /// @return `length` bytes of data, fewer when the connection ends
    std::string read(std::size_t length);
    /// The version byte each way.
    void exchangeVersions(char version = 0);

    /// Sends a KeyUpdate message. @param answered  requests new keys of the peer too
    void updateKeys(bool answered);
    /// Sends close_notify.
    void closeNotify();

    /// Holds back everything sent from now on; release() sends it in one write.
    void hold() { mHeld = true; }
    void release();

    /// Makes a record as this end would encrypt it now. The engine does not count it, so only further records of this
    /// kind may follow it.
    /// @param type  23 data, 22 handshake, 21 alert (RFC 8446, 5.1)
    std::string protectedRecord(std::uint8_t type, const std::string& content);
    /// Sends bytes as they are.
    void sendBytes(const std::string& bytes);

    Stream& stream() { return *mStream; }

private:
    static void pKeepSecret(const SSL* ssl, const char* line);

    void pFlush();
    bool pReceive();
    bool pRetry(int result);

    std::unique_ptr<Stream> mStream;
    const Role mRole;
    SSL_CTX_PTR mContext;
    SSL_PTR mSSL;
    BIO* mIn;  // owned by mSSL
    BIO* mOut; // owned by mSSL
    bool mHeld = false;
    std::string mSecret; // of this end's data records
    std::uint64_t mRecordsSent = 0;
};

} // namespace qel::test
