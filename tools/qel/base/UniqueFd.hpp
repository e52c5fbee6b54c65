#pragma once

#include <unistd.h>

namespace qel::tool {

/// Owns a descriptor and closes it. Movable, not copyable; -1 is none.
class UniqueFd {
public:
    UniqueFd() noexcept = default;
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

    int get() const noexcept { return mFd; }

    void reset() noexcept
    {
        if (mFd >= 0) ::close(mFd);
        mFd = -1;
    }

private:
    int mFd = -1;
};

} // namespace qel::tool
