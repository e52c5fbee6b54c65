#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include <csignal>
#include <initializer_list>

namespace qel::tool {

/// Makes signals readable from a descriptor (signalfd(2)). Blocks them in the constructing thread and in the threads
/// that it starts later, until destruction: construct it before starting threads.
/// Thread safety: one thread.
class SignalWatch {
public:
    /// @throws PosixError  the descriptor cannot be created
    explicit SignalWatch(std::initializer_list<int> signals);

    /// Restores the signal mask.
    ~SignalWatch();

    SignalWatch(const SignalWatch&) = delete;
    SignalWatch& operator=(const SignalWatch&) = delete;

    /// Readable when a signal is pending.
    PollFd getPollFd() const;

    /// Reads one signal. @return its number; 0: none is pending
    int take();

private:
    sigset_t mPrevious{};
    UniqueFd mFd;
};

} // namespace qel::tool
