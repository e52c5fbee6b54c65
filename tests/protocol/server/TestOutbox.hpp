#pragma once

#include <qel/common/QelMessageGeneric.hpp>

#include "server/Outbox.hpp"

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

/// Lengths and limits are in this unit. So two messages, of at least 32 units each, do not fit one batch.
constexpr unsigned int kUnit = 260;
static_assert(2 * 32 * kUnit > protocol::Outbox::kBatchBytes, "see above");

/// A frame of the given length in bytes, at least 32, that carries a number.
inline std::unique_ptr<QelMessage> frameOf(unsigned int callerId, std::size_t bytes)
{
    auto message = std::make_unique<QelMessageGeneric>(callerId, 0x6003, 0x0107, MsgResponse);
    const std::string payload(bytes - 32, 'x');
    message->setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

/// The same, of a length in units.
inline std::unique_ptr<QelMessage> frame(unsigned int callerId, unsigned int units = 32)
{
    return frameOf(callerId, units * kUnit);
}

/// Keeps the numbers of what was sent, batch by batch, and counts how often room was reported.
class TestOutbox final : public protocol::Outbox {
public:
    using Batch = std::vector<unsigned int>;

    explicit TestOutbox(std::size_t limit) : Outbox(limit) {}
    ~TestOutbox() override { retire(); }

    void resumeReading() override {}
    void cut() override {}

    bool needsNoWait = true;
    std::size_t room = ~std::size_t{0}; // messages that go out without waiting
    std::function<void()> onSend;       // called when a batch is sent; may throw

    // Of the thread that sends.
    std::vector<Batch> batches;
    std::vector<bool> mayWait; // for each batch
    Batch rest;                // what found no room
    unsigned failures = 0;
    unsigned roomCalls = 0;
    bool hadRoomWhenTold = true; // each time

private:
    bool pNeedsNoWait() const override { return needsNoWait; }
    void pBeginBatch(bool canWait) override
    {
        if (canWait) rest.clear();
        mayWait.push_back(canWait);
        batches.emplace_back();
    }
    void pGather(const QelMessage& message) override { batches.back().push_back(message.getCallerId()); }
    bool pSendBatch() override
    {
        if (onSend) onSend();
        if (mayWait.back() || batches.back().size() <= room) return true;
        rest.assign(batches.back().begin() + static_cast<std::ptrdiff_t>(room), batches.back().end());
        return false;
    }
    void pOnRoom() override
    {
        ++roomCalls;
        hadRoomWhenTold = hadRoomWhenTold && hasRoom();
    }
    void pOnSendFailure() noexcept override
    {
        ++failures;
        abandon();
    }
};

} // namespace qel::test
