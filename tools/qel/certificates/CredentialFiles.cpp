#include "certificates/CredentialFiles.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/PemContent.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"

#include <array>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <random>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::size_t kMaxNameLength = 64;
constexpr const char* kNameStart = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";

std::string checkName(std::string& name)
{
    const std::string allowed = std::string(kNameStart) + "._-";
    const bool isName = !name.empty() && name.size() <= kMaxNameLength &&
                        name.find_first_not_of(allowed) == std::string::npos &&
                        std::string(kNameStart).find(name.front()) != std::string::npos;
    if (isName) return {};
    return "'" + name +
           "' is not a name for credentials: 1 to 64 letters, digits, '.', '_' and '-', the first a letter or a digit";
}

void writeAll(int fd, const std::string& content, const std::string& path)
{
    std::size_t written = 0;
    while (written < content.size()) {
        const ssize_t count = ::write(fd, content.data() + written, content.size() - written);
        const int error = errno;
        if (count < 0 && error == EINTR) continue;
        if (count < 0) throw FileIOError(error, "cannot write " + path);
        written += static_cast<std::size_t>(count);
    }
}

std::string randomDigits()
{
    std::random_device device;
    std::array<char, 9> text{};
    std::snprintf(text.data(), text.size(), "%08x", device());
    return text.data();
}

/// Opens a directory and waits until no other process has it locked; the lock ends when the descriptor is closed.
UniqueFd openLocked(const std::string& directory)
{
    UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const int error = errno;
    if (fd.get() < 0) throw FileIOError(error, "cannot open the directory " + directory);
    // There are file systems without locks for directories. There, too, no file is overwritten that must be kept; but
    // of two processes that replace files at the same time, some of each may be left.
    while (::flock(fd.get(), LOCK_EX) != 0 && errno == EINTR)
        continue;
    return fd;
}

/// Gives a file its name unless there is one of that name. @return 0, or the error number
int renameToFreeName(int directory, const char* from, const char* to)
{
    if (::renameat2(directory, from, directory, to, RENAME_NOREPLACE) == 0) return 0;
    if (errno != EINVAL && errno != ENOSYS) return errno;
    // The file system or the kernel cannot do that. A second name for the file does the same in two steps.
    if (::linkat(directory, from, directory, to, 0) != 0) return errno;
    static_cast<void>(::unlinkat(directory, from, 0));
    return 0;
}

} // namespace

CLI::Validator credentialNameValidator() { return CLI::Validator(checkName, ""); }

void addKeyPermissionsOption(CLI::App& app, KeyPermissions& permissions)
{
    app.add_flag_callback(
        "--insecure-permissions", [&permissions] { permissions = KeyPermissions::Any; },
        "Use a private key although others than its owner may read or write its file");
}

void makeDirectory(const std::string& path)
{
    if (::mkdir(path.c_str(), S_IRWXU) == 0) return;
    const int error = errno;
    struct stat status;
    if (error == EEXIST && ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode)) return;
    throw FileIOError(error, "cannot make the directory " + path);
}

EndPostponed::EndPostponed()
{
    sigset_t ending;
    ::sigemptyset(&ending);
    for (const int number : {SIGHUP, SIGINT, SIGQUIT, SIGTERM})
        ::sigaddset(&ending, number);
    ::pthread_sigmask(SIG_BLOCK, &ending, &mBefore);
}

EndPostponed::~EndPostponed() { ::pthread_sigmask(SIG_SETMASK, &mBefore, nullptr); }

NewFiles::NewFiles(const std::string& directory, Existing existing)
    : mDirectory(directory), mExisting(existing), mFd(openLocked(directory))
{}

NewFiles::~NewFiles()
{
    for (const File& file : mFiles) {
        if (file.hasTemporary) static_cast<void>(::unlinkat(mFd.get(), file.temporary.c_str(), 0));
    }
}

void NewFiles::checkFree(std::initializer_list<std::string> names) const
{
    if (mExisting == Existing::Replace) return;
    for (const std::string& name : names) {
        struct stat status;
        if (::fstatat(mFd.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0) pRefuse(name);
    }
}

void NewFiles::add(const std::string& name, const std::string& content, Readers readers)
{
    const mode_t mode = S_IRUSR | S_IWUSR | (readers == Readers::Everybody ? S_IRGRP | S_IROTH : 0U);
    mFiles.push_back({{}, name, false, false});
    const UniqueFd fd = pCreate(mFiles.back(), mode);
    writeAll(fd.get(), content, pathIn(mDirectory, name));
    if (::fsync(fd.get()) != 0) pFail(errno, "cannot write ", name);
}

void NewFiles::publish()
{
    try {
        for (File& file : mFiles)
            pPublish(file);
    } catch (...) {
        if (mExisting == Existing::Keep) pRemoveNames();
        throw;
    }
    // The names must be on the disk too before the command reports them. Not every file system can sync a directory.
    if (::fsync(mFd.get()) == 0 || errno == EINVAL) return;
    const int error = errno;
    throw FileIOError(error, "cannot write the directory " + mDirectory);
}

UniqueFd NewFiles::pCreate(File& file, mode_t mode) const
{
    for (;;) {
        file.temporary = "." + file.name + "." + randomDigits() + ".tmp";
        UniqueFd fd(::openat(mFd.get(), file.temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode));
        const int error = errno;
        file.hasTemporary = fd.get() >= 0;
        if (file.hasTemporary) return fd;
        if (error != EEXIST) pFail(error, "cannot create ", file.name);
    }
}

void NewFiles::pPublish(File& file) const
{
    const char* const from = file.temporary.c_str();
    const char* const to = file.name.c_str();
    int error = 0;
    if (mExisting == Existing::Keep) {
        error = renameToFreeName(mFd.get(), from, to);
    } else if (::renameat(mFd.get(), from, mFd.get(), to) != 0) {
        error = errno;
    }
    if (error == EEXIST && mExisting == Existing::Keep) pRefuse(file.name);
    if (error != 0) pFail(error, "cannot name ", file.name);
    file.hasTemporary = false;
    file.hasName = true;
}

void NewFiles::pRefuse(const std::string& name) const
{
    throw CommandFailure(ExitStatus::Refused, pathIn(mDirectory, name) + " already exists; --force replaces it");
}

void NewFiles::pFail(int error, const char* what, const std::string& name) const
{
    throw FileIOError(error, what + pathIn(mDirectory, name));
}

void NewFiles::pRemoveNames() noexcept
{
    for (File& file : mFiles) {
        if (file.hasName) static_cast<void>(::unlinkat(mFd.get(), file.name.c_str(), 0));
        file.hasName = false;
    }
}

} // namespace qel::tool
