#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/util/Mutex.hpp>

#include <string>
#include <utility>
#include <vector>

namespace qel::test {

/// A back-end without a filter that keeps every line and its level.
/// Thread safety: lines may be read while threads log.
class RecordingLogBackend : public LogBackend {
public:
    struct Entry {
        LogLevel::Level level;
        std::string line;
    };

    void log(LogLevel::Level level, const std::string& line) override
    {
        const MutexLock lock(mMutex);
        mEntries.push_back({level, line});
    }

    std::vector<Entry> entries() const
    {
        const MutexLock lock(mMutex);
        return mEntries;
    }

    std::vector<std::string> lines() const
    {
        const MutexLock lock(mMutex);
        std::vector<std::string> lines;
        for (const Entry& entry : mEntries)
            lines.push_back(entry.line);
        return lines;
    }

    void clear()
    {
        const MutexLock lock(mMutex);
        mEntries.clear();
    }

private:
    mutable Mutex mMutex;
    std::vector<Entry> mEntries QEL_GUARDED_BY(mMutex);
};

} // namespace qel::test
