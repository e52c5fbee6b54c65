#pragma once

#include <unistd.h>

namespace qel {

/// Owns a descriptor and closes it. Movable, not copyable; -1 is none.
/// Thread safety: that of a plain value.
class UniqueFd {
public:
    UniqueFd() noexcept = default;
    /// @param fd  owned from now on; -1: none
    explicit UniqueFd(int fd) noexcept : mFd(fd) {}
    UniqueFd(UniqueFd&& other) noexcept : mFd(other.mFd) { other.mFd = -1; }
    UniqueFd& operator=(UniqueFd&& other) noexcept
    {
        if (this == &other) return *this;
        reset();
        mFd = other.mFd;
        other.mFd = -1;
        return *this;
    }
    ~UniqueFd() { reset(); }

    /// @return the descriptor, still owned; -1: none
    int get() const noexcept { return mFd; }

    /// Closes the descriptor, if there is one.
    void reset() noexcept
    {
        if (mFd >= 0) ::close(mFd);
        mFd = -1;
    }

private:
    int mFd = -1;
};

} // namespace qel
