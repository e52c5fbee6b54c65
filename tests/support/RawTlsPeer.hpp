#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLTypes.hpp>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace qel::test {

/// The other end of a TLS connection, made of OpenSSL alone and able to misbehave: it offers what it is told to, and
/// can send records of its own making.
///
/// Everything returns quietly when TLS or the stream ends; what went wrong is for the end under test to report. An
/// exception of the stream comes through.
/// Thread safety: belongs to one thread at a time.
class RawTlsPeer {
public:
    enum Role { Client, Server };

    struct Options {
        const SSLCredentials* credentials = nullptr; ///< what it presents and trusts; null: no certificate, trusts all
        int minimumVersion = TLS1_3_VERSION;
        int maximumVersion = TLS1_3_VERSION;
        std::size_t tickets = 0;  ///< that a server sends after the handshake
        bool verifiesPeer = true; ///< a server demands a certificate; a client looks at the server's
    };

    RawTlsPeer(Role role, const Options& options, std::unique_ptr<Stream> stream);
    ~RawTlsPeer();
    RawTlsPeer(const RawTlsPeer&) = delete;
    RawTlsPeer& operator=(const RawTlsPeer&) = delete;

    /// Only begins the TLS handshake: a client sends its offer.
    void beginHandshake();
    /// The TLS handshake alone, without the version byte. @return whether it succeeded
    bool handshake();
    /// Sends data, a record for each call; at most 16384 bytes.
    void write(const std::string& data);
    /// @return that many bytes of data, fewer when the connection ends
    std::string read(std::size_t length);
    /// The version byte each way.
    void exchangeVersions(char version = 0);

    /// Sends a KeyUpdate message. @param answered  the peer shall change its keys, too
    void updateKeys(bool answered);
    /// Says that no more data will come, as TLS wants it.
    void closeNotify();

    /// Collects what is sent from here on; release() sends all of it in one write.
    void hold() { mHeld = true; }
    void release();

    /// Makes a record as this end would encrypt it at this moment. The engine does not know of it, so once it is sent
    /// only further records of this kind may follow.
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
