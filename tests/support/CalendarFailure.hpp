#pragma once

namespace qel::test {

/// Makes gmtime_r(3) fail, as it does for a year that does not fit its type, from construction to destruction. No time
/// of the standard clocks reaches such a year. A program that links CalendarFailure.cpp replaces the C library's
/// function, for the calls of shared libraries too.
/// Thread safety: in force for the thread that makes it; one at a time.
class CalendarFailure {
public:
    CalendarFailure();
    ~CalendarFailure();
    CalendarFailure(const CalendarFailure&) = delete;
    CalendarFailure& operator=(const CalendarFailure&) = delete;
};

} // namespace qel::test
