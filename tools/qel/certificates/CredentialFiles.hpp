#pragma once

#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/CredentialFiles.hpp>

#include "base/Library.hpp"

#include <CLI/CLI.hpp>
#include <csignal>
#include <initializer_list>
#include <string>
#include <sys/types.h>
#include <vector>

/// @file
/// The files of certificates, keys and requests: options for them, and writing them. CredentialFiles.hpp of the
/// library names and reads them.

namespace qel::tool {

/// Accepts a name for credentials: 1 to 64 letters, digits, '.', '_' and '-', the first a letter or a digit. Such a
/// name can be neither a path nor an option. "root" is accepted too.
CLI::Validator credentialNameValidator();

/// Adds --insecure-permissions.
void addKeyPermissionsOption(CLI::App& app, KeyPermissions& permissions);

/// Makes a directory for its owner only. An existing directory stays as it is.
/// @throws FileIOError  it cannot be made
void makeDirectory(const std::string& path);

/// Blocks the signals that would end this process (SIGHUP, SIGINT, SIGQUIT, SIGTERM) until it is destroyed.
/// Thread safety: for single-threaded programs.
class EndPostponed {
public:
    EndPostponed();
    ~EndPostponed();
    EndPostponed(const EndPostponed&) = delete;
    EndPostponed& operator=(const EndPostponed&) = delete;

private:
    sigset_t mBefore;
};

/// Files that appear in a directory together, each of them complete.
///
/// add() writes a file under a temporary name, ".NAME.<random>.tmp", and forces it to the disk; publish() then renames
/// all files. If publish() is not reached, no file remains. Signals that end the process are blocked between
/// construction and destruction. A process that is killed, or a machine that stops, may leave the temporary files.
///
/// The process must ignore SIGXFSZ: otherwise a file that exceeds the limit of setrlimit(2) kills it.
/// Thread safety: one thread.
class NewFiles {
public:
    /// What to do with existing files.
    enum class Existing { Keep, Replace };

    /// Who may read a file. The file is created with these permissions; the umask may remove some.
    enum class Readers { Owner, Everybody };

    /// Waits until no other process makes files in the directory.
    /// @throws FileIOError  the directory cannot be opened
    NewFiles(const std::string& directory, Existing existing);

    /// Removes the remaining temporary files.
    ~NewFiles();
    NewFiles(const NewFiles&) = delete;
    NewFiles& operator=(const NewFiles&) = delete;

    /// With Existing::Keep, checks that the names are free, to fail before the work is done. publish() checks again.
    /// @throws CommandFailure  Refused: a file exists
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
