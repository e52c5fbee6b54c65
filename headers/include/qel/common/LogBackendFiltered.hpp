#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <atomic>
#include <string>

namespace qel {

/// A back-end with a threshold of its own, which drops lines below it. The base of all back-ends of this library.
/// Thread safety: any thread may read and set the threshold while lines are logged; for log see LogBackend.
class QEL_EXPORT LogBackendFiltered : public LogBackend {
public:
    /// The threshold is Warn.
    LogBackendFiltered();
    /// The threshold is the given level, or Warn if that is not a valid level.
    explicit LogBackendFiltered(LogLevel::Level level);
    ~LogBackendFiltered() override;

    /// Passes the line to pLog unless its level is below the threshold. The threshold Inherit passes every line.
    /// @throws what pLog throws
    void log(LogLevel::Level level, const std::string& line) final;

    /// Sets the threshold. An invalid level is ignored.
    void setLogLevel(LogLevel::Level level) noexcept;

    /// @return the threshold
    LogLevel::Level getLogLevel() const noexcept { return mLevel.load(std::memory_order_relaxed); }

private:
    /// Writes one line that passed the threshold, and adds a line end. The rules of LogBackend::log apply.
    virtual void pLog(const std::string& line) = 0;

    std::atomic<LogLevel::Level> mLevel{LogLevel::Warn};
};

} // namespace qel
