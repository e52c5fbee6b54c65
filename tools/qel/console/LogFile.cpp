#include "console/LogFile.hpp"

#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <fcntl.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

LogFile::LogFile(std::string path, Content content, TimeStamps::Style style)
    : mPath(std::move(path)), mContent(content),
      mFile(::open(mPath.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOCTTY | O_NONBLOCK, 0600)),
      mStamps(style)
{
    const PosixErrorCode error = errno;
    if (mFile.get() < 0) throw FileIOError(error, "cannot write the log " + mPath);
}

void LogFile::onOutput(const char* data, std::size_t length)
{
    if (!mIsOn) return;
    if (mContent == Content::Raw) return pWrite(std::string(data, length));
    std::string text;
    mStripper.append(data, length, text);
    std::string stamped;
    mStamps.append(text.data(), text.size(), stamped);
    pWrite(stamped);
}

void LogFile::onGap(const std::string& text)
{
    if (!mIsOn) return;
    const std::string line = (mEndsLine ? "[qel: " : "\n[qel: ") + text + "]\n";
    mStripper = ControlStripper(); // a control sequence that has begun is not continued
    onOutput(line.data(), line.size());
}

std::string LogFile::takeFailure() { return std::exchange(mFailure, {}); }

void LogFile::pWrite(const std::string& text)
{
    if (!text.empty()) mEndsLine = text.back() == '\n';
    std::size_t written = 0;
    while (written < text.size()) {
        const ssize_t count = ::write(mFile.get(), text.data() + written, text.size() - written);
        const PosixErrorCode error = errno;
        if (count > 0) {
            written += static_cast<std::size_t>(count);
        } else if (error != EINTR) {
            mFailure = FileIOError(error, "cannot write the log " + mPath).what();
            mIsOn = false;
            return;
        }
    }
}

} // namespace qel::tool
