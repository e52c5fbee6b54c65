#pragma once

#include "support/SizedMessage.hpp"

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <utility>

namespace qel::test {

/// The number of live CountedMessages, the sum of their frame lengths in bytes, and its maximum.
/// Lifetime: must outlive its messages. Thread safety: any thread.
class MessageCensus {
public:
    int living() const { return mLiving; }
    std::int64_t bytes() const { return mBytes; }
    std::int64_t mostBytes() const { return mMostBytes; }

private:
    friend class CountedMessage;

    void add(std::int64_t messageBytes)
    {
        ++mLiving;
        const std::int64_t now = mBytes += messageBytes;
        std::int64_t most = mMostBytes;
        while (most < now && !mMostBytes.compare_exchange_weak(most, now)) {
        }
    }
    void remove(std::int64_t messageBytes)
    {
        --mLiving;
        mBytes -= messageBytes;
    }

    std::atomic<int> mLiving{0};
    std::atomic<std::int64_t> mBytes{0};
    std::atomic<std::int64_t> mMostBytes{0};
};

/// A message that is counted while it is alive.
class CountedMessage : public SizedMessage {
public:
    /// @param atTheEnd  called by the destructor
    CountedMessage(
        MessageCensus& census, unsigned int length, unsigned int callerId = 0, std::function<void()> atTheEnd = [] {})
        : SizedMessage(length, callerId), mCensus(census), mAtTheEnd(std::move(atTheEnd))
    {
        mCensus.add(msgLength());
    }
    ~CountedMessage() override
    {
        mCensus.remove(msgLength());
        mAtTheEnd();
    }
    CountedMessage(const CountedMessage&) = delete;
    CountedMessage& operator=(const CountedMessage&) = delete;

private:
    MessageCensus& mCensus;
    std::function<void()> mAtTheEnd;
};

} // namespace qel::test
