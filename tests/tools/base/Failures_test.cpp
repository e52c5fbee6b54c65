#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"

#include <cerrno>
#include <functional>
#include <gtest/gtest.h>
#include <new>
#include <vector>

namespace qel::test {

namespace {

using tool::CommandFailure;
using tool::ExitStatus;
using tool::StatusError;

/// Throws the way the stream layer does: what the system said, nested in what the stream says.
[[noreturn]] void throwStreamFailure(int error)
{
    try {
        throw PosixError(error, "socket stream failed to receive");
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException("socket stream receive failure"));
    }
}

QelMessageGeneric refusal()
{
    QelMessageGeneric message(1, 0x6003, 0x0107, MsgResponse);
    message.setStatus(QelMessageStatusTooManyConnections, 0xAB);
    return message;
}

struct Case {
    const char* name;
    std::function<void()> fail;
    ExitStatus expected;
};

TEST(Failures, EachKindOfFailureHasItsExitStatus)
{
    const std::vector<Case> cases{
        {"own", [] { throw CommandFailure(ExitStatus::CannotConnect, "x"); }, ExitStatus::CannotConnect},
        {"refused", [] { throw StatusError(refusal()); }, ExitStatus::Refused},
        {"broken frame", [] { throw QelMessageValidationException("x"); }, ExitStatus::ProtocolBroken},
        {"of another class", [] { throw QelMessageCastException(QelMessageGeneric(), "T"); },
         ExitStatus::ProtocolBroken},
        {"deadline passed before", [] { throw StreamIOException("I/O deadline"); }, ExitStatus::DeadlinePassed},
        {"deadline passed during", [] { throwStreamFailure(EAGAIN); }, ExitStatus::DeadlinePassed},
        {"end of stream", [] { throw StreamIOException("EOF"); }, ExitStatus::ClosedByPeer},
        {"reset", [] { throwStreamFailure(ECONNRESET); }, ExitStatus::ClosedByPeer},
        {"broken pipe", [] { throwStreamFailure(EPIPE); }, ExitStatus::ClosedByPeer},
        {"system", [] { throw PosixError(ENOSPC); }, ExitStatus::Failed},
        {"memory", [] { throw std::bad_alloc(); }, ExitStatus::Failed},
    };
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.name);
        try {
            entry.fail();
            ADD_FAILURE() << "nothing was thrown";
        } catch (const std::exception& error) {
            EXPECT_EQ(tool::exitStatusOf(error), entry.expected);
        }
    }
}

TEST(Failures, ExitStatusesHaveTheDocumentedNumbers)
{
    EXPECT_EQ(static_cast<int>(ExitStatus::Done), 0);
    EXPECT_EQ(static_cast<int>(ExitStatus::Refused), 1);
    EXPECT_EQ(static_cast<int>(ExitStatus::Usage), 2);
    EXPECT_EQ(static_cast<int>(ExitStatus::CannotConnect), 3);
    EXPECT_EQ(static_cast<int>(ExitStatus::Failed), 4);
    EXPECT_EQ(static_cast<int>(ExitStatus::ProtocolBroken), 5);
    EXPECT_EQ(static_cast<int>(ExitStatus::DeadlinePassed), 6);
    EXPECT_EQ(static_cast<int>(ExitStatus::ClosedByPeer), 7);
}

TEST(Failures, ExplanationIncludesTheNestedCauses)
{
    try {
        throwStreamFailure(ECONNRESET);
    } catch (const std::exception& error) {
        EXPECT_EQ(tool::explain(error), "socket stream receive failure: socket stream failed to receive: 104 "
                                        "(Connection reset by peer)");
    }
    EXPECT_EQ(tool::explain(StreamIOException("EOF")), "EOF");
}

TEST(Failures, UserMessageExplainsTheLibrarysPhrase)
{
    struct Row {
        std::function<void()> fail;
        std::string text;
    };
    for (const Row& row : {
             Row{[] { throw CommandFailure(ExitStatus::ClosedByPeer, "own words"); }, "own words"},
             Row{[] { throw StatusError(refusal()); }, "time refused: 0x00000012 (QelMessageStatusTooManyConnections)"},
             Row{[] { throw QelMessageValidationException("Invalid length"); },
                 "the peer broke the protocol: Invalid length"},
             Row{[] { throw StreamIOException("I/O deadline"); }, "the peer did not answer in time: I/O deadline"},
             Row{[] { throwStreamFailure(EAGAIN); },
                 "the peer did not answer in time: socket stream receive failure: socket stream failed to "
                 "receive: 11 (Resource temporarily unavailable)"},
             Row{[] { throw StreamIOException("EOF"); }, "connection lost: EOF"},
             Row{[] { throw PosixError(ENOSPC, "x"); }, "x: 28 (No space left on device)"},
         }) {
        SCOPED_TRACE(row.text);
        try {
            row.fail();
            ADD_FAILURE() << "nothing was thrown";
        } catch (const std::exception& error) {
            EXPECT_EQ(tool::userMessage(error), row.text);
        }
    }
}

TEST(Failures, CauseThatIsNotAnExceptionIsUnknown)
{
    try {
        try {
            throw 42;
        } catch (int) {
            std::throw_with_nested(StreamIOException("outer"));
        }
    } catch (const std::exception& error) {
        EXPECT_EQ(tool::explain(error), "outer: unknown cause");
        EXPECT_EQ(tool::exitStatusOf(error), ExitStatus::ClosedByPeer);
    }
}

} // namespace

} // namespace qel::test
