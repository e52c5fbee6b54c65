#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "base/MessageKind.hpp"

#include <gtest/gtest.h>

namespace qel::test {

namespace {

using protocol::isKind;

TEST(MessageKind, AMessageIsOfTheKindOfItsClass)
{
    EXPECT_TRUE(isKind<QelMessageGetQelTodReq>(QelMessageGetQelTodReq()));
    EXPECT_TRUE(isKind<QelMessageUpgradeConnectionAsync>(QelMessageUpgradeConnectionAsync()));
}

TEST(MessageKind, TheClassOfTheObjectDoesNotMatter)
{
    // Without a payload, so that no registry makes an object of the class.
    EXPECT_TRUE(isKind<QelMessageDaxBroadcastReq>(QelMessageGeneric(1, 0x6003, 0x0106, MsgResponseExpected)));
}

TEST(MessageKind, FunctionOperationAndClassificationMustMatch)
{
    EXPECT_TRUE(isKind<QelMessageGetQelTodReq>(QelMessageGeneric(1, 0x6003, 0x0107, MsgResponseExpected)));
    EXPECT_FALSE(isKind<QelMessageGetQelTodReq>(QelMessageGeneric(1, 0x6002, 0x0107, MsgResponseExpected)));
    EXPECT_FALSE(isKind<QelMessageGetQelTodReq>(QelMessageGeneric(1, 0x6003, 0x0108, MsgResponseExpected)));
    EXPECT_FALSE(isKind<QelMessageGetQelTodReq>(QelMessageGeneric(1, 0x6003, 0x0107, MsgResponse)));
}

} // namespace

} // namespace qel::test
