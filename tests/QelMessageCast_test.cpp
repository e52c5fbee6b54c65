#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageGeneric.hpp>

#include "support/MessageProbe.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <type_traits>

namespace qel {
namespace {

using test::frameOf;
using testing::StrEq;
using testing::ThrowsMessage;

const char* const kFailure =
    "Failed to cast message [CID: 0x00000007, FN: 0x6001, OP: 0x0001, FL: 0x00, DL: 0, ST: 0x00000000:0000] to type "
    "qel::QelMessageAbortHandshakeAsync";

TEST(QelMessageCast, MovesTheMessageToAPointerToItsClass)
{
    std::unique_ptr<QelMessage> message = std::make_unique<QelMessageUpgradeConnectionAsync>(7U);
    const QelMessage* const object = message.get();
    const std::unique_ptr<QelMessageUpgradeConnectionAsync> typed =
        qelMessageCast<QelMessageUpgradeConnectionAsync>(message);
    EXPECT_EQ(typed.get(), object);
    EXPECT_EQ(message, nullptr);
}

TEST(QelMessageCast, KeepsTheOwnerWhenTheMessageIsOfAnotherClass)
{
    std::unique_ptr<QelMessage> message = std::make_unique<QelMessageUpgradeConnectionAsync>(7U);
    const QelMessage* const object = message.get();
    EXPECT_THAT([&] { qelMessageCast<QelMessageAbortHandshakeAsync>(message); },
                ThrowsMessage<QelMessageCastException>(StrEq(kFailure)));
    EXPECT_EQ(message.get(), object);
    EXPECT_EQ(message->getCallerId(), 7U);
}

TEST(QelMessageCast, MovesTheMessageToAPointerToItsBase)
{
    std::unique_ptr<QelMessage> message = std::make_unique<QelMessageGeneric>();
    EXPECT_NE(qelMessageCast<QelMessage>(message), nullptr);
    EXPECT_EQ(message, nullptr);
}

TEST(QelMessageCast, RefusesANullPointer)
{
    std::unique_ptr<QelMessage> message;
    EXPECT_THAT([&] { qelMessageCast<QelMessageGeneric>(message); },
                ThrowsMessage<std::invalid_argument>(StrEq("message")));
}

TEST(QelMessageCast, IgnoresTheIdentityInTheHeader)
{
    std::unique_ptr<QelMessage> plain = std::make_unique<QelMessage>(QelMessageUpgradeConnectionAsync(7U));
    EXPECT_THROW(qelMessageCast<QelMessageUpgradeConnectionAsync>(plain), QelMessageCastException);
    EXPECT_NE(plain, nullptr);
}

TEST(QelMessageCast, ViewsAReferenceAsItsClass)
{
    QelMessageUpgradeConnectionAsync object(7U);
    QelMessage& message = object;
    const QelMessage& constant = object;
    EXPECT_EQ(&qelMessageCast<QelMessageUpgradeConnectionAsync>(message), &object);
    EXPECT_EQ(&qelMessageCast<QelMessageUpgradeConnectionAsync>(constant), &object);
    static_assert(std::is_same<decltype(qelMessageCast<QelMessageGeneric>(message)), QelMessageGeneric&>::value, "");
    static_assert(std::is_same<decltype(qelMessageCast<QelMessageGeneric>(constant)), const QelMessageGeneric&>::value,
                  "");
}

TEST(QelMessageCast, RefusesAReferenceToAnotherClass)
{
    QelMessageUpgradeConnectionAsync object(7U);
    QelMessage& message = object;
    const QelMessage& constant = object;
    EXPECT_THAT([&] { qelMessageCast<QelMessageAbortHandshakeAsync>(message); },
                ThrowsMessage<QelMessageCastException>(StrEq(kFailure)));
    EXPECT_THAT([&] { qelMessageCast<QelMessageAbortHandshakeAsync>(constant); },
                ThrowsMessage<QelMessageCastException>(StrEq(kFailure)));
}

TEST(QelMessageCast, FailureIsAValidationException)
{
    QelMessage message;
    EXPECT_THROW(qelMessageCast<QelMessageGeneric>(message), QelMessageValidationException);
}

} // namespace
} // namespace qel
