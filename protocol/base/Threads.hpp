#pragma once

#include <csignal>
#include <thread>
#include <utility>

namespace qel::protocol {

/// Starts a thread that takes none of the program's signals: their handlers run on the program's own threads.
/// @throws std::system_error  the system allows no more threads
template <typename Work>
std::thread startThread(Work&& work)
{
    struct Blocked {
        Blocked() noexcept
        {
            sigset_t all;
            ::sigfillset(&all);
            ::pthread_sigmask(SIG_SETMASK, &all, &before);
        }
        ~Blocked() { ::pthread_sigmask(SIG_SETMASK, &before, nullptr); }
        Blocked(const Blocked&) = delete;
        Blocked& operator=(const Blocked&) = delete;

        sigset_t before{};
    };
    const Blocked blocked; // a thread inherits the signals that its creator blocks
    return std::thread(std::forward<Work>(work));
}

} // namespace qel::protocol
