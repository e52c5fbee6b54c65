#include "lines/RotatingFile.hpp"

#include <qel/common/util/PosixError.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <new>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

RotatingFile::RotatingFile(std::string path, std::uint64_t limit) : mPath(std::move(path)), mLimit(limit)
{
    const int error = pOpen();
    if (error != 0) throw FileIOError(error, "cannot write the line log " + mPath);
}

int RotatingFile::append(const std::string& bytes) noexcept
{
    if (mFile.get() < 0) {
        const int error = pOpen();
        if (error != 0) return error;
    }
    if (mSize != 0 && bytes.size() > mLimit - std::min(mSize, mLimit)) {
        const int error = rotate();
        if (error != 0) return error;
    }
    std::size_t written = 0;
    while (written < bytes.size()) {
        iovec piece{const_cast<char*>(bytes.data()) + written, bytes.size() - written}; // writev() only reads it
        const ssize_t count = ::writev(mFile.get(), &piece, 1);
        const int error = count == 0 ? ENOSPC : errno;
        if (count > 0) {
            written += static_cast<std::size_t>(count);
        } else if (count == 0 || error != EINTR) {
            pTakeBack(written);
            return error;
        }
    }
    mSize += written;
    return 0;
}

int RotatingFile::rotate() noexcept
{
    const bool isThere = pExists(0);
    if (mFile.get() >= 0 && mSize == 0 && isThere) return 0;
    pMoveOlder();
    return pOpen();
}

/// Removes a part that has been written: it would be a torn line. Somebody else may have cut the file meanwhile, so its
/// size is asked for.
void RotatingFile::pTakeBack(std::uint64_t written) noexcept
{
    struct stat status {};
    mSize += written;
    if (::fstat(mFile.get(), &status) != 0) return;
    mSize = static_cast<std::uint64_t>(status.st_size);
    const std::uint64_t whole = mSize - std::min(mSize, written);
    if (::ftruncate(mFile.get(), static_cast<off_t>(whole)) == 0) mSize = whole;
}

/// Opens the current file anew. When that fails, the one that is open stays open, if there is one.
int RotatingFile::pOpen() noexcept
{
    UniqueFd file(::open(mPath.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_NONBLOCK | O_CLOEXEC, 0600));
    const int error = errno;
    if (file.get() < 0) return error;
    struct stat status {};
    if (::fstat(file.get(), &status) != 0) return errno;
    mFile = std::move(file);
    mSize = static_cast<std::uint64_t>(status.st_size);
    return 0;
}

/// Makes room for a new current file: makes every file one older, up to the first name that is free. So nothing moves
/// when the room is there already, because the new file could not be opened the last time; otherwise each attempt would
/// cost the oldest file. It goes from the oldest down: the other way round, a failure would overwrite a newer one. What
/// cannot be moved stays, and the file that should make room for it grows on.
void RotatingFile::pMoveOlder() noexcept
{
    try {
        int free = 0;
        while (free < kOlderFiles && pExists(free))
            ++free;
        for (int age = free; age > 0; --age)
            static_cast<void>(std::rename(pName(age - 1).c_str(), pName(age).c_str()));
    } catch (const std::bad_alloc&) { // NOLINT(bugprone-empty-catch): the file grows on
    }
}

/// True too when there is no memory for the name.
bool RotatingFile::pExists(int age) const noexcept
{
    try {
        struct stat status {};
        return ::lstat(pName(age).c_str(), &status) == 0;
    } catch (const std::bad_alloc&) {
        return true;
    }
}

} // namespace qel::tool
