#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <exception>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ostream>
#include <string>
#include <sys/resource.h>
#include <vector>

/// @file
/// Real connections inside this machine, for tests of sockets, and matchers for their errors.

namespace qel::test {

/// @return port 0 of the address of this machine itself: 127.0.0.1 or ::1
IPEndpoint loopback(IPFamily family = IPFamily::IPv4);

/// @return a listener on a free port, which getSocketName() returns
Socket makeListener(IPFamily family = IPFamily::IPv4, int backlog = 8);

/// Both ends of a TCP connection, blocking.
struct TcpPair {
    Socket client;
    Socket server;
};
TcpPair makeTcpPair(IPFamily family = IPFamily::IPv4);

/// An endpoint of this machine that never answers: a listener whose queue is full, so that the system drops further
/// connection requests.
class SilentEndpoint {
public:
    explicit SilentEndpoint(IPFamily family = IPFamily::IPv4);

    const IPEndpoint& endpoint() const { return mEndpoint; }
    /// Closes the listener: the next attempt of a pending connection is refused.
    void closeListener() { mListener = Socket(-1); }

private:
    Socket mHolder; // reserves the port after the listener is closed
    Socket mListener;
    IPEndpoint mEndpoint;
    std::vector<Socket> mWaiting; // fill the queue
};

/// @return a TCP socket that is bound to a free port and does not listen: while it is open, connections to its
///         getSocketName() are refused
Socket makeRefusingSocket(IPFamily family = IPFamily::IPv4);

/// @return the backlog that a listening TCP socket was given, as the kernel keeps it (tcp(7), TCP_INFO)
unsigned int backlogOf(const Socket& listener);

/// @return why this machine has no loopback address of the family; empty when it has
std::string whyNoLoopback(IPFamily family);

/// Tests that run over IPv4 and IPv6 alike. On a machine without ::1 the IPv6 half is skipped with the reason.
class EachFamily : public ::testing::TestWithParam<IPFamily> {
protected:
    void SetUp() override
    {
        const std::string reason = whyNoLoopback(GetParam());
        if (!reason.empty()) GTEST_SKIP() << reason;
    }
};
#define QEL_TEST_OVER_EACH_FAMILY(suite)                                                                               \
    INSTANTIATE_TEST_SUITE_P(Over, suite, ::testing::Values(qel::IPFamily::IPv4, qel::IPFamily::IPv6),                 \
                             ::testing::PrintToStringParamName())

/// The process can open no descriptors while this object exists. Use it only around the system call that is to fail, in
/// a replacement of SystemCalls: the sanitizers open descriptors for their checks. Preserves errno.
class NoMoreDescriptors {
public:
    /// @param limit  descriptors from this number on cannot be opened
    explicit NoMoreDescriptors(rlim_t limit = 0);
    ~NoMoreDescriptors();
    NoMoreDescriptors(const NoMoreDescriptors&) = delete;
    NoMoreDescriptors& operator=(const NoMoreDescriptors&) = delete;

private:
    rlimit mBefore;
};

/// A call that throws a PosixError with exactly this code and text.
inline auto ThrowsPosixError(int code, const std::string& text)
{
    using ::testing::AllOf;
    using ::testing::Property;
    using ::testing::StrEq;
    return ::testing::Throws<PosixError>(AllOf(Property("code", &PosixError::getErrorCode, PosixErrorCode(code)),
                                               Property("text", &PosixError::what, StrEq(text))));
}

/// An exception in which a PosixError with exactly this code and text is nested.
MATCHER_P2(NestsPosixError, code, text, "")
{
    try {
        std::rethrow_if_nested(arg);
    } catch (const PosixError& nested) {
        *result_listener << "nests " << nested.what();
        return nested.getErrorCode() == PosixErrorCode(code) && std::string(nested.what()) == text;
    } catch (...) {
        *result_listener << "nests something else";
        return false;
    }
    *result_listener << "nests nothing";
    return false;
}

/// A back-end that changes errno with each line, as writing to a file may: errno must be saved before a line is
/// written.
class ErrnoSpoilingLogBackend : public LogBackend {
public:
    void log(LogLevel::Level, const std::string&) override { errno = ENOTTY; }
};

/// An exception in which nothing is nested.
MATCHER(NestsNothing, "")
{
    try {
        std::rethrow_if_nested(arg);
    } catch (...) {
        return false;
    }
    return true;
}

} // namespace qel::test
