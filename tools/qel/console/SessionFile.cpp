#include "console/SessionFile.hpp"

#include <qel/common/util/PosixError.hpp>

#include "console/ConsoleTexts.hpp"

#include <cerrno>
#include <cstddef>
#include <fcntl.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

SessionFile::SessionFile(std::string path, int flags, const char* failure)
    : mPath(std::move(path)), mFailureText(failure),
      mFile(::open(mPath.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOCTTY | O_NONBLOCK | flags, 0600))
{
    const PosixErrorCode error = errno;
    if (mFile.get() < 0) throw FileIOError(error, filled(mFailureText, {mPath}));
}

bool SessionFile::write(const std::string& text)
{
    std::size_t written = 0;
    while (written < text.size()) {
        const ssize_t count = ::write(mFile.get(), text.data() + written, text.size() - written);
        const PosixErrorCode error = errno;
        if (count > 0) {
            written += static_cast<std::size_t>(count);
        } else if (error != EINTR) {
            mFailure = FileIOError(error, filled(mFailureText, {mPath})).what();
            return false;
        }
    }
    return true;
}

std::string SessionFile::takeFailure() { return std::exchange(mFailure, {}); }

} // namespace qel::tool
