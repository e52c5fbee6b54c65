#include <qel/common/QelInternalMessageRegistry.hpp>

#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <thread>
#include <type_traits>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::bytes;
using test::CapturedLog;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::RawFrame;
using testing::Each;
using testing::IsEmpty;

std::unique_ptr<QelMessage> deserialize(const QelMessageRegistry& registry, const std::vector<char>& frame)
{
    return registry.deserialize(heapCopy(frame).get(), static_cast<unsigned int>(frame.size()));
}

TEST(QelInternalMessageRegistry, ParsesTheTwoHandshakeMessages)
{
    const QelInternalMessageRegistry registry;
    const std::vector<char> upgrade = RawFrame::newForm().callerId(3).function(0x6001).operation(0x0001).bytes();
    const std::vector<char> abort = RawFrame::newForm().callerId(4).function(0x6001).operation(0x0002).bytes();

    const std::unique_ptr<QelMessage> first = deserialize(registry, upgrade);
    const std::unique_ptr<QelMessage> second = deserialize(registry, abort);
    EXPECT_NE(dynamic_cast<QelMessageUpgradeConnectionAsync*>(first.get()), nullptr);
    EXPECT_NE(dynamic_cast<QelMessageAbortHandshakeAsync*>(second.get()), nullptr);
    EXPECT_EQ(frameOf(*first), hex(upgrade));
    EXPECT_EQ(frameOf(*second), hex(abort));
}

TEST(QelInternalMessageRegistry, ParsesOtherFramesToPlainMessages)
{
    const std::vector<char> frames[] = {
        RawFrame::newForm().function(0x6003).operation(0x0102).flags(0x80).bytes(),
        RawFrame::newForm().function(0x7000).operation(0xA009).bytes(),
        RawFrame::newForm().function(0x6001).operation(0x0003).bytes(),
        RawFrame::newForm().function(0x6001).operation(0x0001).flags(0x80).bytes(),
        RawFrame::newForm().function(0x6001).operation(0x0001).flags(0xC0).bytes(),
    };
    CapturedLog log;
    for (const std::vector<char>& frame : frames) {
        SCOPED_TRACE(hex(frame));
        const std::unique_ptr<QelMessage> message = deserialize(QelInternalMessageRegistry::getInstance(), frame);
        const QelMessage& object = *message;
        EXPECT_EQ(typeid(object), typeid(QelMessage));
        EXPECT_EQ(frameOf(object), hex(frame));
    }
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelInternalMessageRegistry, HasOneInstanceForAllThreads)
{
    static_assert(std::is_same<decltype(QelInternalMessageRegistry::getInstance()), QelInternalMessageRegistry&>::value,
                  "not const: it is handed on to streams");
    std::vector<const QelInternalMessageRegistry*> seen(4);
    std::vector<std::thread> threads;
    for (const QelInternalMessageRegistry*& registry : seen) {
        threads.emplace_back([&registry] { registry = &QelInternalMessageRegistry::getInstance(); });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_THAT(seen, Each(&QelInternalMessageRegistry::getInstance()));
}

TEST(QelInternalMessages, AreBuiltWithoutPayload)
{
    EXPECT_EQ(frameOf(QelMessageUpgradeConnectionAsync(0x0A0B0C0DU)),
              hex(RawFrame::newForm().callerId(0x0A0B0C0D).function(0x6001).operation(0x0001).bytes()));
    EXPECT_EQ(frameOf(QelMessageAbortHandshakeAsync(0x0A0B0C0DU)),
              hex(RawFrame::newForm().callerId(0x0A0B0C0D).function(0x6001).operation(0x0002).bytes()));
}

TEST(QelInternalMessages, DrawNewCallerIds)
{
    const QelMessageUpgradeConnectionAsync first;
    const QelMessageAbortHandshakeAsync second;
    EXPECT_EQ(second.getCallerId(), first.getCallerId() + 1);
}

TEST(QelInternalMessages, IgnoreAPayload)
{
    const std::vector<char> frame =
        RawFrame::newForm().function(0x6001).operation(0x0002).payload(bytes({1, 2, 3})).bytes();
    EXPECT_EQ(frameOf(QelMessageAbortHandshakeAsync(frame.data(), static_cast<unsigned int>(frame.size()))),
              hex(frame));
}

TEST(QelInternalMessages, CloneAsTheirClass)
{
    const QelMessageUpgradeConnectionAsync message(5U);
    const QelMessage& base = message;
    const std::unique_ptr<QelMessage> copy = base.clone();
    EXPECT_NE(dynamic_cast<QelMessageUpgradeConnectionAsync*>(copy.get()), nullptr);
    EXPECT_EQ(frameOf(*copy), frameOf(message));
}

} // namespace
} // namespace qel
