#pragma once

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/socket.h>
#include <sys/time.h>
#include <utility>
#include <vector>

/// @file
/// What the tests of socket streams share.

namespace qel::test {

inline const char* const kReadRetried = "W: socket stream read interrupted by signal, retrying I/O";
inline const char* const kWriteRetried = "W: socket stream write interrupted by signal, retrying I/O";

inline auto throwsReceiveFailure(int code, const std::string& nested)
{
    return ::testing::Throws<StreamIOException>(::testing::AllOf(
        ::testing::Property(&StreamIOException::what, ::testing::StrEq("socket stream receive failure")),
        NestsPosixError(code, nested)));
}

inline auto throwsSendFailure(int code, const std::string& nested)
{
    return ::testing::Throws<StreamIOException>(
        ::testing::AllOf(::testing::Property(&StreamIOException::what, ::testing::StrEq("socket stream send failure")),
                         NestsPosixError(code, nested)));
}

inline auto throwsDeadline()
{
    return ::testing::Throws<StreamIOException>(::testing::AllOf(
        ::testing::Property(&StreamIOException::what, ::testing::StrEq("I/O deadline")), NestsNothing()));
}

/// Records the socket options that a stream sets, as texts, in order.
class RecordedOptions {
public:
    explicit RecordedOptions(SystemCalls& calls)
    {
        calls.setsockopt = [this](int fd, int level, int name, const void* value, socklen_t length) {
            mOptions.push_back(pDescribe(level, name, value, length));
            if (mOptions.size() == mFailAt) {
                errno = EPERM;
                return -1;
            }
            return ::setsockopt(fd, level, name, value, length);
        };
    }

    const std::vector<std::string>& options() const { return mOptions; }
    void clear() { mOptions.clear(); }
    /// Lets the nth option fail with EPERM, counted from 1.
    void failAt(std::size_t count) { mFailAt = count; }

private:
    static std::string pDescribe(int level, int name, const void* value, socklen_t length)
    {
        if (level == SOL_SOCKET && (name == SO_RCVTIMEO || name == SO_SNDTIMEO)) {
            EXPECT_EQ(length, sizeof(timeval));
            const timeval* const time = static_cast<const timeval*>(value);
            return std::string(name == SO_RCVTIMEO ? "RCVTIMEO " : "SNDTIMEO ") + std::to_string(time->tv_sec) + "s " +
                   std::to_string(time->tv_usec) + "us";
        }
        EXPECT_EQ(length, sizeof(int));
        return std::to_string(level) + "/" + std::to_string(name) + " = " +
               std::to_string(*static_cast<const int*>(value));
    }

    std::vector<std::string> mOptions;
    std::size_t mFailAt = 0; // never
};

inline timeval kernelTimeout(int fd, int name)
{
    timeval value{-1, -1};
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(fd, SOL_SOCKET, name, &value, &length), 0);
    return value;
}

/// A stream, its peer as a plain socket, and a record of the socket options and the log lines of the stream.
class SocketStreamPair : public ::testing::Test {
protected:
    explicit SocketStreamPair(IPFamily family = IPFamily::IPv4) : SocketStreamPair(makeTcpPair(family)) {}
    explicit SocketStreamPair(TcpPair pair)
        : mStream(std::move(pair.client)), mPeer(std::move(pair.server)), mRecorded(mCalls)
    {
        mLog.clear();
    }

    int fd() const { return mStream.getSocket().getFd(); }

    void peerSends(const std::string& text)
    {
        EXPECT_EQ(mPeer.write(text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    void peerCloses() { mPeer = Socket(-1); }
    /// Closes the connection with a reset.
    void peerResets()
    {
        mCalls.setsockopt = nullptr; // this option is not one of the stream
        const linger atOnce{1, 0};
        mPeer.setSocketOption(SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce));
        peerCloses();
    }
    std::string peerReads(std::size_t length)
    {
        std::string text(length, '\0');
        std::size_t done = 0;
        while (done < length) {
            const ssize_t count = mPeer.read(&text[done], length - done);
            if (count <= 0) break;
            done += static_cast<std::size_t>(count);
        }
        text.resize(done);
        return text;
    }

    std::string read(std::size_t length = 16)
    {
        std::string text(length, '\0');
        text.resize(mStream.read(&text[0], length));
        return text;
    }
    void write(const std::string& text) { mStream.write(text.data(), text.size()); }

    CapturedLog mLog;
    SocketStream mStream;
    Socket mPeer;
    SystemCalls mCalls;
    RecordedOptions mRecorded;
};

} // namespace qel::test
