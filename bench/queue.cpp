#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "Contest.hpp"

#include <blockingconcurrentqueue.h>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

namespace qel::bench {

namespace {

using MessagePointer = std::unique_ptr<QelMessage>;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr std::size_t kBurst = 1000; // messages that are under way at once in the contests of a crowd
constexpr std::size_t kRoom = 100;   // messages that a limited queue holds

MessagePointer makeMessage() { return std::make_unique<QelMessage>(1, 0x6003, 0x8001, NoFlagSet); }

// The contestants. put() and take() wait, takeNow() does not.

class Ours {
public:
    explicit Ours(std::size_t limit = 0) : mQueue(limit) {}
    void put(MessagePointer message) { mQueue.enqueue(std::move(message), MessageQueuingOptions::BLOCKING); }
    MessagePointer take() { return mQueue.waitForMsg(milliseconds::max()); }
    MessagePointer takeNow() { return mQueue.waitForMsg(milliseconds::zero()); }

private:
    QelMessageQueue mQueue;
};

/// Our queue without its figures: the same limit and the same way of waking, but no clock and no statistics.
class WithoutStatistics {
public:
    explicit WithoutStatistics(std::size_t limit = 0) : mLimit(limit) {}
    void put(MessagePointer message)
    {
        std::unique_lock<std::mutex> lock(mMutex);
        while (mLimit != 0 && mBytes >= mLimit) {
            ++mProducers;
            mRoom.wait(lock);
            --mProducers;
        }
        mBytes += message->msgLength();
        mMessages.push_back(std::move(message));
        if (mConsumers == 0) return;
        lock.unlock();
        mArrival.notify_one();
    }
    MessagePointer take()
    {
        std::unique_lock<std::mutex> lock(mMutex);
        while (mMessages.empty()) {
            ++mConsumers;
            mArrival.wait(lock);
            --mConsumers;
        }
        return pTake(lock);
    }
    MessagePointer takeNow()
    {
        std::unique_lock<std::mutex> lock(mMutex);
        return mMessages.empty() ? nullptr : pTake(lock);
    }

private:
    MessagePointer pTake(std::unique_lock<std::mutex>& lock)
    {
        MessagePointer message = std::move(mMessages.front());
        mMessages.pop_front();
        mBytes -= message->msgLength();
        if (mProducers == 0 || mBytes >= mLimit) return message;
        lock.unlock();
        mRoom.notify_one();
        return message;
    }

    const std::size_t mLimit;
    std::mutex mMutex;
    std::condition_variable mArrival;
    std::condition_variable mRoom;
    std::deque<MessagePointer> mMessages;
    std::size_t mBytes = 0;
    int mProducers = 0;
    int mConsumers = 0;
};

/// What anybody writes: a mutex, a deque, a condition variable.
class Plain {
public:
    void put(MessagePointer message)
    {
        {
            const std::lock_guard<std::mutex> lock(mMutex);
            mMessages.push_back(std::move(message));
        }
        mArrival.notify_one();
    }
    MessagePointer take()
    {
        std::unique_lock<std::mutex> lock(mMutex);
        mArrival.wait(lock, [this] { return !mMessages.empty(); });
        MessagePointer message = std::move(mMessages.front());
        mMessages.pop_front();
        return message;
    }
    MessagePointer takeNow() { return take(); }

private:
    std::mutex mMutex;
    std::condition_variable mArrival;
    std::deque<MessagePointer> mMessages;
};

/// Lock-free, with one time stamp on the way in and one on the way out: the least that a latency costs.
class MoodyCamel {
public:
    void put(MessagePointer message) { mQueue.enqueue({std::move(message), steady_clock::now()}); }
    MessagePointer take()
    {
        Stamped stamped;
        mQueue.wait_dequeue(stamped);
        return pLatency(stamped);
    }
    MessagePointer takeNow()
    {
        Stamped stamped;
        return mQueue.try_dequeue(stamped) ? pLatency(stamped) : nullptr;
    }

private:
    struct Stamped {
        MessagePointer message;
        steady_clock::time_point start;
    };
    static MessagePointer pLatency(Stamped& stamped)
    {
        benchmark::DoNotOptimize(steady_clock::now() - stamped.start);
        return std::move(stamped.message);
    }

    moodycamel::BlockingConcurrentQueue<Stamped> mQueue;
};

// The work.

template <typename Queue>
void oneThread(benchmark::State& state)
{
    Queue queue;
    MessagePointer message = makeMessage();
    for (auto _ : state) {
        queue.put(std::move(message));
        message = queue.takeNow();
    }
}

/// Passes a burst from this thread to another one and waits until all of it has arrived. The messages exist already:
/// what is measured is the way, not the allocator.
template <typename Queue>
void passBursts(benchmark::State& state, Queue& queue)
{
    std::vector<MessagePointer> here(kBurst);
    std::vector<MessagePointer> there(kBurst);
    for (MessagePointer& message : here)
        message = makeMessage();

    Plain done; // tells that a burst has arrived; null: it was the last one
    Plain next;
    std::thread consumer([&] {
        while (next.take() != nullptr) {
            for (MessagePointer& message : there)
                message = queue.take();
            done.put(makeMessage());
        }
    });
    for (auto _ : state) {
        next.put(makeMessage());
        for (MessagePointer& message : here)
            queue.put(std::move(message));
        done.take();
        here.swap(there);
    }
    next.put(nullptr);
    consumer.join();
}

template <typename Queue>
void oneAndOne(benchmark::State& state)
{
    Queue queue;
    passBursts(state, queue);
}

/// The same with a limit that the producer runs into.
template <typename Queue>
void oneAndOneLimited(benchmark::State& state)
{
    Queue queue(kRoom * makeMessage()->msgLength());
    passBursts(state, queue);
}

/// One message to another thread and back.
template <typename Queue>
void thereAndBack(benchmark::State& state)
{
    Queue there;
    Queue back;
    std::thread echo([&] {
        while (MessagePointer message = there.take()) {
            const bool last = message->getCallerId() == 0;
            back.put(std::move(message));
            if (last) return;
        }
    });
    MessagePointer message = makeMessage();
    for (auto _ : state) {
        there.put(std::move(message));
        message = back.take();
    }
    there.put(std::make_unique<QelMessage>(0, 0x6003, 0x8001, NoFlagSet));
    back.take();
    echo.join();
}

/// The figures of one message, without a queue.
void statisticsAlone(benchmark::State& state)
{
    QelMessageQueueStatistics statistics;
    const MessagePointer message = makeMessage();
    for (auto _ : state) {
        statistics.enqueued(*message, std::chrono::nanoseconds(100));
        statistics.dequeued(*message, std::chrono::nanoseconds(200));
    }
    benchmark::DoNotOptimize(statistics.getPending());
}

void twoReadingsOfTheClock(benchmark::State& state)
{
    for (auto _ : state) {
        benchmark::DoNotOptimize(TimeProvider::steady());
        benchmark::DoNotOptimize(TimeProvider::steady());
    }
}

} // namespace

void addQueueContests()
{
    constexpr char kWithout[] = "the same without statistics";
    constexpr char kPlain[] = "mutex, deque, condition variable";
    constexpr char kMoodyCamel[] = "moodycamel with two time stamps";

    contest("queue: enqueue and dequeue, one thread")
        .ours(oneThread<Ours>)
        .floor(kPlain, 0, oneThread<Plain>)
        .peer(kWithout, 0, oneThread<WithoutStatistics>)
        .peer(kMoodyCamel, 2.1, oneThread<MoodyCamel>);
    contest("queue: 1000 messages, one producer, one consumer")
        .ours(oneAndOne<Ours>)
        .floor(kPlain, 0, oneAndOne<Plain>)
        .peer(kWithout, 0, oneAndOne<WithoutStatistics>)
        .peer(kMoodyCamel, 1.65, oneAndOne<MoodyCamel>);
    contest("queue: the same with room for 100")
        .ours(oneAndOneLimited<Ours>)
        .peer(kWithout, 0, oneAndOneLimited<WithoutStatistics>);
    contest("queue: a message there and back, two threads")
        .ours(thereAndBack<Ours>)
        .floor(kPlain, 1.12, thereAndBack<Plain>)
        .peer(kWithout, 0, thereAndBack<WithoutStatistics>)
        .peer(kMoodyCamel, 0.35, thereAndBack<MoodyCamel>);
    contest("queue: statistics of one message")
        .ours(statisticsAlone)
        .floor("two readings of the clock", 0, twoReadingsOfTheClock);
}

} // namespace qel::bench
