#include "support/Fiber.hpp"

#include <cstdint>
#include <cstring>
#include <cxxabi.h>
#include <stdexcept>
#include <utility>

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define QEL_TEST_ADDRESS_SANITIZER 1
#endif
#if __has_feature(thread_sanitizer)
#define QEL_TEST_THREAD_SANITIZER 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__)
#define QEL_TEST_ADDRESS_SANITIZER 1
#endif
#if defined(__SANITIZE_THREAD__)
#define QEL_TEST_THREAD_SANITIZER 1
#endif

#if defined(QEL_TEST_ADDRESS_SANITIZER)
#include <sanitizer/common_interface_defs.h>
#endif
#if defined(QEL_TEST_THREAD_SANITIZER)
#include <sanitizer/tsan_interface.h>
#endif

namespace qel::test {

Fiber::Fiber() : mStack(new char[kStackBytes])
{
    ::getcontext(&mInside);
    mInside.uc_stack.ss_sp = mStack.get();
    mInside.uc_stack.ss_size = kStackBytes;
    mInside.uc_link = nullptr; // the context never ends
    const auto self = reinterpret_cast<std::uintptr_t>(this);
    ::makecontext(&mInside, reinterpret_cast<void (*)()>(&Fiber::sMain), 2, static_cast<unsigned int>(self >> 32),
                  static_cast<unsigned int>(self));
#if defined(QEL_TEST_THREAD_SANITIZER)
    mSanitizerFiber = __tsan_create_fiber(0);
#endif
}

Fiber::~Fiber()
{
#if defined(QEL_TEST_THREAD_SANITIZER)
    __tsan_destroy_fiber(mSanitizerFiber);
#endif
}

void Fiber::assign(std::function<void()> job)
{
    if (mJob) throw std::logic_error("the fiber has a job");
    mJob = std::move(job);
}

void Fiber::resume() { pSwitch(true); }

void Fiber::suspend() { pSwitch(false); }

void Fiber::pSwitch(bool in)
{
    static_assert(sizeof(Handled) == 16, "as in the C++ runtime of this platform");
    Handled handled;
    std::memcpy(&handled, abi::__cxa_get_globals(), sizeof(handled));
    std::memcpy(abi::__cxa_get_globals(), &mHandled, sizeof(mHandled));
    mHandled = handled;

#if defined(QEL_TEST_ADDRESS_SANITIZER)
    void* fakeStack = nullptr;
    __sanitizer_start_switch_fiber(&fakeStack, in ? mStack.get() : mOutsideStack,
                                   in ? kStackBytes : mOutsideStackBytes);
#endif
#if defined(QEL_TEST_THREAD_SANITIZER)
    if (in) mSanitizerOutside = __tsan_get_current_fiber();
    __tsan_switch_to_fiber(in ? mSanitizerFiber : mSanitizerOutside, 0);
#endif
    if (in) {
        ::swapcontext(&mOutside, &mInside);
    } else {
        ::swapcontext(&mInside, &mOutside);
    }
#if defined(QEL_TEST_ADDRESS_SANITIZER)
    // Resumed: the sanitizer returns the stack of the other side.
    if (in) {
        __sanitizer_finish_switch_fiber(fakeStack, nullptr, nullptr);
    } else {
        __sanitizer_finish_switch_fiber(fakeStack, &mOutsideStack, &mOutsideStackBytes);
    }
#endif
}

void Fiber::sMain(unsigned int high, unsigned int low)
{
    const std::uintptr_t self = static_cast<std::uintptr_t>(high) << 32 | low;
    reinterpret_cast<Fiber*>(self)->pRun();
}

void Fiber::pRun()
{
#if defined(QEL_TEST_ADDRESS_SANITIZER)
    __sanitizer_finish_switch_fiber(nullptr, &mOutsideStack, &mOutsideStackBytes);
#endif
    for (;;) {
        mJob();
        mJob = nullptr;
        suspend();
    }
}

} // namespace qel::test
