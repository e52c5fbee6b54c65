#pragma once

#include <cstddef>

/// @file
/// Counts what the code under test allocates, and lets it run out of memory. A program that links Allocations.cpp
/// replaces the global operator new, for shared libraries too.

// clang's thread sanitizer brings an operator new of its own and tolerates no other.
#if defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define QEL_TEST_OWN_OPERATOR_NEW 0
#endif
#endif
#ifndef QEL_TEST_OWN_OPERATOR_NEW
#define QEL_TEST_OWN_OPERATOR_NEW 1
#endif

/// Put this first in each test that makes an Allocations: it skips the test in builds that cannot count.
#define QEL_TEST_NEEDS_ALLOCATIONS()                                                                                   \
    if (!QEL_TEST_OWN_OPERATOR_NEW) GTEST_SKIP() << "this build cannot count allocations"

namespace qel::test {

/// Counts the calls of operator new on the thread that made this object, from its construction on. Each call sets errno
/// to kErrno, as a successful call may, so code that reads errno too late reports a wrong error. Thread safety: belongs
/// to that thread; allocations of other threads do not count, never fail and keep errno.
class Allocations {
public:
    static constexpr int kErrno = 4711; // no error has this number

    Allocations();
    ~Allocations();
    Allocations(const Allocations&) = delete;
    Allocations& operator=(const Allocations&) = delete;

    /// @return the allocations so far
    std::size_t count() const;

    /// Lets `count` more allocations succeed and makes every later one fail with std::bad_alloc, until this object is
    /// destroyed or succeedAgain is called.
    void failAfter(std::size_t count);
    void failAll() { failAfter(0); }
    void succeedAgain();

    /// Allocations that a fake makes within the code under test do not count and do not fail while it holds one of
    /// these.
    class Exempt {
    public:
        Exempt();
        ~Exempt();
        Exempt(const Exempt&) = delete;
        Exempt& operator=(const Exempt&) = delete;

    private:
        const bool mWatching;
        const bool mFailing;
    };
};

} // namespace qel::test
