#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace qel::test {

/// Records the library's OpenSSL calls and makes one of them fail on request. A test program that links
/// OpenSSLCalls.cpp defines the functions listed there itself; the library then calls those, which pass every call on
/// to OpenSSL.
///
/// Calls that OpenSSL makes itself within a recorded one are neither recorded nor made to fail.
///
/// In force for the thread that makes it, from construction to destruction; one at a time.
class OpenSSLCalls {
public:
    OpenSSLCalls();
    ~OpenSSLCalls();
    OpenSSLCalls(const OpenSSLCalls&) = delete;
    OpenSSLCalls& operator=(const OpenSSLCalls&) = delete;

    /// @return the calls so far, each as its name with the integers among its arguments, "BN_rand(128, -1, 0)";
    ///         pointers are left out
    const std::vector<std::string>& calls() const { return mCalls; }

    /// Makes the call at that place of calls() fail: it does nothing but leave one entry in the error queue (see
    /// injectedErrorLine) and return the result: null, or the number.
    void failCall(std::size_t place, int result = 0);
    /// Makes the next call of that function fail.
    void failNext(const std::string& name, int result = 0);
    /// @return true when the failure has happened
    bool hasFailed() const { return mHasFailed; }

    /// @return the log line that the entry of a failed call becomes: "E: [libssl] injected.c:4711: ..."
    static std::string injectedErrorLine();

    /// For the stand-ins. @return true when this call is to fail
    bool note(const std::string& name, const std::string& arguments);
    int result() const { return mResult; }

private:
    static constexpr std::size_t kNone = static_cast<std::size_t>(-1);

    std::vector<std::string> mCalls;
    std::size_t mFailPlace = kNone;
    std::string mFailName;
    int mResult = 0;
    bool mHasFailed = false;
};

/// @return the name in a recorded call
inline std::string nameOf(const std::string& call) { return call.substr(0, call.find('(')); }

/// While it exists, every key that the calling thread generates is a copy of a single key: for tests that make many
/// keys.
class QuickKeys {
public:
    QuickKeys();
    ~QuickKeys();
    QuickKeys(const QuickKeys&) = delete;
    QuickKeys& operator=(const QuickKeys&) = delete;
};

/// Adds the queue entry that a failed call leaves.
void putInjectedError();

} // namespace qel::test
