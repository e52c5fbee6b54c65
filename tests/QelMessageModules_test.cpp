// A process with several modules that were built separately: they must share the process-wide state of the library and
// recognise each other's objects and exceptions.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>

#include "support/CallerIdScope.hpp"
#include "support/MessageModule.hpp"

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <stdexcept>
#include <string>
#include <typeinfo>

namespace qel {
namespace {

using test::CallerIdScope;
using testing::StrEq;
using testing::ThrowsMessage;

/// A loaded module. It is never unloaded: messages that it built may outlive this object.
class Module {
public:
    explicit Module(const char* path) : mHandle(::dlopen(path, RTLD_NOW | RTLD_LOCAL))
    {
        if (mHandle == nullptr) throw std::runtime_error(::dlerror());
    }

    template <typename Function>
    Function* find(const char* name) const
    {
        void* const symbol = ::dlsym(mHandle, name);
        if (symbol == nullptr) throw std::runtime_error(::dlerror());
        return reinterpret_cast<Function*>(symbol);
    }

private:
    void* mHandle;
};

class QelMessageModules : public testing::Test {
protected:
    Module mOne{QEL_MESSAGE_MODULE_ONE};
    Module mTwo{QEL_MESSAGE_MODULE_TWO};
};

TEST_F(QelMessageModules, AreTwo)
{
    EXPECT_NE(mOne.find<decltype(nextCallerId)>("nextCallerId"), mTwo.find<decltype(nextCallerId)>("nextCallerId"));
}

TEST_F(QelMessageModules, ShareTheCallerIdCounterWithTheProgram)
{
    auto* const nextOfOne = mOne.find<decltype(nextCallerId)>("nextCallerId");
    auto* const nextOfTwo = mTwo.find<decltype(nextCallerId)>("nextCallerId");
    auto* const messageOfOne = mOne.find<decltype(callerIdOfNewMessage)>("callerIdOfNewMessage");
    auto* const messageOfTwo = mTwo.find<decltype(callerIdOfNewMessage)>("callerIdOfNewMessage");
    CallerIdScope scope(1000);
    EXPECT_EQ(nextOfOne(), 1001U);
    EXPECT_EQ(nextOfTwo(), 1002U);
    EXPECT_EQ(QelMessage::generateNextUint32(), 1003U);
    EXPECT_EQ(messageOfOne(), 1004U);
    EXPECT_EQ(messageOfTwo(), 1005U);
    EXPECT_EQ(QelMessageUpgradeConnectionAsync().getCallerId(), 1006U);
    EXPECT_EQ(nextOfOne(), 1007U);
}

TEST_F(QelMessageModules, ShareTheInternalRegistryWithTheProgram)
{
    const void* const own = &QelInternalMessageRegistry::getInstance();
    EXPECT_EQ(mOne.find<decltype(internalRegistry)>("internalRegistry")(), own);
    EXPECT_EQ(mTwo.find<decltype(internalRegistry)>("internalRegistry")(), own);
}

TEST_F(QelMessageModules, BuildMessagesThatTheProgramRecognises)
{
    for (const Module* module : {&mOne, &mTwo}) {
        const std::unique_ptr<QelMessage> message(module->find<decltype(newMessage)>("newMessage")());
        const QelMessage& object = *message;
        EXPECT_NE(dynamic_cast<const QelMessageAbortHandshakeAsync*>(&object), nullptr);
        EXPECT_EQ(dynamic_cast<const QelMessageUpgradeConnectionAsync*>(&object), nullptr);
        EXPECT_EQ(typeid(object), typeid(QelMessageAbortHandshakeAsync));
        EXPECT_EQ(object.getCallerId(), 9U);
    }
}

TEST_F(QelMessageModules, ThrowExceptionsThatTheProgramCatchesByClass)
{
    const std::string text = QelMessageStatusException(QelMessage(9, 0x6001, 0x0002, NoFlagSet)).what();
    for (const Module* module : {&mOne, &mTwo}) {
        auto* const thrower = module->find<decltype(throwStatus)>("throwStatus");
        EXPECT_THAT([&] { thrower(); }, ThrowsMessage<QelMessageStatusException>(StrEq(text)));
        EXPECT_THAT([&] { thrower(); }, ThrowsMessage<QelMessageValidationException>(StrEq(text)));
    }
}

} // namespace
} // namespace qel
