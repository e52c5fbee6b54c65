#include "support/Allocations.hpp"

#include <cerrno>
#include <cstdlib>
#include <new>

namespace qel::test {

namespace {

// Plain data: operator new runs before any initialiser and must not allocate.
thread_local bool tWatching = false;
thread_local bool tFailing = false;
thread_local std::size_t tBeforeFailing = 0; // allocations that still succeed while tFailing
thread_local std::size_t tCount = 0;

/// @return null: there is no memory
[[maybe_unused]] void* tryToAllocate(std::size_t size) noexcept
{
    if (tWatching) ++tCount;
    if (tFailing) {
        if (tBeforeFailing == 0) return nullptr;
        --tBeforeFailing;
    }
    void* const block = std::malloc(size != 0 ? size : 1);
    if (block != nullptr && tWatching) errno = Allocations::kErrno;
    return block;
}

[[maybe_unused]] void* allocate(std::size_t size)
{
    void* const block = tryToAllocate(size);
    if (block == nullptr) throw std::bad_alloc();
    return block;
}

} // namespace

Allocations::Allocations()
{
    tCount = 0;
    tWatching = true;
}

Allocations::~Allocations()
{
    tWatching = false;
    tFailing = false;
}

std::size_t Allocations::count() const { return tCount; }

void Allocations::failAfter(std::size_t count)
{
    tBeforeFailing = count;
    tFailing = true;
}

void Allocations::succeedAgain() { tFailing = false; }

Allocations::Exempt::Exempt() : mWatching(tWatching), mFailing(tFailing)
{
    tWatching = false;
    tFailing = false;
}

Allocations::Exempt::~Exempt()
{
    tWatching = mWatching;
    tFailing = mFailing;
}

} // namespace qel::test

#if QEL_TEST_OWN_OPERATOR_NEW
void* operator new(std::size_t size) { return qel::test::allocate(size); }
void* operator new[](std::size_t size) { return qel::test::allocate(size); }
// These two as well: the sanitizer's own would not match the operator delete below.
void* operator new(std::size_t size, const std::nothrow_t&) noexcept { return qel::test::tryToAllocate(size); }
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept { return qel::test::tryToAllocate(size); }
void operator delete(void* block) noexcept { std::free(block); }
void operator delete[](void* block) noexcept { std::free(block); }
void operator delete(void* block, std::size_t) noexcept { std::free(block); }
void operator delete[](void* block, std::size_t) noexcept { std::free(block); }
#endif
