#pragma once

#include <chrono>
#include <condition_variable>
#include <csignal>
#include <map>
#include <mutex>
#include <string>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace qel::test {

/// A process of the test: started, talked to, and gone when the object goes, killed if need be.
///
/// What it writes is collected in the background, so that it never waits for the test. Every wait has a deadline; one
/// that passes throws std::runtime_error with what the process had written by then.
class Process {
public:
    static constexpr std::chrono::seconds kDeadline{20};

    struct Result {
        int exitStatus; ///< -1: ended by a signal
        int signal;     ///< 0: ended by itself
        std::string output;
        std::string errors;
    };

    /// Starts a program. Standard input is a pipe from writeInput(); variables are added to the environment.
    /// @param arguments  the path of the program first
    /// @param descriptors  the program has them as 3, 4, ...
    /// @throws std::runtime_error  it cannot be started
    explicit Process(const std::vector<std::string>& arguments,
                     const std::map<std::string, std::string>& environment = {},
                     const std::vector<int>& descriptors = {});
    ~Process();
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    pid_t pid() const { return mPid; }

    /// Writes to its standard input; what it does not want to read any more is dropped.
    void writeInput(const std::string& bytes);
    void closeInput();

    /// Sends a signal. With SIGSTOP it returns when all threads of the process have stopped.
    void signal(int number) const;

    /// What it has written so far.
    std::string output() const;
    std::string errors() const;

    /// Waits for the next whole line of standard output. @return the line without its end
    std::string readLine();

    /// Waits until standard output (or error) contains the text.
    void awaitOutput(const std::string& text) const;
    void awaitErrors(const std::string& text) const;

    /// Waits for the process to end and for all it has written.
    Result wait();

    /// The number of descriptors it has open.
    std::size_t descriptors() const;

    /// The number of its children, zombies included.
    std::size_t children() const;

    /// Bytes of memory it has in use (resident).
    std::size_t residentBytes() const;

private:
    void collect();
    void awaitText(const std::string Process::*stream, const std::string& text) const;
    [[noreturn]] void fail(const std::string& what) const;

    pid_t mPid = -1;
    int mInput = -1;
    int mOutput = -1;
    int mErrors = -1;
    bool mReaped = false;
    Result mResult{};

    mutable std::mutex mMutex;
    mutable std::condition_variable mChanged;
    std::string mOutputText; // guarded by mMutex, as all that follows
    std::string mErrorText;
    std::size_t mLinesTaken = 0; // bytes of mOutputText that readLine() has returned
    bool mDrained = false;
    std::thread mCollector;
};

/// Runs a program to its end. @param input  its standard input, all of it
Process::Result run(const std::vector<std::string>& arguments, const std::string& input = {});

} // namespace qel::test
