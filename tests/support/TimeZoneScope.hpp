#pragma once

#include <cstdlib>
#include <ctime>
#include <optional>
#include <string>

namespace qel::test {

/// Sets the local time zone of the process for the length of a test.
class TimeZoneScope {
public:
    /// @param zone  in the form of the environment variable TZ; see tzset(3)
    explicit TimeZoneScope(const char* zone)
    {
        if (const char* const previous = std::getenv("TZ")) mPrevious = previous;
        ::setenv("TZ", zone, 1);
        ::tzset();
    }
    ~TimeZoneScope()
    {
        if (mPrevious) {
            ::setenv("TZ", mPrevious->c_str(), 1);
        } else {
            ::unsetenv("TZ");
        }
        ::tzset();
    }
    TimeZoneScope(const TimeZoneScope&) = delete;
    TimeZoneScope& operator=(const TimeZoneScope&) = delete;

private:
    std::optional<std::string> mPrevious;
};

} // namespace qel::test
