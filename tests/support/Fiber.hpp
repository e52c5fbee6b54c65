#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <ucontext.h>

namespace qel::test {

/// A thread of control that runs only when told and stops where it chooses to; see makecontext(3). It does one job
/// after the other. Knows the sanitizers' ways of being told about such things.
/// Thread safety: all fibers and whoever resumes them belong to one thread.
class Fiber {
public:
    Fiber();
    ~Fiber(); // its job must have ended
    Fiber(const Fiber&) = delete;
    Fiber& operator=(const Fiber&) = delete;

    /// Gives it a job, which begins with the next resume().
    void assign(std::function<void()> job);
    /// Lets the job go on until it suspends itself or ends.
    void resume();
    /// To be called by the job: back to whoever resumed it.
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
    // Exceptions that are being handled are kept by the C++ runtime for each thread of the system: two words.
    struct Handled {
        void* caught;
        std::size_t uncaught;
    };
    Handled mHandled = {};
    // What the sanitizers want to know.
    [[maybe_unused]] void* mSanitizerFiber = nullptr;
    [[maybe_unused]] void* mSanitizerOutside = nullptr;
    [[maybe_unused]] const void* mOutsideStack = nullptr;
    [[maybe_unused]] std::size_t mOutsideStackBytes = 0;
};

} // namespace qel::test
