#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// A file of limited size that bytes are added to, with older ones beside it: PATH.1, the youngest of them, to PATH.4.
/// What does not fit rotates first. The files have mode 0600: what goes over a serial line is not for everybody.
///
/// Unlike the library's rotating log it takes any bytes, rotates on request, and tells its caller what could not be
/// written, so that the caller can mark the gap.
/// Thread safety: none of its own.
class RotatingFile {
public:
    static constexpr int kOlderFiles = 4;

    /// Opens the file, creating it if it is missing; bytes go after what it holds.
    /// @param limit  bytes of one file; more than 0
    /// @throws FileIOError  "cannot write the line log PATH": it cannot be opened
    RotatingFile(std::string path, std::uint64_t limit);

    const std::string& path() const noexcept { return mPath; }

    /// Adds bytes, all or none. More than the limit go to a file of their own.
    /// @return 0, or the error number: nothing has been written
    int append(const std::string& bytes) noexcept;

    /// Begins a new file, unless the current one is empty; also when somebody else has moved it away. @return 0, or the
    /// error number
    int rotate() noexcept;

private:
    int pOpen() noexcept;
    void pTakeBack(std::uint64_t written) noexcept;
    void pMoveOlder() noexcept;
    bool pExists(int age) const noexcept;
    std::string pName(int age) const { return age == 0 ? mPath : mPath + "." + std::to_string(age); }

    const std::string mPath;
    const std::uint64_t mLimit;
    UniqueFd mFile;          ///< negative: it could not be opened
    std::uint64_t mSize = 0; ///< of the file
};

} // namespace qel::tool
