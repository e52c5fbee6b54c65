#include "lines/LineLog.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <exception>
#include <utility>

namespace qel::tool {

namespace {

/// Runs what must not throw: without memory, log lines are lost.
template <typename Operation>
void guarded(Operation&& operation) noexcept
{
    try {
        std::forward<Operation>(operation)();
    } catch (const std::exception& error) {
        protocol::logLine(LogLevel::Warn, "a line log: ", error.what());
    }
}

/// A line of output that could be taken for one of the server's gets a backslash.
std::string notOurs(const std::string& line) { return line.rfind("[qel: ", 0) == 0 ? "\\" + line : line; }

std::string errorText(int error)
{
    std::array<char, 128> buffer{};
    return ::strerror_r(error, buffer.data(), buffer.size());
}

} // namespace

LineLog::LineLog(const std::string& directory, const std::string& name, std::uint64_t limit)
    : mRaw{RotatingFile(directory + "/" + name + ".raw", limit)}, mText{RotatingFile(directory + "/" + name + ".log",
                                                                                     limit)},
      mLines([this](const std::string& line) QEL_NO_THREAD_SAFETY_ANALYSIS { pLine(notOurs(line)); })
{
    onEvent(0, "the log begins");
}

LineLog::~LineLog() { onEvent(0, "the log ends"); }

void LineLog::onOutput(std::uint16_t, const char* data, std::size_t length) noexcept
{
    guarded([&] {
        const MutexLock lock(mMutex);
        const auto now = TimeProvider::system();
        pWrite(mRaw, std::string(data, length), "\r\n", "\r\n");
        mLines.feed(data, length, [&]() QEL_NO_THREAD_SAFETY_ANALYSIS { mLineBegan = now; });
    });
}

void LineLog::onEvent(std::uint16_t, const std::string& text) noexcept
{
    guarded([&] {
        const MutexLock lock(mMutex);
        mLines.flush(); // what has come of a line, such as a prompt, has come before
        mLineBegan = TimeProvider::system();
        pLine("[qel: " + text + "]");
    });
}

void LineLog::rotate()
{
    const MutexLock lock(mMutex);
    mLines.flush();
    for (Output* const output : {&mRaw, &mText}) {
        const int error = output->file.rotate();
        if (error != 0) {
            protocol::logLine(LogLevel::Warn, "cannot rotate the line log ", output->file.path(), ": ",
                              errorText(error));
        }
    }
}

std::string LineLog::fileName(std::uint16_t partition, const std::string& name)
{
    if (name.empty() || name.front() == '.') return "partition-" + std::to_string(partition);
    std::string safe = name;
    std::replace_if(
        safe.begin(), safe.end(),
        [](unsigned char character) {
            return std::isalnum(character) == 0 && (character == '\0' || std::strchr(".-_", character) == nullptr);
        },
        '_');
    return safe;
}

void LineLog::pLine(const std::string& text)
{
    const std::string stamp = pStamp(mLineBegan);
    pWrite(mText, stamp + text + "\n", pStamp(TimeProvider::system()), "\n");
}

/// @param gapPrefix, gapSuffix  around the mark that says how many bytes are missing
void LineLog::pWrite(Output& output, const std::string& bytes, const std::string& gapPrefix,
                     const std::string& gapSuffix)
{
    std::string gap;
    if (output.lostBytes != 0) {
        gap = gapPrefix + "[qel: " + std::to_string(output.lostBytes) + " bytes lost: " + errorText(output.error) +
              "]" + gapSuffix;
    }
    const int error = output.file.append(gap + bytes);
    if (error == 0) {
        if (output.lostBytes != 0) {
            protocol::logLine(LogLevel::Info, "the line log ", output.file.path(), " is written again; ",
                              output.lostBytes, " bytes are missing");
        }
        output.lostBytes = 0;
        return;
    }
    if (output.lostBytes == 0) {
        output.error = error;
        protocol::logLine(LogLevel::Warn, "cannot write the line log ", output.file.path(), ": ", errorText(error));
    }
    output.lostBytes += bytes.size();
}

/// "2026-11-22T10:15:04.123Z "
std::string LineLog::pStamp(std::chrono::system_clock::time_point time)
{
    const auto sinceEpoch = std::chrono::floor<std::chrono::milliseconds>(time.time_since_epoch());
    const auto seconds = std::chrono::floor<std::chrono::seconds>(sinceEpoch);
    const auto whole = static_cast<std::time_t>(seconds.count());
    std::tm parts{};
    ::gmtime_r(&whole, &parts);
    std::array<char, 32> date{};
    const std::size_t length = std::strftime(date.data(), date.size(), "%Y-%m-%dT%H:%M:%S", &parts);
    std::array<char, 8> fraction{};
    std::snprintf(fraction.data(), fraction.size(), ".%03dZ ", static_cast<int>((sinceEpoch - seconds).count()));
    return std::string(date.data(), length) + fraction.data();
}

} // namespace qel::tool
