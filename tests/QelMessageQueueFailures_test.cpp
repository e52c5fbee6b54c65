// A failed operation leaves the queue as it was.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "QueueKit.hpp"
#include "support/Allocations.hpp"
#include "support/CountedMessage.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"
#include "support/ThrowingClock.hpp"

#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ios>
#include <memory>
#include <new>
#include <ostream>
#include <stdexcept>
#include <streambuf>
#include <string>
#include <utility>

namespace qel {
namespace {

using namespace std::chrono_literals;
using test::Allocations;
using test::CountedMessage;
using test::dumpOf;
using test::MessageCensus;
using test::SettableClock;
using test::sized;
using test::take;
using test::ThrowingClock;
using testing::HasSubstr;

TEST(QelMessageQueueFailures, AClockThatFailsInEnqueueLeavesTheQueueUnchanged)
{
    ThrowingClock clock;
    MessageCensus census;
    QelMessageQueue queue(0);
    const std::string before = dumpOf(queue);
    for (int readings = 0; readings < 3; ++readings) { // of the call, of the admission, of the head
        SCOPED_TRACE(readings);
        clock.failAfter(readings);
        EXPECT_THROW(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), std::runtime_error);
        clock.work();
        EXPECT_EQ(census.living(), 0);
        EXPECT_EQ(dumpOf(queue), before);
        EXPECT_EQ(queue.waitForMsg(0ms), nullptr);
    }
    EXPECT_EQ(queue.enqueue(sized(32, 7)), QelMessageQueue::OK);
    EXPECT_EQ(take(queue), 7U);
}

TEST(QelMessageQueueFailures, AClockThatFailsInWaitForMsgLeavesTheMessageInTheQueue)
{
    ThrowingClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(32, 7));
    const std::string before = dumpOf(queue);
    for (int readings = 0; readings < 2; ++readings) { // of the latency, of the head
        SCOPED_TRACE(readings);
        clock.failAfter(readings);
        EXPECT_THROW(queue.waitForMsg(0ms), std::runtime_error);
        clock.work();
        EXPECT_EQ(dumpOf(queue), before);
    }
    EXPECT_EQ(take(queue), 7U);
}

TEST(QelMessageQueueFailures, AFailedAllocationLeavesTheQueueUnchanged)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    SettableClock clock;
    MessageCensus census;
    QelMessageQueue queue(0);
    int failed = 0;
    int queued = 0;
    while (failed < 3) { // one message in many allocates
        ASSERT_LT(queued, 1000);
        auto message = std::make_unique<CountedMessage>(census, 32);
        const std::string before = dumpOf(queue);
        bool thrown = false;
        {
            Allocations allocations;
            allocations.failAll();
            try {
                queue.enqueue(std::move(message));
            } catch (const std::bad_alloc&) {
                thrown = true;
            }
        }
        if (thrown) {
            ++failed;
            EXPECT_EQ(dumpOf(queue), before);
            EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), QelMessageQueue::OK);
        }
        ++queued;
        EXPECT_EQ(census.living(), queued);
    }
    while (queued > 0) {
        EXPECT_NE(queue.waitForMsg(0ms), nullptr);
        --queued;
    }
    EXPECT_EQ(queue.waitForMsg(0ms), nullptr);
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueueFailures, ReleasesTheLockAfterAFailedClock)
{
    ThrowingClock clock;
    QelMessageQueue queue(0);
    clock.failAfter(1);
    EXPECT_THROW(queue.enqueue(sized(32)), std::runtime_error);
    clock.work();
    EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        0 (0 B)\n")); // takes the lock
}

TEST(QelMessageQueueFailures, ReleasesTheLockAfterADumpToAStreamThatFails)
{
    struct FullDisk : std::streambuf {}; // takes nothing
    FullDisk disk;
    std::ostream os(&disk);
    os.exceptions(std::ios_base::badbit);
    QelMessageQueue queue(0);
    queue.enqueue(sized(32, 7));
    EXPECT_THROW(queue.dumpStatistics(os, Indent(0, ' ')), std::ios_base::failure);
    EXPECT_EQ(take(queue), 7U);
}

} // namespace
} // namespace qel
