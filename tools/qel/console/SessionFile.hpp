#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include <string>

namespace qel::tool {

/// A file that a session is written to, readable by its owner only. Writing does not wait: a pipe that is full fails
/// like a disk that is.
/// Thread safety: one thread.
class SessionFile {
public:
    /// Makes the file if it is not there.
    /// @param flags  O_APPEND or O_TRUNC
    /// @param failure  the text of failures; $1 stands for the path
    /// @throws FileIOError  it cannot be opened
    SessionFile(std::string path, int flags, const char* failure);

    const std::string& path() const noexcept { return mPath; }

    /// @return false: not all of it has been written, and takeFailure() says why
    bool write(const std::string& text);

    /// @return why writing has failed since the last call; empty: it has not
    std::string takeFailure();

private:
    const std::string mPath;
    const char* const mFailureText;
    UniqueFd mFile;
    std::string mFailure;
};

} // namespace qel::tool
