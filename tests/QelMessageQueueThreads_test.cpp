// What happens between the threads of a queue. Run it under the thread sanitizer, too.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "QueueKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/CountedMessage.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"
#include "support/ThrowingClock.hpp"

#include <atomic>
#include <chrono>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <ostream>
#include <stdexcept>
#include <streambuf>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using test::CapturedLog;
using test::CountedMessage;
using test::dumpOf;
using test::kBestEffort;
using test::kBlocking;
using test::kLow;
using test::kNoLimit;
using test::MessageCensus;
using test::SettableClock;
using test::sized;
using test::ThrowingClock;
using test::waitForSleepers;
using test::waitUntil;
using testing::Contains;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;

// Producers that wait for room.

TEST(QelMessageQueueThreads, ABlockedProducerIsAdmittedWhenAMessageIsTaken)
{
    const CapturedLog log;
    QelMessageQueue queue(100);
    queue.enqueue(sized(100, 1));
    QelMessageQueue::ReturnCode result = QelMessageQueue::DROPPED;
    std::thread producer([&] { result = queue.enqueue(sized(50, 2), kBlocking); });
    waitForSleepers(log, queue, 1);

    EXPECT_EQ(queue.waitForMsg(kNoLimit)->getCallerId(), 1U);
    EXPECT_EQ(queue.waitForMsg(kNoLimit)->getCallerId(), 2U);
    producer.join();
    EXPECT_EQ(result, QelMessageQueue::OK);
    EXPECT_THAT(dumpOf(queue), HasSubstr("Dropped:        0 (0 B)\n"));
    EXPECT_THAT(log.lines(), ElementsAre("D: Message queue limit of 100 reached, waiting",
                                         "D: Unblocking message queue rate limiter (limit 100)"));
}

TEST(QelMessageQueueThreads, ABlockedProducerOfLowPriorityWaitsForItsOwnLimit)
{
    const CapturedLog log;
    QelMessageQueue queue(101);
    queue.enqueue(sized(51, 1));
    queue.enqueue(sized(40, 2));
    QelMessageQueue::ReturnCode result = QelMessageQueue::DROPPED;
    std::thread producer([&] { result = queue.enqueue(sized(50, 3), kBlocking | kLow); });
    waitForSleepers(log, queue, 1);

    EXPECT_EQ(queue.waitForMsg(kNoLimit)->getCallerId(), 1U); // 40 bytes are left, which is below 51
    producer.join();
    EXPECT_EQ(result, QelMessageQueue::OK);
    EXPECT_EQ(queue.waitForMsg(0ms)->getCallerId(), 2U);
    EXPECT_EQ(queue.waitForMsg(0ms)->getCallerId(), 3U);
    EXPECT_THAT(log.lines(), ElementsAre("D: Message queue limit of 51 reached, waiting",
                                         "D: Unblocking message queue rate limiter (limit 51)"));
}

TEST(QelMessageQueueThreads, BlockedProducersReturnAtShutdownAndAreNotCountedAsDropped)
{
    const CapturedLog log;
    MessageCensus census;
    QelMessageQueue queue(100);
    queue.enqueue(sized(100, 1));
    std::vector<std::thread> producers;
    for (const MessageQueuingOptions options :
         {kBlocking, kBlocking | kLow, kBlocking | kBestEffort, kBlocking | kLow | kBestEffort}) {
        producers.emplace_back([&queue, &census, options] {
            EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32), options), QelMessageQueue::SHUTDOWN);
        });
    }
    waitForSleepers(log, queue, 4);
    queue.shutdown();
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_EQ(census.living(), 0);
    EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        1 (100 B)\nDropped:        0 (0 B)\n"));
}

TEST(QelMessageQueueThreads, LatenciesStartWithTheCallOfABlockedProducer)
{
    SettableClock clock;
    const CapturedLog log;
    QelMessageQueue queue(100);
    queue.enqueue(sized(100, 1));
    std::thread producer([&] { queue.enqueue(sized(32, 2), kBlocking); });
    waitForSleepers(log, queue, 1);
    clock.advance(50ms);
    queue.waitForMsg(kNoLimit); // 50 ms at the head and in all
    producer.join();            // after 50 ms of waiting for room
    clock.advance(150ms);
    queue.waitForMsg(kNoLimit); // 150 ms at the head, 200 ms since its producer's call
    EXPECT_THAT(dumpOf(queue), HasSubstr("              Enqueue      Dequeue      E2E         \n"
                                         "  0-1ms:      1            0            0           \n"
                                         "  1-10ms:     0            0            0           \n"
                                         "  10-100ms:   1            1            1           \n"
                                         "  100-1000ms: 0            1            1           \n"));
}

/// A stream that calls a function when the first byte is written.
class HookedOutput : private std::streambuf, public std::ostream {
public:
    explicit HookedOutput(std::function<void()> hook) : std::ostream(this), mHook(std::move(hook)) {}

private:
    int overflow(int character) override
    {
        if (mHook) std::exchange(mHook, nullptr)();
        return character;
    }

    std::function<void()> mHook;
};

TEST(QelMessageQueueThreads, LatenciesStartWithTheCallOfAProducerThatWaitsForTheLock)
{
    SettableClock clock;
    QelMessageQueue queue(0);
    std::thread producer;
    HookedOutput os([&] { // called with the lock held
        producer = std::thread([&] { queue.enqueue(sized(32)); });
        waitUntil([&] { return clock.steadyReads() == 1; });
        clock.advance(50ms);
    });
    queue.dumpStatistics(os, Indent(0, ' '));
    producer.join();
    clock.advance(150ms);
    queue.waitForMsg(0ms); // 150 ms at the head, 200 ms since its producer's call
    EXPECT_THAT(dumpOf(queue), HasSubstr("              Enqueue      Dequeue      E2E         \n"
                                         "  0-1ms:      0            0            0           \n"
                                         "  1-10ms:     0            0            0           \n"
                                         "  10-100ms:   1            0            0           \n"
                                         "  100-1000ms: 0            1            1           \n"));
}

TEST(QelMessageQueueThreads, TakingAMessageAdmitsOneProducerOfEachPriority)
{
    const CapturedLog log;
    QelMessageQueue queue(100);
    queue.enqueue(sized(1000, 1));
    std::vector<std::thread> producers;
    for (const unsigned int callerId : {10U, 11U, 20U, 21U}) {
        const MessageQueuingOptions options = callerId < 20 ? kBlocking : kBlocking | kLow;
        producers.emplace_back([&queue, callerId, options] { queue.enqueue(sized(32, callerId), options); });
    }
    waitForSleepers(log, queue, 4);

    EXPECT_EQ(queue.waitForMsg(0ms)->getCallerId(), 1U);
    waitUntil([&] { return dumpOf(queue).find("Pending:        2 (64 B)") != std::string::npos; });
    // One of each priority is admitted now; the others follow with the next messages that are taken.
    std::vector<unsigned int> kinds;
    for (int i = 0; i < 4; ++i)
        kinds.push_back(queue.waitForMsg(kNoLimit)->getCallerId() / 10);
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_THAT(std::vector<unsigned int>(kinds.begin(), kinds.begin() + 2), UnorderedElementsAre(1, 2));
    EXPECT_THAT(kinds, UnorderedElementsAre(1, 1, 2, 2));
}

TEST(QelMessageQueueThreads, AProducerWhoseAdmissionFailsWakesAnother)
{
    const CapturedLog log;
    ThrowingClock clock;
    QelMessageQueue queue(32);
    queue.enqueue(sized(32, 1));
    std::atomic<int> failed{0};
    std::atomic<int> queued{0};
    std::vector<std::thread> producers;
    for (int i = 0; i < 2; ++i) {
        producers.emplace_back([&] {
            try {
                queue.enqueue(sized(32, 2), kBlocking);
                ++queued;
            } catch (const std::runtime_error&) {
                ++failed;
            }
        });
    }
    waitForSleepers(log, queue, 2);
    clock.failSteadyOnceAfter(2); // the next two readings are those of waitForMsg
    EXPECT_EQ(queue.waitForMsg(0ms)->getCallerId(), 1U);
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_EQ(failed, 1);
    EXPECT_EQ(queued, 1);
    EXPECT_EQ(queue.waitForMsg(0ms)->getCallerId(), 2U);
}

TEST(QelMessageQueueThreads, ShutdownDoesNotThrowWhenTheClockFails)
{
    const CapturedLog log;
    ThrowingClock clock;
    QelMessageQueue queue(32);
    queue.enqueue(sized(32));
    std::thread producer([&] { EXPECT_EQ(queue.enqueue(sized(32), kBlocking), QelMessageQueue::SHUTDOWN); });
    waitForSleepers(log, queue, 1);
    clock.failOnceAfter(0);
    EXPECT_NO_THROW(queue.shutdown());
    producer.join();
    EXPECT_THAT(log.lines(), Contains("D: MQ: Shutdown!"));
    EXPECT_TRUE(queue.isShutdown());
    EXPECT_EQ(queue.waitForMsg(kNoLimit), nullptr);
}

// Consumers.

TEST(QelMessageQueueThreads, AConsumerWaitsForAMessage)
{
    for (const milliseconds timeout : {milliseconds(1h), milliseconds(std::chrono::hours(24 * 365 * 100)),
                                       milliseconds(std::chrono::hours(24 * 365 * 100)) + 1ms,
                                       milliseconds(std::chrono::hours(24 * 365 * 292)), kNoLimit - 1ms, kNoLimit}) {
        SCOPED_TRACE(timeout.count());
        QelMessageQueue queue(0);
        std::unique_ptr<QelMessage> message;
        std::thread consumer([&] { message = queue.waitForMsg(timeout); });
        std::this_thread::yield(); // usually the consumer sleeps by now
        queue.enqueue(sized(32, 5));
        consumer.join();
        ASSERT_NE(message, nullptr);
        EXPECT_EQ(message->getCallerId(), 5U);
    }
}

TEST(QelMessageQueueThreads, ConsumersReturnAtShutdown)
{
    for (int round = 0; round < 50; ++round) {
        QelMessageQueue queue(0);
        std::vector<std::thread> consumers;
        for (const milliseconds timeout : {kNoLimit, kNoLimit - 1ms, milliseconds(1h)}) {
            consumers.emplace_back([&queue, timeout] { EXPECT_EQ(queue.waitForMsg(timeout), nullptr); });
        }
        std::this_thread::yield();
        queue.shutdown();
        for (std::thread& consumer : consumers)
            consumer.join();
    }
}

TEST(QelMessageQueueThreads, AConsumerThatFailsLeavesTheMessageToAnother)
{
    for (int round = 0; round < 20; ++round) {
        ThrowingClock clock;
        QelMessageQueue queue(0);
        std::atomic<int> failed{0};
        std::atomic<int> taken{0};
        std::vector<std::thread> consumers;
        for (int i = 0; i < 2; ++i) {
            consumers.emplace_back([&] {
                try {
                    if (queue.waitForMsg(kNoLimit) != nullptr) ++taken;
                } catch (const std::runtime_error&) {
                    ++failed;
                }
            });
        }
        std::this_thread::yield();
        clock.failOnceAfter(3); // the three readings of enqueue
        queue.enqueue(sized(32));
        for (std::thread& consumer : consumers)
            consumer.join();
        EXPECT_EQ(failed, 1);
        EXPECT_EQ(taken, 1);
    }
}

} // namespace
} // namespace qel
