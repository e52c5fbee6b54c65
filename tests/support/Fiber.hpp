#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <ucontext.h>

namespace qel::test {

/// A thread of control that runs when it is resumed, until it suspends itself; see makecontext(3). Runs one job after
/// another. Tells the sanitizers about each switch.
/// Thread safety: all fibers and their callers belong to one thread.
class Fiber {
public:
    Fiber();
    ~Fiber(); // the job must have ended
    Fiber(const Fiber&) = delete;
    Fiber& operator=(const Fiber&) = delete;

    /// Sets the job, which starts with the next resume().
    void assign(std::function<void()> job);
    /// Runs the job until it suspends itself or ends.
    void resume();
    /// Called by the job: returns to the caller of resume().
    void suspend();
    bool hasJob() const { return static_cast<bool>(mJob); }

private:
    static void sMain(unsigned int high, unsigned int low);
    void pRun();
    void pSwitch(bool in);

    static constexpr std::size_t kStackBytes = 256 * 1024;

    std::unique_ptr<char[]> mStack;
    std::function<void()> mJob;
    ucontext_t mInside = {};
    ucontext_t mOutside = {};
    // What the C++ runtime keeps for each system thread about exceptions being handled: two words.
    struct Handled {
        void* caught;
        std::size_t uncaught;
    };
    Handled mHandled = {};
    // For the sanitizers.
    [[maybe_unused]] void* mSanitizerFiber = nullptr;
    [[maybe_unused]] void* mSanitizerOutside = nullptr;
    [[maybe_unused]] const void* mOutsideStack = nullptr;
    [[maybe_unused]] std::size_t mOutsideStackBytes = 0;
};

} // namespace qel::test
