#pragma once

#include <ctime>

namespace qel::test {

/// Replaces time(2), so that a test can stop or set the calendar. A test program that links CalendarTime.cpp defines
/// the function itself; the library, and OpenSSL when it checks the validity of a certificate, then call that.
///
/// Active for the thread that makes it, from construction to destruction; one at a time.
class CalendarTime {
public:
    /// @param now  what every call returns, in seconds since 1970-01-01 00:00 UTC
    explicit CalendarTime(std::time_t now);
    ~CalendarTime();
    CalendarTime(const CalendarTime&) = delete;
    CalendarTime& operator=(const CalendarTime&) = delete;

    void set(std::time_t now) { mNow = now; }
    /// Makes every call advance the time, so that a test notices a second read.
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
