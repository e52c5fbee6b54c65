#pragma once

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel {

/// Writes lines to a file of limited size and keeps four older files beside it: <path>.1 (the youngest of them) to
/// <path>.4. A line that would not fit any more first makes every file one older, the oldest is lost, and a fresh file
/// begins.
///
/// Trouble with the files never reaches the caller: it goes to the system log (syslog with LOG_ERR; the program decides
/// about openlog), and lines are lost:
///  - the file cannot be opened, at construction or after a rotation: every later line is dropped without another word;
///  - a write fails: the first failure of a run is reported, later ones are only counted, and the first write that
///    succeeds again reports the count with LOG_INFO. The file stays open.
///
/// Construction heals what a rotation that was cut short left behind: gaps in the numbering are closed, starting with
/// the current file, and a second name of a file is removed. Only regular files take part; a directory or a symbolic
/// link under one of the five names counts as a gap. Trouble while healing stops it and is not reported.
///
/// Thread safety: as LogBackend::log says, one line at a time; setLogLevel from any thread. Several processes may write
/// to one file without mixing within a line, but they overwrite each other's lines, since the file is not opened in
/// append mode: give each process its own file.
class QEL_EXPORT LogBackendRotating : public LogBackendFiltered {
public:
    /// How many files there are at most: the current one and four older ones.
    static constexpr std::size_t MAX_FILES_ALLOWED = 5;

    /// Heals the set of files and opens <directory>/<name> for appending, creating it with mode 0644 if it is missing.
    /// Trailing '/' characters of the whole path are dropped. The threshold is Warn.
    /// @param rotateSize  the most bytes a file may hold, line ends included; a line of rotateSize bytes or more is cut
    ///        to rotateSize - 1 bytes and its line end. 0 is of no use: nothing is cut then and every line rotates.
    LogBackendRotating(const std::string& directory, const std::string& name, std::size_t rotateSize);
    /// The same with a threshold; a value that is no level leaves it at Warn.
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
    void pNoteWritten(std::uint64_t bytes);
    void pNoteFailed(int error);
    bool pIsOk() const noexcept { return mFileDescriptor >= 0; }

    std::string mPath;                 // of the current file
    std::uint64_t mRotateSize;         // the most bytes one file may hold
    std::uint64_t mFileSize = 0;       // bytes in the current file, 0 while closed
    std::int32_t mFileDescriptor = -1; // -1 while closed
    std::uint64_t mDropped = 0;        // lines lost to failed writes since the last write that succeeded
};

} // namespace qel
