#pragma once

#include "support/Pty.hpp"

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace qel::test {

/// A process of the test on a terminal of its own, which is its standard input, output and error, and its controlling
/// terminal: the test types and looks at the screen as a person would. Gone when the object goes, killed if need be.
///
/// The screen is read in the background. Every wait has a deadline; one that passes throws std::runtime_error with what
/// stood on the screen by then.
class PtyProcess {
public:
    static constexpr std::chrono::seconds kDeadline{20};

    struct Result {
        int exitStatus; ///< -1: ended by a signal
        int signal;     ///< 0: ended by itself
        std::string screen;
    };

    /// @param arguments  the path of the program first
    /// @throws std::runtime_error  it cannot be started
    explicit PtyProcess(const std::vector<std::string>& arguments);
    ~PtyProcess();
    PtyProcess(const PtyProcess&) = delete;
    PtyProcess& operator=(const PtyProcess&) = delete;

    pid_t pid() const { return mPid; }
    const Pty& terminal() const { return mPty; }

    /// True while the terminal is as it was before the process was started.
    bool isTerminalUntouched() const { return mPty.attributes() == mOriginal; }

    void type(const std::string& text) const { mPty.type(text); }
    void signal(int number) const;

    /// Waits until the text is on the screen, after what the last call waited for.
    void await(const std::string& text);

    /// All that has been on the screen.
    std::string screen() const;

    /// Waits for the process to end and for all it has put on the screen.
    Result wait();

private:
    void collect();
    [[noreturn]] void fail(const std::string& what) const;

    Pty mPty;
    const termios mOriginal = mPty.attributes();
    pid_t mPid = -1;
    bool mReaped = false;
    Result mResult{};

    mutable std::mutex mMutex;
    mutable std::condition_variable mChanged;
    std::string mScreen;   // guarded by mMutex, as what follows
    std::size_t mSeen = 0; // bytes of it that await() has passed
    bool mDrained = false;
    int mStop[2] = {-1, -1}; // a pipe; closing the second end ends the collector at once
    std::thread mCollector;
};

} // namespace qel::test
