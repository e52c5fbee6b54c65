#pragma once

#include <qel/protocol/ProtocolExport.hpp>

#include <string>

/// @file
/// The files of certificates and keys: their names, and how they are read.
///
/// In a directory, NAME.crt is the certificate of NAME, NAME.key its private key, NAME.csr its request. The name "root"
/// belongs to the authority: every end needs root.crt, the authority alone needs root.key. "qel ca" writes such
/// directories.
///
/// Thread safety: any thread may call any function.

namespace qel::protocol {

/// The name of the authority in a directory of credentials.
inline constexpr const char* kRootName = "root";

QEL_PROTOCOL_EXPORT std::string certificateFile(const std::string& name);
QEL_PROTOCOL_EXPORT std::string keyFile(const std::string& name);
QEL_PROTOCOL_EXPORT std::string requestFile(const std::string& name);

/// The path of a file in a directory.
QEL_PROTOCOL_EXPORT std::string pathIn(const std::string& directory, const std::string& file);

/// Which files of private keys are accepted.
enum class KeyPermissions {
    OwnerOnly, ///< files of this process's user (or of root) that no other user may read or write
    Any        ///< every file that can be read
};

/// Reads a certificate or a request: a regular file of at most 1 MiB.
/// @throws FileIOError  it cannot be read
/// @throws CredentialsUnusable  it is not a regular file, or too large
QEL_PROTOCOL_EXPORT std::string readPemFile(const std::string& path);

/// Reads a private key. The caller wipes the text when it is not needed any more: see wipe().
/// @throws FileIOError, CredentialsUnusable  as readPemFile(). CredentialsUnusable (Permissions) also because of the
///         file's owner or its permissions, access control lists included: the group bits show what they grant, see
///         acl(5)
QEL_PROTOCOL_EXPORT std::string readKeyFile(const std::string& path, KeyPermissions permissions);

/// Overwrites a secret, so that it is not left in memory, and makes the text empty. The whole capacity is overwritten.
QEL_PROTOCOL_EXPORT void wipe(std::string& secret) noexcept;

/// The files that one end of a connection needs.
struct CredentialPaths {
    std::string certificate;
    std::string key;
    std::string root; ///< the certificate of the authority
};

/// The paths of a name's credentials in a directory. Accesses no file.
QEL_PROTOCOL_EXPORT CredentialPaths credentialPaths(const std::string& directory, const std::string& name);

} // namespace qel::protocol
