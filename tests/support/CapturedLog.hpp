#pragma once

#include <qel/common/LogLevel.hpp>

#include "support/RecordingLogBackend.hpp"

#include <memory>
#include <string>
#include <vector>

namespace qel::test {

/// Captures the lines of the root logger for the length of a test. Construction and destruction reset all loggers of
/// the process, so use one at a time. Thread safety: lines may be read while other threads log.
class CapturedLog {
public:
    /// @param level  the threshold of the root logger; lines that pass it are captured
    explicit CapturedLog(LogLevel::Level level = LogLevel::Debug);
    ~CapturedLog();
    CapturedLog(const CapturedLog&) = delete;
    CapturedLog& operator=(const CapturedLog&) = delete;

    /// @return the lines without time and ids: "E: the text". A line without a proper prefix fails the test.
    std::vector<std::string> lines() const;
    /// @return the lines as a back-end receives them
    std::vector<std::string> rawLines() const;
    /// Forgets the lines so far.
    void clear();

private:
    std::shared_ptr<RecordingLogBackend> mBackend;
};

} // namespace qel::test
