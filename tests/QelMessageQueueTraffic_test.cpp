// Many producers and consumers. Run it under the thread sanitizer, too.

#include <qel/common/QelMessageQueue.hpp>

#include "QueueKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/CountedMessage.hpp"
#include "support/SizedMessage.hpp"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using test::CapturedLog;
using test::CountedMessage;
using test::dumpOf;
using test::kBlocking;
using test::kLow;
using test::kNoLimit;
using test::MessageCensus;
using test::sized;
using test::waitForSleepers;
using test::waitUntil;
using testing::HasSubstr;

/// A caller id that holds a producer and the number of its message.
unsigned int idOf(unsigned int producer, unsigned int number) { return producer << 20 | number; }

/// Collects the messages of one consumer and checks that those of each producer come in order.
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

/// The ids of all messages of all producers.
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

TEST_P(QelMessageQueueCrowds, EveryMessageArrivesOnceAndThoseOfAProducerInOrder)
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
                         testing::Values(Crowd{"OneAndOne", 300, 1, 1, kNoLimit},
                                         Crowd{"ManyAndOne", 300, 6, 1, kNoLimit},
                                         Crowd{"ManyAndMany", 300, 6, 4, kNoLimit},
                                         Crowd{"ManyAndManyWithTheSmallestLimit", 1, 4, 4, kNoLimit},
                                         Crowd{"ManyAndManyWithoutALimit", 0, 4, 4, kNoLimit},
                                         Crowd{"ManyAndManyInAHurry", 300, 4, 4, 1ms},
                                         Crowd{"ManyAndManyThatNeverWait", 300, 4, 4, 0ms}),
                         [](const auto& test) { return test.param.name; });

TEST(QelMessageQueueTraffic, EveryMessageIsReceivedOrCountedAsDropped)
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
        while (const auto message = queue.waitForMsg(kNoLimit))
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

TEST(QelMessageQueueTraffic, ShutdownDuringTrafficLosesNoMessage)
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
                        const auto message = queue.waitForMsg(kNoLimit);
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
            EXPECT_EQ(queue.waitForMsg(kNoLimit), nullptr);
            EXPECT_EQ(census.living(), static_cast<int>(sent - received));
            const unsigned int left = sent - received;
            EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        " + std::to_string(left) + " ("));
        }
        EXPECT_EQ(census.living(), 0);
    }
}

TEST(QelMessageQueueTraffic, DumpsAreConsistentWhileMessagesPass)
{
    QelMessageQueue queue(0);
    std::thread producer([&] {
        for (int i = 0; i < 20000; ++i)
            queue.enqueue(sized(32));
        queue.shutdown();
    });
    std::thread consumer([&] {
        while (queue.waitForMsg(kNoLimit) != nullptr) {
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

TEST(QelMessageQueueTraffic, BlockedProducersStayWithinTheLimit)
{
    constexpr std::int64_t kLimit = 10000;
    constexpr unsigned int kMaxLength = 1000;
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
                const unsigned int length = 32 + static_cast<unsigned int>(i * 37) % (kMaxLength - 31);
                ASSERT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, length), options),
                          QelMessageQueue::OK);
            }
        });
    }
    waitForSleepers(log, queue, kProducers); // no message is taken, so all of them block

    // At most one byte less than the limit plus one message is pending, and each producer holds one more message.
    constexpr std::int64_t kMaxBytes = kLimit - 1 + kMaxLength + kProducers * kMaxLength;
    EXPECT_GE(census.bytes(), kLimit);
    EXPECT_LE(census.bytes(), kMaxBytes);

    for (unsigned int i = 0; i < kProducers * kMessages; ++i)
        EXPECT_NE(queue.waitForMsg(kNoLimit), nullptr);
    for (std::thread& producer : producers)
        producer.join();
    EXPECT_LE(census.mostBytes(), kMaxBytes + kMaxLength); // the consumer holds one
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueueTraffic, ProducersThatDoNotWaitStayWithinTheLimit)
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

TEST(QelMessageQueueTraffic, LowPriorityLeavesRoomForNormalPriority)
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
        order.push_back(queue.waitForMsg(kNoLimit)->getCallerId());
    bulk.join();
    EXPECT_EQ(std::find(order.begin(), order.end(), 2U) - order.begin(), 5); // after the messages that were pending
}

} // namespace
} // namespace qel
