#pragma once

#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/protocol/CredentialFiles.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <memory>
#include <string>

namespace qel::protocol {

/// What one end of a connection needs for TLS: its certificate, the private key of it, and the root certificate that it
/// trusts. They are read and checked on construction, so that a mistake is reported with the name of the file.
///
/// Holds the key as text, and overwrites that text when the object is destroyed or assigned to. Keep it only as long as
/// contexts are to be made from it.
/// Thread safety: that of a plain value.
class QEL_PROTOCOL_EXPORT Credentials {
public:
    /// Reads NAME.crt, NAME.key and root.crt of a directory, as "qel ca" writes them.
    /// @throws as fromFiles()
    static Credentials fromDirectory(const std::string& directory, const std::string& name,
                                     KeyPermissions permissions = KeyPermissions::OwnerOnly);

    /// Reads three PEM files.
    /// @throws FileIOError  a file cannot be read
    /// @throws CredentialsUnusable  a file does not hold what it should; the key belongs to another user, or others may
    ///         read or write it; certificate and key do not belong together; the certificate or the root is expired or
    ///         not yet valid
    static Credentials fromFiles(const CredentialPaths& paths, KeyPermissions permissions = KeyPermissions::OwnerOnly);

    /// Takes three PEM texts, for example from certificates made in the same process. Wipes nothing of the argument.
    /// @throws CredentialsUnusable  as fromFiles()
    static Credentials fromTexts(const SSLCredentials& texts);

    Credentials(const Credentials& other);
    Credentials& operator=(const Credentials& other);
    Credentials(Credentials&& other) noexcept;
    Credentials& operator=(Credentials&& other) noexcept;
    ~Credentials();

    /// A new TLS configuration for consoles, or for servers. Not for a moved-from object.
    /// @throws SSLException  OpenSSL cannot make it
    std::unique_ptr<SSLClientContext> makeClientContext() const;
    std::unique_ptr<SSLServerContext> makeServerContext() const;

private:
    explicit Credentials(SSLCredentials&& texts) noexcept;

    SSLCredentials mTexts;
};

} // namespace qel::protocol
