#pragma once

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageRegistry.hpp>

#include "hypervisor/ConsoleLink.hpp"
#include "hypervisor/DeferredWakeUps.hpp"
#include "support/Allocations.hpp"

#include <deque>
#include <memory>
#include <stdexcept>
#include <utility>

namespace qel::test {

/// A link to a console. Keeps what is posted, as the console would read it from the wire.
class FakeConsole : public protocol::ConsoleLink {
public:
    bool room = true;       ///< for responses, notices and broadcasts
    bool serialRoom = true; ///< for serial data
    bool finished = false;
    bool isCut = false;
    unsigned resumed = 0;
    std::shared_ptr<protocol::LinkWriter> writer; ///< woken for serial data; null: none

    void post(std::unique_ptr<QelMessage> message) override
    {
        const Allocations::Exempt exempt;
        if (finished) throw std::logic_error("posted after finish()");
        mPosted.push_back(mRegistry.deserialize(message->serialize(), message->msgLength()));
    }
    void postSerial(std::unique_ptr<QelMessage> message) override
    {
        if (!serialRoom) throw std::logic_error("serial data without room");
        post(std::move(message));
        if (writer != nullptr) protocol::DeferredWakeUps::wake(writer);
    }
    bool offer(std::unique_ptr<QelMessage> message) override
    {
        if (room) post(std::move(message));
        return room;
    }
    bool hasRoom() const override { return room; }
    bool hasSerialRoom() const override { return serialRoom; }
    void resumeReading() override { ++resumed; }
    void finish() override
    {
        if (finished) throw std::logic_error("finished twice");
        finished = true;
    }
    void cut() override { isCut = true; }

    std::size_t posted() const { return mPosted.size(); }

    /// The oldest posted message that has not been taken.
    std::unique_ptr<QelMessage> take()
    {
        if (mPosted.empty()) throw std::logic_error("nothing was posted");
        std::unique_ptr<QelMessage> message = std::move(mPosted.front());
        mPosted.pop_front();
        return message;
    }

    /// The same, as a T. @throws std::bad_cast  it is of another class
    template <typename T>
    std::unique_ptr<T> take()
    {
        std::unique_ptr<QelMessage> message = take();
        return qelMessageCast<T>(message);
    }

private:
    QelMessageRegistry mRegistry;
    std::deque<std::unique_ptr<QelMessage>> mPosted;
};

} // namespace qel::test
