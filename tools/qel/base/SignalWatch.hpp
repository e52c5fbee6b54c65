#pragma once

#include <qel/common/util/Poll.hpp>

#include "base/UniqueFd.hpp"

#include <csignal>
#include <initializer_list>

namespace qel::tool {

/// Turns signals into something to wait for. While it lives they are blocked in the thread that made it and in all
/// threads that this one starts: make it before the threads. See signalfd(2).
/// Thread safety: one thread.
class SignalWatch {
public:
    /// @throws PosixError  no descriptor is left
    explicit SignalWatch(std::initializer_list<int> signals);

    /// The signals are as before.
    ~SignalWatch();

    SignalWatch(const SignalWatch&) = delete;
    SignalWatch& operator=(const SignalWatch&) = delete;

    /// Readable once one of the signals has come.
    PollFd getPollFd() const;

    /// Takes one signal. @return its number; 0: none has come
    int take();

private:
    sigset_t mPrevious{};
    UniqueFd mFd;
};

} // namespace qel::tool
