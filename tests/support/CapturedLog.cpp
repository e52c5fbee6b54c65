#include "support/CapturedLog.hpp"

#include <qel/common/QelDebug.hpp>
#include <qel/common/QelLogger.hpp>

#include <gtest/gtest.h>

namespace qel::test {

namespace {

/// "[2026-03-01 17:04:09] (4711:4719) (E): text" becomes "E: text".
std::string withoutPrefix(const std::string& line)
{
    constexpr const char* kEndOfPrefix = "): ";
    const std::size_t end = line.find(kEndOfPrefix);
    if (line.empty() || line.front() != '[' || end == std::string::npos || end < 2 || line[end - 2] != '(') {
        ADD_FAILURE() << "a log line without a proper prefix: " << line;
        return line;
    }
    return line.substr(end - 1, 1) + ": " + line.substr(end + 3);
}

} // namespace

CapturedLog::CapturedLog(LogLevel::Level level) : mBackend(std::make_shared<RecordingLogBackend>())
{
    QelDebug::globals().resetLoggers();
    QelLogger::get().setLevel(level).addBackend(mBackend);
}

CapturedLog::~CapturedLog() { QelDebug::globals().resetLoggers(); }

std::vector<std::string> CapturedLog::lines() const
{
    std::vector<std::string> lines;
    for (const std::string& line : mBackend->lines())
        lines.push_back(withoutPrefix(line));
    return lines;
}

std::vector<std::string> CapturedLog::rawLines() const { return mBackend->lines(); }

void CapturedLog::clear() { mBackend->clear(); }

} // namespace qel::test
