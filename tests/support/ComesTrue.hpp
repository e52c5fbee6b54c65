#pragma once

#include "support/Process.hpp"

#include <chrono>
#include <thread>

namespace qel::test {

/// Waits for a condition that another process brings about, at most for Process::kDeadline.
/// @return whether it has come true; assert it
template <typename F>
[[nodiscard]] bool comesTrue(F condition)
{
    const auto end = std::chrono::steady_clock::now() + Process::kDeadline;
    while (std::chrono::steady_clock::now() < end) {
        if (condition()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return condition();
}

} // namespace qel::test
