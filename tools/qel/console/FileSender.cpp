#include "console/FileSender.hpp"

#include <qel/common/util/PosixError.hpp>

#include "console/ConsoleTexts.hpp"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr std::size_t kPiece = 4096;

} // namespace

FileSender::FileSender(std::string path)
    : mPath(std::move(path)), mFile(::open(mPath.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK))
{
    const PosixErrorCode error = errno;
    if (mFile.get() < 0) throw FileIOError(error, filled(texts::kCannotRead, {mPath}));
    struct stat status {};
    if (::fstat(mFile.get(), &status) != 0) return;
    if (S_ISDIR(status.st_mode)) throw FileIOError(PosixErrorCode(EISDIR), filled(texts::kCannotRead, {mPath}));
    mSize = static_cast<std::uint64_t>(status.st_size);
}

std::string FileSender::next()
{
    std::string piece(kPiece, '\0');
    const ssize_t count = ::read(mFile.get(), piece.data(), piece.size());
    const PosixErrorCode error = errno;
    if (count < 0) throw FileIOError(error, filled(texts::kCannotRead, {mPath}));
    piece.resize(static_cast<std::size_t>(count));
    mSent += piece.size();
    return piece;
}

} // namespace qel::tool
