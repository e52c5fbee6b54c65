#include "support/ProcessIdCalls.hpp"

#include <atomic>
#include <sys/syscall.h>
#include <sys/types.h>
#include <unistd.h>

namespace qel::test {

namespace {

std::atomic<unsigned> sCalls{0};

} // namespace

unsigned processIdCalls() { return sCalls; }

} // namespace qel::test

// The C library's entry point.
extern "C" pid_t getpid() noexcept
{
    ++qel::test::sCalls;
    return static_cast<pid_t>(::syscall(SYS_getpid));
}
