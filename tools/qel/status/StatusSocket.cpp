#include "status/StatusSocket.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr int kBacklog = 16;

/// Of a client, for a place in the backlog.
constexpr timeval kConnectTime{5, 0};

/// How long another process may hold the lock of the directory.
constexpr int kLockAttempts = 200;
constexpr std::chrono::milliseconds kLockPause(10);

[[noreturn]] void failListening(const std::string& path, const std::string& reason)
{
    throw CommandFailure(ExitStatus::CannotConnect, "cannot listen on " + printable(path) + ": " + reason);
}

std::string errorText(int error) { return std::strerror(error); }

/// @return none: the path is empty or too long
std::optional<sockaddr_un> addressOf(const std::string& path)
{
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof(address.sun_path)) return std::nullopt;
    std::memcpy(static_cast<void*>(address.sun_path), path.c_str(), path.size() + 1);
    return address;
}

constexpr const char* kBadPath = "a path of a socket has 1 to 107 bytes";

const sockaddr* plain(const sockaddr_un& address) { return reinterpret_cast<const sockaddr*>(&address); }

UniqueFd makeSocket(int flags) { return UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0)); }

/// Keeps two servers from finding the same stale file and replacing each other's new one. Held on the directory, so
/// that no file of the lock's own is left.
UniqueFd lockDirectoryOf(const std::string& path)
{
    const std::size_t slash = path.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (fd.get() < 0) failListening(path, errorText(errno));
    for (int attempt = 0; ::flock(fd.get(), LOCK_EX | LOCK_NB) != 0; ++attempt) {
        if (errno != EWOULDBLOCK || attempt == kLockAttempts) failListening(path, "its directory is locked");
        std::this_thread::sleep_for(kLockPause);
    }
    return fd;
}

/// The directory that a variable names: the first one of several.
/// @param forbidden  permissions that make it unfit
/// @return empty: the variable names none of this user's own
std::string ownDirectory(const char* variable, mode_t forbidden)
{
    const char* const value = std::getenv(variable);
    const std::string directory = value == nullptr ? std::string() : std::string(value, std::strcspn(value, ":"));
    struct stat status {};
    if (directory.empty() || directory.front() != '/' || ::stat(directory.c_str(), &status) != 0) return {};
    const bool isOwn = S_ISDIR(status.st_mode) && status.st_uid == ::geteuid();
    return isOwn && (status.st_mode & forbidden) == 0 ? directory : std::string();
}

/// Removes the file of a server that is dead.
void removeStale(const std::string& path, const sockaddr_un& address)
{
    struct stat file {};
    if (::lstat(path.c_str(), &file) != 0) return; // binding says why, if it matters
    if (!S_ISSOCK(file.st_mode)) failListening(path, "a file that is not a socket is there");
    const UniqueFd probe = makeSocket(SOCK_NONBLOCK);
    if (probe.get() < 0) failListening(path, errorText(errno));
    if (::connect(probe.get(), plain(address), sizeof(address)) == 0 ||
        errno == EAGAIN) { // EAGAIN: its backlog is full
        failListening(path, "another server listens there");
    }
    if (errno != ECONNREFUSED) failListening(path, errorText(errno));
    if (::unlink(path.c_str()) != 0) failListening(path, errorText(errno));
}

} // namespace

StatusSocket::StatusSocket(std::string path) : mPath(std::move(path)), mFd(makeSocket(SOCK_NONBLOCK))
{
    const std::optional<sockaddr_un> address = addressOf(mPath);
    if (!address) failListening(mPath, kBadPath);
    if (mFd.get() < 0) failListening(mPath, errorText(errno));
    const UniqueFd lock = lockDirectoryOf(mPath);
    removeStale(mPath, *address);
    // Linux gives the file the mode of the socket, less the umask. A umask for the moment of binding would do the same,
    // but it belongs to all threads.
    if (::fchmod(mFd.get(), S_IRUSR | S_IWUSR) != 0) failListening(mPath, errorText(errno));
    if (::bind(mFd.get(), plain(*address), sizeof(*address)) != 0) failListening(mPath, errorText(errno));
    struct stat file {};
    if (::lstat(mPath.c_str(), &file) != 0) failListening(mPath, errorText(errno));
    mDevice = file.st_dev;
    mInode = file.st_ino;
    const bool isPrivate = (file.st_mode & (S_IRWXG | S_IRWXO)) == 0;
    const int error = isPrivate && ::listen(mFd.get(), kBacklog) == 0 ? 0 : errno;
    if (isPrivate && error == 0) return;
    static_cast<void>(::unlink(mPath.c_str()));
    failListening(mPath, isPrivate ? errorText(error) : "others could use the socket");
}

StatusSocket::~StatusSocket()
{
    struct stat file {};
    const bool isThere = ::lstat(mPath.c_str(), &file) == 0 && file.st_dev == mDevice && file.st_ino == mInode;
    if (isThere) static_cast<void>(::unlink(mPath.c_str()));
}

std::string defaultStatusSocket()
{
    const std::string ofUser = ownDirectory("XDG_RUNTIME_DIR", S_IRWXG | S_IRWXO);
    if (!ofUser.empty()) return ofUser + "/qel-status.sock";
    const std::string ofService = ownDirectory("RUNTIME_DIRECTORY", S_IWGRP | S_IWOTH);
    return ofService.empty() ? std::string() : ofService + "/status.sock";
}

UniqueFd connectStatus(const std::string& path)
{
    const auto fail = [&path](const std::string& reason) {
        throw CommandFailure(ExitStatus::CannotConnect,
                             "cannot reach a server over " + printable(path) + ": " + reason);
    };
    const std::optional<sockaddr_un> address = addressOf(path);
    if (!address) fail(kBadPath);
    UniqueFd fd = makeSocket(0);
    if (fd.get() < 0) fail(errorText(errno));
    // Without O_NONBLOCK, which would not wait for a place in the server's backlog.
    static_cast<void>(::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &kConnectTime, sizeof(kConnectTime)));
    if (::connect(fd.get(), plain(*address), sizeof(*address)) != 0) {
        if (errno == ECONNREFUSED) fail("no server listens there any more");
        fail(errno == EAGAIN ? "it does not accept the connection in time" : errorText(errno));
    }
    return fd;
}

} // namespace qel::tool
