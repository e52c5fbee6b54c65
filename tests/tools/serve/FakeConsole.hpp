#pragma once

#include <qel/common/QelMessageCast.hpp>

#include "serve/ConsoleLink.hpp"

#include <deque>
#include <memory>
#include <stdexcept>
#include <utility>

namespace qel::test {

/// The way to a console, as the hypervisor's logic sees it: keeps what is posted.
class FakeConsole : public tool::ConsoleLink {
public:
    bool room = true;       ///< for responses, notices and broadcasts
    bool serialRoom = true; ///< for serial data
    bool finished = false;
    unsigned resumed = 0;

    void post(std::unique_ptr<QelMessage> message) override
    {
        if (finished) throw std::logic_error("posted after finish()");
        mPosted.push_back(std::move(message));
    }
    void postSerial(std::unique_ptr<QelMessage> message) override
    {
        if (!serialRoom) throw std::logic_error("serial data without room");
        post(std::move(message));
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

    std::size_t posted() const { return mPosted.size(); }

    /// The oldest message that was not taken yet.
    std::unique_ptr<QelMessage> take()
    {
        if (mPosted.empty()) throw std::logic_error("nothing was posted");
        std::unique_ptr<QelMessage> message = std::move(mPosted.front());
        mPosted.pop_front();
        return message;
    }

    /// The same, as the class it must be of.
    template <typename T>
    std::unique_ptr<T> take()
    {
        std::unique_ptr<QelMessage> message = take();
        return qelMessageCast<T>(message);
    }

private:
    std::deque<std::unique_ptr<QelMessage>> mPosted;
};

} // namespace qel::test
