#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>

#include "base/StreamFailure.hpp"
#include "support/Errors.hpp"

#include <cerrno>
#include <gmock/gmock.h>
#include <memory>
#include <stdexcept>

namespace qel::test {

namespace {

using protocol::ClosedByPeer;
using protocol::DeadlinePassed;
using protocol::Error;
using protocol::StatusError;

/// Throws the way the stream layer does: what the system said, nested in what the stream says.
[[noreturn]] void throwOfStream(int error)
{
    try {
        throw PosixError(error, "socket stream failed to receive");
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException("socket stream receive failure"));
    }
}

/// Lets throwStreamFailure() translate what `fail` throws.
template <typename F>
void translate(F fail)
{
    try {
        fail();
    } catch (const StreamIOException& error) {
        protocol::throwStreamFailure(error, "host:1");
    }
}

TEST(Error, NamesThePeer)
{
    EXPECT_EQ(Error("x").getPeer(), "");
    EXPECT_EQ(Error("x", "host:1").getPeer(), "host:1");
}

TEST(Error, TakesWhatWasAttemptedInFront)
{
    ClosedByPeer error("the peer ended the connection");
    const ClosedByPeer before = error;
    error.addContext("no protected connection to host:1: ", "host:1");
    EXPECT_STREQ(error.what(), "no protected connection to host:1: the peer ended the connection");
    EXPECT_EQ(error.getPeer(), "host:1");
    EXPECT_STREQ(before.what(), "the peer ended the connection");
}

TEST(StatusError, CarriesACopyOfTheResponse)
{
    auto response = std::make_unique<QelMessageGeneric>(7, 0x6003, 0x0107, MsgResponse);
    response->setStatus(QelMessageStatusTooManyConnections, 0xAB);
    const StatusError error(*response, "host:1");
    response.reset();
    const StatusError copy = error;
    EXPECT_EQ(copy.getStatus(), QelMessageStatusTooManyConnections);
    EXPECT_EQ(copy.getResponse().getStatusDetail(), 0xAB);
    EXPECT_EQ(copy.getResponse().getCallerId(), 7U);
    EXPECT_STREQ(error.what(), "the request was refused: [CID: 0x00000007, FN: 0x6003, OP: 0x0107, FL: 0x40, DL: 0, "
                               "ST: 0x00000012:00AB]");
}

TEST(ThrowStreamFailure, TellsADeadlineFromTheEndOfAConnection)
{
    EXPECT_THAT([] { translate([] { throw StreamIOException("I/O deadline"); }); },
                failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
    EXPECT_THAT([] { translate([] { throwOfStream(EAGAIN); }); },
                failsWith<DeadlinePassed>("the peer did not answer in time: socket stream receive failure: socket "
                                          "stream failed to receive: 11 (Resource temporarily unavailable)"));
    EXPECT_THAT([] { translate([] { throw StreamIOException("EOF"); }); },
                failsWith<ClosedByPeer>("connection lost: EOF"));
    EXPECT_THAT([] { translate([] { throwOfStream(ECONNRESET); }); },
                failsWith<ClosedByPeer>("connection lost: socket stream receive failure: socket stream failed to "
                                        "receive: 104 (Connection reset by peer)"));
}

TEST(ThrowStreamFailure, NestsTheCauseAndNamesThePeer)
{
    try {
        translate([] { throwOfStream(EPIPE); });
        FAIL() << "nothing was thrown";
    } catch (const ClosedByPeer& error) {
        EXPECT_EQ(error.getPeer(), "host:1");
        EXPECT_THROW(std::rethrow_if_nested(error), StreamIOException);
    }
}

TEST(Explain, JoinsTheCauses)
{
    try {
        throwOfStream(EPIPE);
    } catch (const std::exception& error) {
        EXPECT_EQ(protocol::explain(error),
                  "socket stream receive failure: socket stream failed to receive: 32 (Broken pipe)");
    }
}

TEST(Explain, DoesNotRepeatTheCausesThatAnErrorNamesItself)
{
    try {
        translate([] { throw StreamIOException("EOF"); });
    } catch (const std::exception& error) {
        EXPECT_EQ(protocol::explain(error), "connection lost: EOF");
    }
}

TEST(Explain, ACauseOfAnotherKindIsUnknown)
{
    try {
        try {
            throw 7;
        } catch (...) {
            std::throw_with_nested(std::runtime_error("outer"));
        }
    } catch (const std::exception& error) {
        EXPECT_EQ(protocol::explain(error), "outer: unknown cause");
    }
}

} // namespace

} // namespace qel::test
