#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/QelExport.hpp>

#include <atomic>
#include <string>

namespace qel {

/// A back-end with a threshold of its own: lines below it are dropped. The base of all back-ends of this library.
/// Thread safety: the threshold may be read and set by any thread while lines are logged.
class QEL_EXPORT LogBackendFiltered : public LogBackend {
public:
    /// The threshold is Warn.
    LogBackendFiltered();
    /// The threshold is the given level; Warn when that is no valid level.
    explicit LogBackendFiltered(LogLevel::Level level);
    ~LogBackendFiltered() override;

    /// Hands the line to pLog when its level is not below the threshold. With the threshold Inherit every line passes.
    void log(LogLevel::Level level, const std::string& line) final;

    /// Sets the threshold. A value that is no level is ignored.
    void setLogLevel(LogLevel::Level level) noexcept;

    /// @return the threshold
    LogLevel::Level getLogLevel() const noexcept { return mLevel.load(std::memory_order_relaxed); }

private:
    /// Writes one line that passed the threshold; the line end is the implementation's to add. Under the same
    /// conditions as LogBackend::log.
    virtual void pLog(const std::string& line) = 0;

    std::atomic<LogLevel::Level> mLevel{LogLevel::Warn};
};

} // namespace qel
