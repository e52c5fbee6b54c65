#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/SerialTap.hpp>

#include "base/Library.hpp"
#include "lines/PlainLines.hpp"
#include "lines/RotatingFile.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// The log of one partition's line, two files in a directory: NAME.raw has the bytes that the line has put out,
/// NAME.log has them as lines of plain text, each with the UTC time at which it began:
///
///     2026-11-22T10:15:04.123Z login: root
///     2026-11-22T10:20:31.007Z [qel: the command exited with status 3]
///
/// Lines in brackets are the program's own: what has happened to the line, where the log begins and ends, and how many
/// bytes could not be written. A full disk costs log lines and never more: both files say where bytes are missing, once
/// there is room again, and the server's log says so at once.
///
/// Thread safety: any thread.
class LineLog : public protocol::SerialTap {
public:
    static constexpr std::uint64_t kDefaultBytes = 10 * 1024 * 1024;

    /// @param directory  exists
    /// @param name  of the files, without their endings: see fileName()
    /// @param limit  bytes of one file; each of the two has four older ones beside it
    /// @throws FileIOError  a file cannot be opened
    LineLog(const std::string& directory, const std::string& name, std::uint64_t limit);
    ~LineLog() override;

    void onOutput(std::uint16_t partition, const char* data, std::size_t length) noexcept override;
    void onEvent(std::uint16_t partition, const std::string& text) noexcept override;

    /// Begins new files: on SIGHUP.
    void rotate();

    /// The name of a partition's files: its name, with "_" for all characters but letters, digits, ".", "-" and "_"; or
    /// "partition-3" when it has none or begins with ".".
    static std::string fileName(std::uint16_t partition, const std::string& name);

private:
    /// A file, and what could not be written to it since the last bytes that could.
    struct Output {
        RotatingFile file;
        std::uint64_t lostBytes = 0;
        int error = 0; ///< the first one
    };

    void pLine(const std::string& text) QEL_REQUIRES(mMutex);
    void pWrite(Output& output, const std::string& bytes, const std::string& gapPrefix, const std::string& gapSuffix)
        QEL_REQUIRES(mMutex);
    static std::string pStamp(std::chrono::system_clock::time_point time);

    Mutex mMutex; ///< a leaf, apart from the logger's
    Output mRaw QEL_GUARDED_BY(mMutex);
    Output mText QEL_GUARDED_BY(mMutex);
    std::chrono::system_clock::time_point mLineBegan QEL_GUARDED_BY(mMutex);
    PlainLines mLines QEL_GUARDED_BY(mMutex);
};

} // namespace qel::tool
