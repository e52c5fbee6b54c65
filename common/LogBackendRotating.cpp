#include <qel/common/LogBackendRotating.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <new>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

namespace qel {

namespace {

/// @return the number and the text of an error, for the system log; empty if there is no memory for it: a back-end must
/// not throw
std::string describe(int error) noexcept
{
    try {
        return PosixErrorCode(error).message();
    } catch (const std::bad_alloc&) {
        return {};
    }
}

} // namespace

LogBackendRotating::LogBackendRotating(const std::string& directory, const std::string& name, std::size_t rotateSize)
    : mPath(Utilities::rstrip(directory + "/" + name, "/")), mRotateSize(rotateSize)
{
    pRepair();
    pOpen(0);
}

LogBackendRotating::LogBackendRotating(LogLevel::Level level, const std::string& directory, const std::string& name,
                                       std::size_t rotateSize)
    : LogBackendRotating(directory, name, rotateSize)
{
    setLogLevel(level);
}

LogBackendRotating::~LogBackendRotating() { pClose(); }

std::string LogBackendRotating::pGetPath(std::size_t n) const
{
    return n == 0 ? mPath : mPath + "." + std::to_string(n);
}

// A rotation moves the files one by one from the oldest down. One that was interrupted leaves a gap, or, in the middle
// of a move, one file under two neighbouring names.
void LogBackendRotating::pRepair()
{
    ino_t previousInode = 0;
    bool hasHole = false;
    std::size_t firstHole = 0;
    for (std::size_t i = 0; i < MAX_FILES_ALLOWED; ++i) {
        const std::string path = pGetPath(i);
        struct stat status = {};
        if (::lstat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
            if (!hasHole) firstHole = i;
            hasHole = true;
            continue;
        }
        if (status.st_ino == previousInode) {
            if (::unlink(path.c_str()) != 0) return;
            if (!hasHole) firstHole = i;
            hasHole = true;
        } else if (hasHole) {
            if (::rename(path.c_str(), pGetPath(firstHole).c_str()) != 0) return;
            ++firstHole;
        }
        previousInode = status.st_ino;
    }
}

bool LogBackendRotating::pOpen(int extraFlags)
{
    mFileDescriptor = ::open(mPath.c_str(), extraFlags | O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (mFileDescriptor < 0) {
        const int error = errno;
        ::syslog(LOG_ERR, "Failed to open log %s: errno %s", mPath.c_str(), describe(error).c_str());
        return false;
    }
    const off_t end = ::lseek(mFileDescriptor, 0, SEEK_END);
    if (end < 0) {
        const int error = errno;
        ::syslog(LOG_ERR, "Failed to seek log %s: errno %s", mPath.c_str(), describe(error).c_str());
        ::close(mFileDescriptor);
        mFileDescriptor = -1;
        return false;
    }
    mFileSize = static_cast<std::uint64_t>(end);
    return true;
}

void LogBackendRotating::pClose()
{
    if (!pIsOk()) return;
    ::fsync(mFileDescriptor);
    ::close(mFileDescriptor);
    mFileDescriptor = -1;
    mFileSize = 0;
}

bool LogBackendRotating::pRotate()
{
    pClose();
    try {
        // From the oldest down: the other way round each file would overwrite the next one.
        for (std::size_t i = MAX_FILES_ALLOWED - 1; i > 0; --i)
            pMove(pGetPath(i - 1), pGetPath(i));
    } catch (const std::bad_alloc&) {
        return false; // no memory for the names: the log stays closed, as if the new file could not be opened
    }
    ::unlink(mPath.c_str()); // exists only if the last move failed
    return pOpen(O_TRUNC);
}

void LogBackendRotating::pMove(const std::string& from, const std::string& to)
{
    if (::rename(from.c_str(), to.c_str()) == 0) return;
    const int error = errno;
    if (error == ENOENT) return; // there are fewer files so far
    ::syslog(LOG_ERR, "Failed to rotate log file %s: errno %s", from.c_str(), describe(error).c_str());
}

void LogBackendRotating::pLog(const std::string& line)
{
    if (!pIsOk()) return;
    const std::uint64_t length = std::min<std::uint64_t>(line.size(), mRotateSize - 1);
    if (length + mFileSize + 1 > mRotateSize && !pRotate()) return;

    const auto bytes = static_cast<std::size_t>(length);
    const ssize_t written = pWrite(line.data(), bytes);
    if (written < 0) {
        const int error = errno;
        pNoteFailed(error);
        return;
    }
    // The disk is nearly full: a second call writes the rest, or fails and says why.
    const auto done = static_cast<std::size_t>(written);
    if (done <= bytes) {
        const ssize_t rest = pWrite(line.data() + done, bytes - done);
        const int error = rest < 0 ? errno : EIO; // short again, without a reason
        if (rest != static_cast<ssize_t>(bytes - done + 1)) {
            pDiscardPart();
            pNoteFailed(error);
            return;
        }
    }
    pNoteWritten(length + 1);
}

/// One gathered write of a text and a line end: no copy of the line, and one call for both.
/// @return the number of bytes written, at most length + 1; -1 with errno set on failure
ssize_t LogBackendRotating::pWrite(const char* text, std::size_t length)
{
    char lineEnd[] = {'\n'};
    const struct iovec pieces[] = {{const_cast<char*>(text), length}, {lineEnd, sizeof(lineEnd)}};
    return ::writev(mFileDescriptor, pieces, 2);
}

/// Removes the part of a line that was written, so that no torn line stays in the file and the next line begins where
/// this one did. If the file cannot be cut, the next line overwrites the part.
void LogBackendRotating::pDiscardPart()
{
    const auto begin = static_cast<off_t>(mFileSize);
    static_cast<void>(::ftruncate(mFileDescriptor, begin) == 0);
    ::lseek(mFileDescriptor, begin, SEEK_SET);
}

void LogBackendRotating::pNoteWritten(std::uint64_t bytes)
{
    mFileSize += bytes;
    if (mDropped == 0) return;
    ::syslog(LOG_INFO, "log %s recovered after write error: %llu messages were dropped", mPath.c_str(),
             static_cast<unsigned long long>(mDropped));
    mDropped = 0;
}

void LogBackendRotating::pNoteFailed(int error)
{
    if (mDropped == 0) ::syslog(LOG_ERR, "cannot write to log %s: errno %s", mPath.c_str(), describe(error).c_str());
    ++mDropped;
}

} // namespace qel
