// What goes on between the threads of a queue. To be run under the thread sanitizer, too.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/CapturedLog.hpp"
#include "support/CountedMessage.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"
#include "support/ThrowingClock.hpp"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <mutex>
#include <ostream>
#include <sstream>
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
using test::MessageCensus;
using test::SettableClock;
using test::sized;
using test::ThrowingClock;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;

constexpr MessageQueuingOptions kBlocking = MessageQueuingOptions::BLOCKING;
constexpr MessageQueuingOptions kLow = MessageQueuingOptions::LOW_PRIORITY;
constexpr MessageQueuingOptions kBestEffort = MessageQueuingOptions::BEST_EFFORT; // nobody looks at it
constexpr milliseconds kForEver = milliseconds::max();

std::string dumpOf(const QelMessageQueue& queue)
{
    std::ostringstream os;
    queue.dumpStatistics(os, Indent(0, ' '));
    return os.str();
}

/// Waits for other threads to get somewhere. What never comes ends with the time limit of the whole test program.
template <typename Condition>
void waitUntil(const Condition& condition)
{
    while (!condition())
        std::this_thread::yield();
}

/// Waits until that many producers have gone to sleep for room, as their log lines tell. They write them with the lock
/// held, and give it back by falling asleep: whoever then has had the lock knows that they sleep.
void waitForSleepers(const CapturedLog& log, const QelMessageQueue& queue, std::size_t count)
{
    waitUntil([&] {
        const std::vector<std::string> lines = log.lines();
        const auto isSleep = [](const std::string& line) { return line.find("reached, waiting") != std::string::npos; };
        return static_cast<std::size_t>(std::count_if(lines.begin(), lines.end(), isSleep)) == count;
    });
    dumpOf(queue);
}

// One producer that waits for room.

TEST(QelMessageQueueThreads, ABlockedProducerIsLetInWhenAMessageIsTaken)
{
    const CapturedLog log;
    QelMessageQueue queue(100);
    queue.enqueue(sized(100, 1));
    QelMessageQueue::ReturnCode result = QelMessageQueue::DROPPED;
    std::thread producer([&] { result = queue.enqueue(sized(50, 2), kBlocking); });
    waitForSleepers(log, queue, 1);

    EXPECT_EQ(queue.waitForMsg(kForEver)->getCallerId(), 1U);
    EXPECT_EQ(queue.waitForMsg(kForEver)->getCallerId(), 2U);
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

    EXPECT_EQ(queue.waitForMsg(kForEver)->getCallerId(), 1U); // 40 bytes are left, which is below 51
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

TEST(QelMessageQueueThreads, LatenciesCountFromTheCallOfAProducerThatHadToWait)
{
    SettableClock clock;
    const CapturedLog log;
    QelMessageQueue queue(100);
    queue.enqueue(sized(100, 1));
    std::thread producer([&] { queue.enqueue(sized(32, 2), kBlocking); });
    waitForSleepers(log, queue, 1);
    clock.advance(50ms);
    queue.waitForMsg(kForEver); // 50 ms at the head and in all
    producer.join();            // after 50 ms of waiting for room
    clock.advance(150ms);
    queue.waitForMsg(kForEver); // 150 ms at the head, 200 ms since its producer's call
    EXPECT_THAT(dumpOf(queue), HasSubstr("              Enqueue      Dequeue      E2E         \n"
                                         "  0-1ms:      1            0            0           \n"
                                         "  1-10ms:     0            0            0           \n"
                                         "  10-100ms:   1            1            1           \n"
                                         "  100-1000ms: 0            1            1           \n"));
}

/// A stream that lets something happen when the first byte comes.
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

TEST(QelMessageQueueThreads, LatenciesCountFromTheCallOfAProducerThatHadToWaitForTheLock)
{
    SettableClock clock;
    QelMessageQueue queue(0);
    std::thread producer;
    HookedOutput os([&] { // here the lock is held
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

TEST(QelMessageQueueThreads, OneMessageTakenLetsInOneProducerOfEachPriority)
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
    // Now one of each is in, and the others are let in by the next messages that are taken.
    std::vector<unsigned int> kinds;
    for (int i = 0; i < 4; ++i)
        kinds.push_back(queue.waitForMsg(kForEver)->getCallerId() / 10);
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_THAT(std::vector<unsigned int>(kinds.begin(), kinds.begin() + 2), UnorderedElementsAre(1, 2));
    EXPECT_THAT(kinds, UnorderedElementsAre(1, 1, 2, 2));
}

TEST(QelMessageQueueThreads, AProducerWhoseAdmissionFailsMakesWayForAnother)
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

TEST(QelMessageQueueThreads, ShutdownThrowsNothingWhenTheClockFails)
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
    EXPECT_THAT(log.lines(), ::testing::Contains("D: MQ: Shutdown!"));
    EXPECT_TRUE(queue.isShutdown());
    EXPECT_EQ(queue.waitForMsg(kForEver), nullptr);
}

// Consumers.

TEST(QelMessageQueueThreads, AConsumerWaitsForAMessage)
{
    for (const milliseconds timeout : {milliseconds(1h), milliseconds(std::chrono::hours(24 * 365 * 100)),
                                       milliseconds(std::chrono::hours(24 * 365 * 100)) + 1ms,
                                       milliseconds(std::chrono::hours(24 * 365 * 292)), kForEver - 1ms, kForEver}) {
        SCOPED_TRACE(timeout.count());
        QelMessageQueue queue(0);
        std::unique_ptr<QelMessage> message;
        std::thread consumer([&] { message = queue.waitForMsg(timeout); });
        std::this_thread::yield(); // more often than not the consumer sleeps by now
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
        for (const milliseconds timeout : {kForEver, kForEver - 1ms, milliseconds(1h)}) {
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
                    if (queue.waitForMsg(kForEver) != nullptr) ++taken;
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

// Crowds. Each message's caller id tells its producer and its number there.

unsigned int idOf(unsigned int producer, unsigned int number) { return producer << 20 | number; }

/// Takes what a consumer gets and checks that the messages of each producer come in their order.
class Receipts {
public:
    void add(const QelMessage& message)
    {
        const unsigned int producer = message.getCallerId() >> 20;
        const unsigned int number = message.getCallerId() & 0xFFFFF;
        const auto last = mLast.find(producer);
        if (last != mLast.end()) {
            EXPECT_LT(last->second, number) << "producer " << producer;
        }
        mLast[producer] = number;
        mIds.push_back(message.getCallerId());
    }
    const std::vector<unsigned int>& ids() const { return mIds; }

private:
    std::map<unsigned int, unsigned int> mLast;
    std::vector<unsigned int> mIds;
};

/// Every number of every producer, once.
std::vector<unsigned int> allIds(unsigned int producers, unsigned int numbers)
{
    std::vector<unsigned int> ids;
    for (unsigned int producer = 0; producer < producers; ++producer) {
        for (unsigned int number = 0; number < numbers; ++number)
            ids.push_back(idOf(producer, number));
    }
    return ids;
}

constexpr unsigned int kNumbers = 2000; // messages of each producer

struct Crowd {
    const char* name;
    std::size_t sizeLimit;
    unsigned int producers;
    unsigned int consumers;
    milliseconds timeout;
};

class QelMessageQueueCrowds : public testing::TestWithParam<Crowd> {};

TEST_P(QelMessageQueueCrowds, EveryMessageArrivesOnceAndThoseOfOneProducerInOrder)
{
    const Crowd& crowd = GetParam();
    QelMessageQueue queue(crowd.sizeLimit);
    const std::size_t expected = crowd.producers * kNumbers;
    std::atomic<std::size_t> taken{0};

    std::vector<Receipts> receipts(crowd.consumers);
    std::vector<std::thread> threads;
    for (Receipts& mine : receipts) {
        threads.emplace_back([&queue, &taken, &mine, &crowd, expected] {
            while (!queue.isShutdown()) {
                const auto message = queue.waitForMsg(crowd.timeout);
                if (message == nullptr) continue;
                mine.add(*message);
                if (++taken == expected) queue.shutdown();
            }
        });
    }
    for (unsigned int producer = 0; producer < crowd.producers; ++producer) {
        threads.emplace_back([&queue, producer] {
            for (unsigned int number = 0; number < kNumbers; ++number) {
                const MessageQueuingOptions options = producer % 2 == 0 ? kBlocking : kBlocking | kLow;
                const unsigned int length = 32 + (number * 7 + producer) % 100;
                ASSERT_EQ(queue.enqueue(sized(length, idOf(producer, number)), options), QelMessageQueue::OK);
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();

    std::vector<unsigned int> ids;
    for (const Receipts& mine : receipts)
        ids.insert(ids.end(), mine.ids().begin(), mine.ids().end());
    std::sort(ids.begin(), ids.end());
    EXPECT_EQ(ids, allIds(crowd.producers, kNumbers));
    EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        0 (0 B)\nDropped:        0 (0 B)\n"));
}

INSTANTIATE_TEST_SUITE_P(Sizes, QelMessageQueueCrowds,
                         testing::Values(Crowd{"OneAndOne", 300, 1, 1, kForEver},
                                         Crowd{"ManyAndOne", 300, 6, 1, kForEver},
                                         Crowd{"ManyAndMany", 300, 6, 4, kForEver},
                                         Crowd{"ManyAndManyWithTheSmallestLimit", 1, 4, 4, kForEver},
                                         Crowd{"ManyAndManyWithoutALimit", 0, 4, 4, kForEver},
                                         Crowd{"ManyAndManyInAHurry", 300, 4, 4, 1ms},
                                         Crowd{"ManyAndManyThatNeverWait", 300, 4, 4, 0ms}),
                         [](const auto& test) { return test.param.name; });

TEST(QelMessageQueueThreads, WhatIsNotReceivedWasCountedAsDropped)
{
    constexpr unsigned int kProducers = 4;
    QelMessageQueue queue(200);
    std::atomic<unsigned int> dropped{0};
    std::vector<std::thread> producers;
    for (unsigned int producer = 0; producer < kProducers; ++producer) {
        producers.emplace_back([&queue, &dropped, producer] {
            for (unsigned int number = 0; number < kNumbers; ++number) {
                const MessageQueuingOptions options = producer % 2 == 0 ? MessageQueuingOptions::DEFAULT : kLow;
                const auto result = queue.enqueue(sized(32, idOf(producer, number)), options);
                if (result == QelMessageQueue::DROPPED) ++dropped;
            }
        });
    }
    Receipts receipts;
    std::thread consumer([&] {
        while (const auto message = queue.waitForMsg(kForEver))
            receipts.add(*message);
    });
    for (std::thread& producer : producers)
        producer.join();
    waitUntil([&] { return dumpOf(queue).find("Pending:        0 (0 B)") != std::string::npos; });
    queue.shutdown();
    consumer.join();

    EXPECT_EQ(receipts.ids().size() + dropped, kProducers * kNumbers);
    const std::string drops = std::to_string(dropped) + " (" + std::to_string(dropped * 32) + " B)\n";
    const std::string arrivals =
        std::to_string(receipts.ids().size()) + " (" + std::to_string(receipts.ids().size() * 32) + " B)\n";
    EXPECT_THAT(dumpOf(queue), HasSubstr("Dropped:        " + drops + "Completed:      " + arrivals));
}

TEST(QelMessageQueueThreads, ShutdownInTheMiddleOfEverythingLosesNothing)
{
    for (unsigned int round = 0; round < 30; ++round) {
        MessageCensus census;
        {
            QelMessageQueue queue(200);
            std::atomic<bool> over{false};
            std::atomic<unsigned int> sent{0};
            std::atomic<unsigned int> received{0};
            std::vector<std::thread> threads;
            for (unsigned int producer = 0; producer < 4; ++producer) {
                threads.emplace_back([&queue, &census, &sent, producer] {
                    const MessageQueuingOptions options = producer % 2 == 0 ? kBlocking : kBlocking | kLow;
                    while (queue.enqueue(std::make_unique<CountedMessage>(census, 32), options) == QelMessageQueue::OK)
                        ++sent;
                });
            }
            for (int consumer = 0; consumer < 3; ++consumer) {
                threads.emplace_back([&] {
                    for (;;) {
                        const bool ended = over; // shutdown() has returned
                        const auto message = queue.waitForMsg(kForEver);
                        if (message == nullptr) return;
                        EXPECT_FALSE(ended) << "handed out after shutdown";
                        ++received;
                    }
                });
            }
            waitUntil([&] { return received >= round * 20; });
            queue.shutdown();
            over = true;
            for (std::thread& thread : threads)
                thread.join();
            EXPECT_EQ(queue.waitForMsg(kForEver), nullptr);
            EXPECT_EQ(census.living(), static_cast<int>(sent - received));
            const unsigned int left = sent - received;
            EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        " + std::to_string(left) + " ("));
        }
        EXPECT_EQ(census.living(), 0);
    }
}

TEST(QelMessageQueueThreads, DumpsAreConsistentWhileMessagesPass)
{
    QelMessageQueue queue(0);
    std::thread producer([&] {
        for (int i = 0; i < 20000; ++i)
            queue.enqueue(sized(32));
        queue.shutdown();
    });
    std::thread consumer([&] {
        while (queue.waitForMsg(kForEver) != nullptr) {
        }
    });
    while (!queue.isShutdown()) {
        unsigned long long messages = 0;
        unsigned long long bytes = 0;
        const std::string text = dumpOf(queue);
        const std::size_t at = text.find("Pending:");
        ASSERT_EQ(std::sscanf(text.c_str() + at, "Pending: %llu (%llu B)", &messages, &bytes), 2);
        ASSERT_EQ(bytes, messages * 32);
        ASSERT_EQ(text.find("Head Wait:") != std::string::npos, messages != 0);
    }
    producer.join();
    consumer.join();
}

// Memory.

TEST(QelMessageQueueThreads, AFloodThatWaitsForASleepingConsumerStaysWithinTheLimit)
{
    constexpr std::int64_t kLimit = 10000;
    constexpr unsigned int kLongest = 1000;
    constexpr unsigned int kProducers = 3;
    constexpr int kMessages = 1000;
    const CapturedLog log;
    MessageCensus census;
    QelMessageQueue queue(kLimit);
    std::vector<std::thread> producers;
    for (unsigned int producer = 0; producer < kProducers; ++producer) {
        producers.emplace_back([&queue, &census, producer] {
            const MessageQueuingOptions options = producer == 0 ? kBlocking | kLow : kBlocking;
            for (int i = 0; i < kMessages; ++i) {
                const unsigned int length = 32 + static_cast<unsigned int>(i * 37) % (kLongest - 31);
                ASSERT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, length), options),
                          QelMessageQueue::OK);
            }
        });
    }
    waitForSleepers(log, queue, kProducers); // nobody takes anything: all of them come to rest

    // One byte below the limit and one whole message wait at most, and each producer has one more in its hands.
    constexpr std::int64_t kMost = kLimit - 1 + kLongest + kProducers * kLongest;
    EXPECT_GE(census.bytes(), kLimit);
    EXPECT_LE(census.bytes(), kMost);

    for (unsigned int i = 0; i < kProducers * kMessages; ++i)
        EXPECT_NE(queue.waitForMsg(kForEver), nullptr);
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_LE(census.mostBytes(), kMost + kLongest); // and the consumer had one
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueueThreads, AFloodThatDoesNotWaitStaysWithinTheLimit)
{
    constexpr std::int64_t kLimit = 10000;
    constexpr unsigned int kLength = 500;
    MessageCensus census;
    QelMessageQueue queue(kLimit);
    int dropped = 0;
    for (int i = 0; i < 10000; ++i) {
        const auto options = i % 2 == 0 ? MessageQueuingOptions::DEFAULT : kLow;
        if (queue.enqueue(std::make_unique<CountedMessage>(census, kLength), options) == QelMessageQueue::DROPPED)
            ++dropped;
    }
    EXPECT_EQ(census.bytes(), kLimit);
    EXPECT_EQ(dropped, 10000 - kLimit / kLength);
    EXPECT_LE(census.mostBytes(), kLimit + kLength);
}

TEST(QelMessageQueueThreads, BulkDoesNotKeepUrgentMessagesOut)
{
    const CapturedLog log;
    QelMessageQueue queue(1000);
    std::thread bulk([&] {
        for (int i = 0; i < 100; ++i)
            queue.enqueue(sized(100, 1), kBlocking | kLow);
    });
    waitForSleepers(log, queue, 1); // at half of the limit
    EXPECT_EQ(queue.enqueue(sized(100, 2)), QelMessageQueue::OK);
    std::vector<unsigned int> order;
    for (int i = 0; i < 101; ++i)
        order.push_back(queue.waitForMsg(kForEver)->getCallerId());
    bulk.join();
    EXPECT_EQ(std::find(order.begin(), order.end(), 2U) - order.begin(), 5); // behind what waited already
}

// A queue that is destroyed by the thread that was woken, while the one that woke it may not have returned yet.

constexpr int kDestructions = 300;

TEST(QelMessageQueueDestruction, ByTheConsumerOfTheLastMessage)
{
    for (int round = 0; round < kDestructions; ++round) {
        auto queue = std::make_unique<QelMessageQueue>(0);
        std::thread producer([queue = queue.get()] { queue->enqueue(sized(32)); });
        EXPECT_NE(queue->waitForMsg(kForEver), nullptr);
        queue.reset();
        producer.join();
    }
}

TEST(QelMessageQueueDestruction, ByTheProducerThatWasLetIn)
{
    for (int round = 0; round < kDestructions; ++round) {
        auto queue = std::make_unique<QelMessageQueue>(32);
        queue->enqueue(sized(32));
        std::thread consumer([queue = queue.get()] { EXPECT_NE(queue->waitForMsg(kForEver), nullptr); });
        EXPECT_EQ(queue->enqueue(sized(32), kBlocking), QelMessageQueue::OK);
        queue.reset();
        consumer.join();
    }
}

TEST(QelMessageQueueDestruction, ByTheConsumerThatShutdownSentHome)
{
    for (int round = 0; round < kDestructions; ++round) {
        auto queue = std::make_unique<QelMessageQueue>(0);
        std::thread owner([queue = queue.get()] { queue->shutdown(); });
        EXPECT_EQ(queue->waitForMsg(kForEver), nullptr);
        queue.reset();
        owner.join();
    }
}

TEST(QelMessageQueueDestruction, ByWhoeverSeesThatItIsShutDown)
{
    for (int round = 0; round < kDestructions; ++round) {
        auto queue = std::make_unique<QelMessageQueue>(0);
        std::thread owner([queue = queue.get()] { queue->shutdown(); });
        waitUntil([&] { return queue->isShutdown(); });
        queue.reset();
        owner.join();
    }
}

} // namespace
} // namespace qel
