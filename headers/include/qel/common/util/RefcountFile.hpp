#pragma once

#include <qel/common/QelExport.hpp>

#include <atomic>
#include <cstdint>
#include <memory>

namespace qel {

/// A file descriptor that several threads use and one of them may close at any time. The descriptor is closed exactly
/// once, by whichever comes last of the closer and its users, so that no user ever works on a number that has been
/// closed and given to another file.
///
/// Ownership: owns the descriptor; copies share it. It is closed by close(), or when the last copy is destroyed.
/// Thread safety: lock-free; any number of threads may make guards and close at the same time. The object itself
/// (copying it, assigning to it) belongs to one thread at a time.
/// @code
/// RefcountFile::Guard guard(file);
/// if (guard.isValid()) use(guard.getFd());
/// @endcode
class QEL_EXPORT RefcountFile {
public:
    class ControlBlock;
    class Guard;

    /// @param fd a descriptor, owned from here on; with a negative one the object starts closed
    /// @throws std::bad_alloc the descriptor is then still the caller's
    explicit RefcountFile(int fd);

    /// Copies share one descriptor; moving copies, so that the source stays usable.
    RefcountFile(const RefcountFile&) = default;
    RefcountFile& operator=(const RefcountFile&) = default;

    /// Closes the descriptor for all copies: at once when no guard holds it, otherwise when the last of those guards
    /// ends. Guards made from now on get nothing. Closing again does nothing.
    void close() noexcept;

private:
    std::shared_ptr<ControlBlock> mControl; // never null
};

/// The descriptor and the count of its users. Shared by the copies of one RefcountFile.
/// Thread safety: every operation but the destructor may be called from any thread.
class QEL_EXPORT RefcountFile::ControlBlock {
public:
    /// @param fd a descriptor, owned from here on; with a negative one the block starts closed
    explicit ControlBlock(int fd) noexcept;

    /// Calls close().
    ~ControlBlock();

    ControlBlock(const ControlBlock&) = delete;
    ControlBlock& operator=(const ControlBlock&) = delete;

    /// Begins a use of the descriptor.
    /// @return the descriptor, which stays open until the matching putFd(); -1 after close(), to be given back never
    int getFd() noexcept;

    /// Ends a use that getFd() began with a descriptor. Closes the descriptor when it was the last use after close().
    void putFd() noexcept;

    /// Refuses further uses and closes the descriptor, at once when nobody uses it, otherwise with the last use.
    /// Does nothing when it was called before.
    void close() noexcept;

private:
    static constexpr std::uint64_t kOpen = 0x8000000000000000U;

    // The top bit is set while open, the other 63 bits count the users. Word and flag change together: the one who
    // brings the whole word to 0 is the one who closes.
    std::atomic<std::uint64_t> mRefcount;
    const std::int32_t mFd;
};

/// One use of the descriptor, from construction to destruction.
/// Lifetime: holds a plain pointer; a copy of the RefcountFile must outlive the guard.
/// Thread safety: a guard belongs to one thread at a time.
class QEL_EXPORT RefcountFile::Guard {
public:
    explicit Guard(RefcountFile& file) noexcept;
    ~Guard();

    Guard(const Guard&) = delete;
    Guard& operator=(const Guard&) = delete;

    /// @return whether the guard got a descriptor; false when the file was closed before
    bool isValid() const noexcept { return mFd >= 0; }

    /// @return the descriptor, open and of the same file as long as the guard lives, or -1; never close it
    int getFd() const noexcept { return mFd; }

private:
    ControlBlock* mControl;
    std::int32_t mFd;
};

} // namespace qel
