#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// A file that is typed into the partition, piece by piece, as the connection takes them.
/// Thread safety: one thread.
class FileSender {
public:
    /// @throws FileIOError  the file cannot be opened, or is a directory
    explicit FileSender(std::string path);

    /// @return the next bytes; empty at the end. @throws FileIOError  the file cannot be read
    std::string next();

    const std::string& path() const noexcept { return mPath; }
    std::uint64_t sent() const noexcept { return mSent; }
    /// The size of the file when it was opened; 0 for what has no size, such as a pipe.
    std::uint64_t size() const noexcept { return mSize; }

private:
    const std::string mPath;
    UniqueFd mFile;
    std::uint64_t mSize = 0;
    std::uint64_t mSent = 0;
};

} // namespace qel::tool
