#include "support/CalendarTime.hpp"

#include <cstdlib>
#include <dlfcn.h>

namespace qel::test {

namespace {

thread_local CalendarTime* tCurrent = nullptr;

} // namespace

CalendarTime::CalendarTime(std::time_t now) : mNow(now)
{
    if (tCurrent != nullptr) std::abort();
    tCurrent = this;
}

CalendarTime::~CalendarTime() { tCurrent = nullptr; }

std::time_t CalendarTime::read()
{
    ++mReads;
    const std::time_t now = mNow;
    mNow += mStep;
    return now;
}

} // namespace qel::test

extern "C" __attribute__((visibility("default"))) std::time_t time(std::time_t* result) noexcept
{
    using Function = std::time_t (*)(std::time_t*);
    std::time_t now = 0;
    if (qel::test::tCurrent != nullptr) {
        now = qel::test::tCurrent->read();
    } else {
        static const auto sReal = reinterpret_cast<Function>(::dlsym(RTLD_NEXT, "time"));
        if (sReal == nullptr) std::abort();
        now = sReal(nullptr);
    }
    if (result != nullptr) *result = now;
    return now;
}
