#include "support/CalendarFailure.hpp"

#include <cerrno>
#include <ctime>
#include <dlfcn.h>

namespace qel::test {

namespace {

thread_local bool tFailing = false;

} // namespace

CalendarFailure::CalendarFailure() { tFailing = true; }

CalendarFailure::~CalendarFailure() { tFailing = false; }

} // namespace qel::test

// The C library's entry point.
extern "C" struct tm* gmtime_r(const time_t* time, struct tm* fields) noexcept
{
    if (qel::test::tFailing) {
        errno = EOVERFLOW;
        return nullptr;
    }
    using Function = struct tm*(const time_t*, struct tm*);
    return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, "gmtime_r"))(time, fields);
}
