#pragma once

#include <ctime>

namespace qel::test {

/// Stands in for time(2), so that a test can stop the calendar or move it. A test program that links CalendarTime.cpp
/// defines the function itself; the library and OpenSSL, when it looks at the validity of a certificate, then call the
/// test program's.
///
/// In force for the thread that makes it, from construction to destruction; one at a time.
class CalendarTime {
public:
    /// @param now  what every call returns, in seconds since 1970-01-01 00:00 UTC
    explicit CalendarTime(std::time_t now);
    ~CalendarTime();
    CalendarTime(const CalendarTime&) = delete;
    CalendarTime& operator=(const CalendarTime&) = delete;

    void set(std::time_t now) { mNow = now; }
    /// Makes every call add so many seconds, so that reading twice shows.
    void advanceByEachRead(std::time_t seconds) { mStep = seconds; }
    /// @return how often the time was read
    unsigned reads() const { return mReads; }

    /// For the stand-in.
    std::time_t read();

private:
    std::time_t mNow;
    std::time_t mStep = 0;
    unsigned mReads = 0;
};

} // namespace qel::test
