#pragma once

#include <qel/common/QelExport.hpp>

#include <atomic>
#include <cstdint>
#include <memory>

namespace qel {

/// A file descriptor that several threads use and that one of them may close at any time. It is closed exactly once, by
/// the last of its closer and its users, so that a user never works on a number that has been closed and reused for
/// another file.
///
/// Ownership: owns the descriptor; copies share it. close() closes it, or the destruction of the last copy.
/// Thread safety: lock-free; any number of threads may make guards and call close() at the same time. One thread at a
/// time may copy an object or assign to it.
/// @code
/// RefcountFile::Guard guard(file);
/// if (guard.isValid()) use(guard.getFd());
/// @endcode
class QEL_EXPORT RefcountFile {
public:
    class ControlBlock;
    class Guard;

    /// @param fd a descriptor, which this object owns from now on; if it is negative, the object starts closed
    /// @throws std::bad_alloc  no memory; the caller still owns the descriptor
    explicit RefcountFile(int fd);

    /// Copies share one descriptor; a move is a copy, so the source stays usable.
    RefcountFile(const RefcountFile&) = default;
    RefcountFile& operator=(const RefcountFile&) = default;

    /// Closes the descriptor for all copies: at once if no guard holds it, otherwise with the last of those guards.
    /// Later guards are not valid. A second call does nothing.
    void close() noexcept;

private:
    std::shared_ptr<ControlBlock> mControl; // never null
};

/// The descriptor and the count of its users. Shared by the copies of one RefcountFile.
/// Thread safety: any thread may call every operation except the destructor.
class QEL_EXPORT RefcountFile::ControlBlock {
public:
    /// @param fd a descriptor, which this block owns from now on; if it is negative, the block starts closed
    explicit ControlBlock(int fd) noexcept;

    /// Calls close().
    ~ControlBlock();

    ControlBlock(const ControlBlock&) = delete;
    ControlBlock& operator=(const ControlBlock&) = delete;

    /// Begins a use of the descriptor.
    /// @return the descriptor, which stays open until the matching putFd(); -1 after close(), which needs no putFd()
    int getFd() noexcept;

    /// Ends a use for which getFd() returned a descriptor. Closes it if this was the last use after close().
    void putFd() noexcept;

    /// Refuses further uses and closes the descriptor: at once if it is not in use, otherwise with the last use. A
    /// second call does nothing.
    void close() noexcept;

private:
    static constexpr std::uint64_t kOpen = 0x8000000000000000U;

    // The top bit is set while open, the other 63 bits count the users. Flag and count change as one word: the thread
    // that makes the word 0 closes.
    std::atomic<std::uint64_t> mRefcount;
    const std::int32_t mFd;
};

/// One use of the descriptor, from construction to destruction.
/// Lifetime: holds a plain pointer; a copy of the RefcountFile must outlive the guard.
/// Thread safety: a guard belongs to one thread at a time.
class QEL_EXPORT RefcountFile::Guard {
public:
    /// @param file borrowed for the call
    explicit Guard(RefcountFile& file) noexcept;
    ~Guard();

    Guard(const Guard&) = delete;
    Guard& operator=(const Guard&) = delete;

    /// @return whether the guard has a descriptor; false if the file was closed before
    bool isValid() const noexcept { return mFd >= 0; }

    /// @return the descriptor, which stays open as long as the guard lives, or -1; do not close it
    int getFd() const noexcept { return mFd; }

private:
    ControlBlock* mControl;
    std::int32_t mFd;
};

} // namespace qel
