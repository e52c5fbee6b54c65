// How many heap blocks each operation on a message allocates. A block costs more than the rest of the work on a short
// message, so one more is a defect.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "support/Allocations.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <algorithm>
#include <gtest/gtest.h>
#include <new>
#include <string>
#include <vector>

namespace qel {
namespace {

using test::Allocations;
using test::frameOf;
using test::hex;
using test::MessageProbe;
using test::RawFrame;

const std::vector<char>& dataFrame()
{
    static const std::vector<char> frame = [] {
        std::vector<char> payload(68, 'x');
        const char fixed[] = {0, 1, 0, 0, 0, 62};
        std::copy(fixed, fixed + sizeof(fixed), payload.begin());
        return RawFrame::newForm().function(0x6002).operation(0x0405).payload(payload).bytes();
    }();
    return frame;
}

unsigned int lengthOf(const std::vector<char>& frame) { return static_cast<unsigned int>(frame.size()); }

TEST(QelMessageAllocations, ReceivedFrameIsOneBlockForTheObjectAndOneForItsBytes)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const QelMessageRegistry registry;
    const std::vector<char>& frame = dataFrame();
    std::unique_ptr<QelMessage> message;
    std::size_t count = 0;
    {
        const Allocations allocations;
        message = registry.deserialize(frame.data(), lengthOf(frame));
        count = allocations.count();
    }
    EXPECT_EQ(count, 2U);
    ASSERT_NE(dynamic_cast<QelMessageVirtualSerialDataToOsAsync*>(message.get()), nullptr);
    EXPECT_EQ(frameOf(*message), hex(frame));
}

TEST(QelMessageAllocations, UnknownFrameIsOneBlockForTheObjectAndOneForItsBytes)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const QelInternalMessageRegistry registry;
    const std::vector<char>& frame = dataFrame();
    std::unique_ptr<QelMessage> message;
    std::size_t count = 0;
    {
        const Allocations allocations;
        message = registry.deserialize(frame.data(), lengthOf(frame));
        count = allocations.count();
    }
    EXPECT_EQ(count, 2U);
    EXPECT_EQ(frameOf(*message), hex(frame));
}

TEST(QelMessageAllocations, BuiltMessageIsOneBlockOfItsFinalSize)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const char data[62] = {};
    const std::string toolId = "console1";
    std::size_t empty = 0;
    std::size_t serial = 0;
    std::size_t broadcast = 0;
    {
        const Allocations allocations;
        const QelMessage message(1, 2, 3, NoFlagSet);
        empty = allocations.count();
    }
    {
        const Allocations allocations;
        const QelMessageVirtualSerialDataToOsAsync message(1, 0, sizeof(data), data);
        serial = allocations.count();
    }
    {
        const Allocations allocations;
        const QelMessageDaxBroadcastReq message(0, sizeof(data), 7, toolId, data);
        broadcast = allocations.count();
    }
    EXPECT_EQ(empty, 1U);
    EXPECT_EQ(serial, 1U);
    EXPECT_EQ(broadcast, 1U);
}

TEST(QelMessageAllocations, CopyIsOneBlockAndCloneIsTwo)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const MessageProbe message(dataFrame());
    QelMessage target;
    std::size_t copied = 0;
    std::size_t assigned = 0;
    std::size_t cloned = 0;
    {
        const Allocations allocations;
        const QelMessage copy(message);
        copied = allocations.count();
    }
    {
        const Allocations allocations;
        target = message;
        assigned = allocations.count();
    }
    {
        const Allocations allocations;
        const std::unique_ptr<QelMessage> clone = target.clone();
        cloned = allocations.count();
    }
    EXPECT_EQ(copied, 1U);
    EXPECT_EQ(assigned, 1U);
    EXPECT_EQ(cloned, 2U);
}

TEST(QelMessageAllocations, ReadingAllocatesNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const MessageProbe message(dataFrame());
    unsigned int sum = 0;
    std::size_t count = 0;
    {
        const Allocations allocations;
        sum = message.getCallerId() + message.getFunction() + message.getOperation() + message.getFlags() +
              message.getStatus() + message.getStatusDetail() + message.msgLength() + message.dataLength() +
              message.getClassification();
        message.checkStatus();
        count = allocations.count();
    }
    EXPECT_EQ(count, 0U);
    EXPECT_EQ(sum, 0x6002U + 0x0405U + 100U + 68U + QelMessageClassification::Async);
}

// --- out of memory

TEST(QelMessageAllocations, FailedAssignmentChangesNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const MessageProbe source(dataFrame());
    QelMessage target(1, 2, 3, NoFlagSet);
    const std::string before = frameOf(target);
    bool failed = false;
    {
        Allocations allocations;
        allocations.failAll();
        try {
            target = source;
        } catch (const std::bad_alloc&) {
            failed = true;
        }
    }
    EXPECT_TRUE(failed);
    EXPECT_EQ(frameOf(target), before);
}

TEST(QelMessageAllocations, FailedChangeOfThePayloadChangesNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    MessageProbe message(dataFrame());
    unsigned int failures = 0;
    {
        Allocations allocations;
        allocations.failAll();
        try {
            message.pAllocData(5);
        } catch (const std::bad_alloc&) {
            ++failures;
        }
        try {
            message.pSetData("abcde", 5);
        } catch (const std::bad_alloc&) {
            ++failures;
        }
    }
    EXPECT_EQ(failures, 2U);
    EXPECT_EQ(frameOf(message), hex(dataFrame()));
}

TEST(QelMessageAllocations, FailedAllocationPassesThroughDeserialize)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const QelMessageRegistry registry;
    const std::vector<char>& frame = dataFrame();
    bool failed = false;
    {
        Allocations allocations;
        allocations.failAll();
        try {
            registry.deserialize(frame.data(), lengthOf(frame));
        } catch (const std::bad_alloc&) {
            failed = true;
        }
    }
    EXPECT_TRUE(failed) << "running out of memory must not look like a malformed frame";
}

} // namespace
} // namespace qel
