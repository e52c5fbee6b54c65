#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include <optional>
#include <string>
#include <sys/types.h>

namespace qel::tool {

/// The Unix socket over which a server says what it does, as a listening descriptor with a name in the file system.
///
/// The file has the mode 0600 from the moment it exists, whatever the umask. A file that a dead server has left is
/// replaced, one that a living server listens on is not. The file is removed at the end, if it is still this one.
/// Thread safety: one thread.
class StatusSocket {
public:
    /// @throws CommandFailure  CannotConnect: "cannot listen on PATH: REASON"
    explicit StatusSocket(std::string path);
    ~StatusSocket();
    StatusSocket(const StatusSocket&) = delete;
    StatusSocket& operator=(const StatusSocket&) = delete;

    const std::string& path() const noexcept { return mPath; }
    /// Listens, and does not block.
    int descriptor() const noexcept { return mFd.get(); }

private:
    const std::string mPath;
    UniqueFd mFd;
    dev_t mDevice = 0; ///< this and the next one: which file it is
    ino_t mInode = 0;
};

/// Where a server of this user listens unless it is told otherwise: "qel-status.sock" in $XDG_RUNTIME_DIR, a directory
/// of this user alone; for a service of systemd "status.sock" in $RUNTIME_DIRECTORY, where only this user may write.
/// Empty: there is no such directory.
std::string defaultStatusSocket();

/// A descriptor that is connected to the socket of a server, and closed on exec.
/// @throws CommandFailure  CannotConnect: "cannot reach a server over PATH: REASON"
UniqueFd connectStatus(const std::string& path);

} // namespace qel::tool
