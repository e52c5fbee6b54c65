#include "support/CapturedSystemLog.hpp"

#include <qel/common/util/Mutex.hpp>

#include "support/Allocations.hpp"

#include <cstdarg>
#include <cstdio>
#include <gtest/gtest.h>
#include <syslog.h>
#include <utility>

namespace qel::test {

namespace {

Mutex sMutex;
bool sCapturing QEL_GUARDED_BY(sMutex) = false;
std::vector<SystemLogMessage> sMessages QEL_GUARDED_BY(sMutex);

void record(int priority, const char* format, va_list arguments)
{
    const Allocations::Exempt exempt;
    va_list again;
    va_copy(again, arguments);
    const int length = std::vsnprintf(nullptr, 0, format, arguments);
    std::string text(static_cast<std::size_t>(length) + 1, '\0');
    std::vsnprintf(text.data(), text.size(), format, again);
    va_end(again);
    text.pop_back();

    const MutexLock lock(sMutex);
    if (sCapturing) {
        sMessages.push_back({priority, text});
    } else {
        ADD_FAILURE() << "an unexpected message to the system log: " << text;
    }
}

} // namespace

std::ostream& operator<<(std::ostream& os, const SystemLogMessage& message)
{
    return os << message.priority << " \"" << message.text << '"';
}

CapturedSystemLog::CapturedSystemLog()
{
    const MutexLock lock(sMutex);
    if (sCapturing) ADD_FAILURE() << "the system log is captured already";
    sCapturing = true;
    sMessages.clear();
}

CapturedSystemLog::~CapturedSystemLog()
{
    const MutexLock lock(sMutex);
    sCapturing = false;
    sMessages.clear();
}

std::vector<SystemLogMessage> CapturedSystemLog::take()
{
    const MutexLock lock(sMutex);
    return std::exchange(sMessages, {});
}

} // namespace qel::test

// The C library's entry points: the plain one, and the one that fortified code calls.
extern "C" {

void syslog(int priority, const char* format, ...)
{
    va_list arguments;
    va_start(arguments, format);
    qel::test::record(priority, format, arguments);
    va_end(arguments);
}

void __syslog_chk(int priority, int flag, const char* format, ...); // NOLINT: the C library's name
void __syslog_chk(int priority, int, const char* format, ...)
{
    va_list arguments;
    va_start(arguments, format);
    qel::test::record(priority, format, arguments);
    va_end(arguments);
}

} // extern "C"
