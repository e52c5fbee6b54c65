#pragma once

#include <qel/common/security/SSLCredentials.hpp>

#include "base/UniqueFd.hpp"

#include <CLI/CLI.hpp>
#include <csignal>
#include <initializer_list>
#include <string>
#include <sys/types.h>
#include <vector>

/// @file
/// The files of certificates, keys and requests: where they lie, how they are read and how they are written.
///
/// A directory holds them by name: NAME.crt is the certificate of NAME, NAME.key its private key, NAME.csr its request.
/// The name "root" belongs to the authority itself; every end needs its root.crt, nobody else needs its root.key.

namespace qel::tool {

/// The name of the authority in a directory of credentials.
inline constexpr const char* kRootName = "root";

std::string certificateFile(const std::string& name);
std::string keyFile(const std::string& name);
std::string requestFile(const std::string& name);

/// The path of a file in a directory.
std::string pathIn(const std::string& directory, const std::string& file);

/// Accepts a name for credentials: 1 to 64 letters, digits, '.', '_' and '-', of which the first is a letter or a
/// digit, so that it is one file's name in the directory and no option. "root" is a name like any other here.
CLI::Validator credentialNameValidator();

/// Whether a private key is taken from a file that others than its owner may read or write.
enum class KeyPermissions { OwnerOnly, Any };

/// Adds --insecure-permissions.
void addKeyPermissionsOption(CLI::App& app, KeyPermissions& permissions);

/// Reads a certificate or a request: a regular file of at most 1 MiB.
/// @throws FileIOError  it cannot be read
/// @throws CommandFailure  Refused: it is no regular file, or too large
std::string readPemFile(const std::string& path);

/// The same for a private key.
/// @throws CommandFailure  Refused: also because of its permissions. What an access control list grants counts, too:
///                         the bits of the group show it, see acl(5)
std::string readKeyFile(const std::string& path, KeyPermissions permissions);

/// The files that one end of a connection needs.
struct CredentialPaths {
    std::string certificate;
    std::string key;
    std::string root; ///< the certificate of the authority
};

/// Where the credentials of a name lie in a directory. Looks at no file.
CredentialPaths credentialPaths(const std::string& directory, const std::string& name);

/// Reads the three files. What is in them is not looked at; SSLContext::setCredentials() does.
/// @throws FileIOError, CommandFailure  as readPemFile() and readKeyFile()
SSLCredentials readCredentials(const CredentialPaths& paths, KeyPermissions permissions);

/// Makes a directory that only its owner may enter; one that is there stays as it is.
/// @throws FileIOError  it cannot be made
void makeDirectory(const std::string& path);

/// Postpones the signals that ask this process to end (SIGHUP, SIGINT, SIGQUIT, SIGTERM) until it is destroyed.
/// Thread safety: for programs with one thread.
class EndPostponed {
public:
    EndPostponed();
    ~EndPostponed();
    EndPostponed(const EndPostponed&) = delete;
    EndPostponed& operator=(const EndPostponed&) = delete;

private:
    sigset_t mBefore;
};

/// Files that appear in a directory together, each of them whole.
///
/// add() writes a file under a temporary name, ".NAME.<random>.tmp", and forces it to the disk; publish() then gives
/// all of them their names. Until then nobody sees any of them, and if publish() is not reached, nothing stays. Between
/// construction and destruction the process does not end by a signal, unless by one that cannot be postponed; a
/// process that is killed, or a machine that stops, may leave the temporary files.
///
/// A file beyond the limit of setrlimit(2) is an error like any other only for a process that ignores SIGXFSZ.
/// Thread safety: one thread.
class NewFiles {
public:
    /// What to do with files that are there already.
    enum class Existing { Keep, Replace };

    /// Who may read a file. It is created so: at no time can more be done with it. The umask may take more away.
    enum class Readers { Owner, Everybody };

    /// Waits for other processes that are making files in the directory.
    /// @throws FileIOError  the directory cannot be opened
    NewFiles(const std::string& directory, Existing existing);

    /// Removes the temporary files that are left.
    ~NewFiles();
    NewFiles(const NewFiles&) = delete;
    NewFiles& operator=(const NewFiles&) = delete;

    /// Looks whether the names are free if they have to be, to know before the work is done; publish() looks again.
    /// @throws CommandFailure  Refused: one of them is not
    void checkFree(std::initializer_list<std::string> names) const;

    /// Writes a file under a temporary name. @throws FileIOError  it cannot be written
    void add(const std::string& name, const std::string& content, Readers readers);

    /// Gives the files their names, in the order of add(). If a name is taken and must be kept, those that have got
    /// theirs are removed again.
    /// @throws CommandFailure  Refused: a name is taken
    /// @throws FileIOError  a file cannot be named. With Existing::Replace, files before it may have been replaced
    void publish();

private:
    struct File {
        std::string temporary;
        std::string name;
        bool hasTemporary;
        bool hasName;
    };

    UniqueFd pCreate(File& file, mode_t mode) const;
    void pPublish(File& file) const;
    [[noreturn]] void pRefuse(const std::string& name) const;
    [[noreturn]] void pFail(int error, const char* what, const std::string& name) const;
    void pRemoveNames() noexcept;

    std::string mDirectory;
    Existing mExisting;
    UniqueFd mFd;               // of the directory; holds the lock
    EndPostponed mEndPostponed; // after the lock, so that waiting for it can be ended
    std::vector<File> mFiles;
};

} // namespace qel::tool
