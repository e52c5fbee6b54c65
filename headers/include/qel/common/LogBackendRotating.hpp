#pragma once

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <cstddef>
#include <cstdint>
#include <string>
#include <sys/types.h>

namespace qel {

/// Writes lines to a file of limited size and keeps four older files beside it: <path>.1 (the youngest of them) to
/// <path>.4. A line that does not fit into the file rotates first: every file becomes one older, the oldest is lost,
/// and an empty file begins.
///
/// File errors never reach the caller. They go to the system log (syslog with LOG_ERR; the program decides about
/// openlog), and lines are lost:
///  - the file cannot be opened, at construction or after a rotation: every later line is dropped, without a further
///    report;
///  - a write fails: the first failure of a run is reported, further ones are counted, and the next write that succeeds
///    reports the count with LOG_INFO. The file stays open. A write that the disk has room for only in part is tried
///    once more; if that fails too, the part is removed again and the line counts as lost. So every line in the file is
///    whole.
///
/// Construction repairs what an interrupted rotation left: it closes gaps in the numbering, beginning with the current
/// file, and removes a second name of a file. Only regular files take part; a directory or a symbolic link under one of
/// the five names counts as a gap. A failure ends the repair and is not reported.
///
/// Thread safety: as LogBackend::log says, one line at a time; setLogLevel from any thread.
/// Give each process a file of its own: the file is not opened in append mode, so processes that share one overwrite
/// and tear each other's lines.
class QEL_EXPORT LogBackendRotating : public LogBackendFiltered {
public:
    /// The maximum number of files: the current one and four older ones.
    static constexpr std::size_t MAX_FILES_ALLOWED = 5;

    /// Repairs the set of files and opens <directory>/<name>, creating it with mode 0644 if it is missing; lines go
    /// after what the file holds. Trailing '/' characters of the whole path are dropped. The threshold is Warn.
    /// @param rotateSize  the maximum size of a file in bytes, line ends included. A line of rotateSize bytes or more
    ///                    is cut to rotateSize - 1 bytes and its line end. Do not pass 0: every line then rotates, and
    ///                    none is cut.
    /// @throws std::bad_alloc  no memory for the path; file errors do not throw
    LogBackendRotating(const std::string& directory, const std::string& name, std::size_t rotateSize);
    /// The same with a threshold; an invalid level leaves it at Warn.
    LogBackendRotating(LogLevel::Level level, const std::string& directory, const std::string& name,
                       std::size_t rotateSize);
    /// Flushes the file to its disk (fsync) and closes it.
    ~LogBackendRotating() override;

private:
    void pLog(const std::string& line) override;

    std::string pGetPath(std::size_t n) const;
    void pRepair();
    bool pOpen(int extraFlags);
    void pClose();
    bool pRotate();
    void pMove(const std::string& from, const std::string& to);
    ssize_t pWrite(const char* text, std::size_t length);
    void pDiscardPart();
    void pNoteWritten(std::uint64_t bytes);
    void pNoteFailed(int error);
    bool pIsOk() const noexcept { return mFileDescriptor >= 0; }

    std::string mPath;                 // of the current file
    std::uint64_t mRotateSize;         // maximum bytes of one file
    std::uint64_t mFileSize = 0;       // bytes in the current file, where the next line begins; 0 while closed
    std::int32_t mFileDescriptor = -1; // -1 while closed
    std::uint64_t mDropped = 0;        // lines lost since the last write that succeeded
};

} // namespace qel
