#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"

#include <cerrno>
#include <functional>
#include <gtest/gtest.h>
#include <new>
#include <vector>

namespace qel::test {

namespace {

using protocol::CannotConnect;
using protocol::CannotListen;
using protocol::CertificateRejected;
using protocol::ClosedByPeer;
using protocol::CredentialsUnusable;
using protocol::DeadlinePassed;
using protocol::NameNotResolved;
using protocol::ProtocolBroken;
using protocol::StatusError;
using protocol::TurnedAway;
using tool::CommandFailure;
using tool::ExitStatus;
using Reason = CertificateRejected::Reason;

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
        {"no such name", [] { throw NameNotResolved("x"); }, ExitStatus::CannotConnect},
        {"no connection", [] { throw CannotConnect("x"); }, ExitStatus::CannotConnect},
        {"nowhere to listen", [] { throw CannotListen("x"); }, ExitStatus::CannotConnect},
        {"abort message", [] { throw TurnedAway("x"); }, ExitStatus::Refused},
        {"own credentials", [] { throw CredentialsUnusable("x"); }, ExitStatus::Refused},
        {"their certificate", [] { throw CertificateRejected(Reason::TheirsByUs, "x"); }, ExitStatus::Refused},
        {"their name", [] { throw CertificateRejected(Reason::NamePin, "x"); }, ExitStatus::Refused},
        {"their fingerprint", [] { throw CertificateRejected(Reason::FingerprintPin, "x"); }, ExitStatus::Refused},
        {"our certificate", [] { throw CertificateRejected(Reason::OursByThem, "x"); }, ExitStatus::ClosedByPeer},
        {"deadline", [] { throw DeadlinePassed("x"); }, ExitStatus::DeadlinePassed},
        {"end of the connection", [] { throw ClosedByPeer("x"); }, ExitStatus::ClosedByPeer},
        {"protocol", [] { throw ProtocolBroken("x"); }, ExitStatus::ProtocolBroken},
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
             Row{[] { throw ClosedByPeer("connection lost: EOF"); }, "connection lost: EOF"},
             Row{[] {
                     throw CertificateRejected(Reason::NamePin,
                                               "wrong peer: the name x does not match the pinned names");
                 },
                 "wrong peer: the name x does not match --peer-name"},
             Row{[] { throw CertificateRejected(Reason::FingerprintPin, "x does not match the pinned fingerprints"); },
                 "x does not match --peer-fingerprint"},
             Row{[] { throw CredentialsUnusable("others may read k: use chmod 600"); },
                 "others may read k: use chmod 600, or --insecure-permissions to allow it"},
             Row{[] { throw CredentialsUnusable("k belongs to another user: make it a file of this user"); },
                 "k belongs to another user: make it a file of this user, or --insecure-permissions to allow it"},
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

} // namespace

} // namespace qel::test
