#pragma once

#include <qel/common/QelMessage.hpp>

#include <memory>

namespace qel::tool {

/// The way from the hypervisor's logic to one console. None of its operations waits for the console.
///
/// Responses, notices and serial data go out in the order in which they were posted. What finds no room waits for it on
/// the link's side; so whoever posts asks first whether something waits, and what waits stays bounded.
/// Thread safety: called with the hypervisor's lock held, from any thread; must not call the hypervisor back.
class ConsoleLink {
public:
    virtual ~ConsoleLink() = default;

    /// Takes a response or a notice for the console.
    virtual void post(std::unique_ptr<QelMessage> message) = 0;

    /// Takes serial data for the console: bulk, which finds room only while less than half of it is taken.
    virtual void postSerial(std::unique_ptr<QelMessage> message) = 0;

    /// Takes a message that is not worth waiting for, if there is room for it.
    /// @return false: there was none, and the message is dropped
    virtual bool offer(std::unique_ptr<QelMessage> message) = 0;

    /// False while a response or a notice waits for room: the console does not take what it asked for, and should not
    /// be let ask for more.
    virtual bool hasRoom() const = 0;

    /// False while anything waits for room.
    virtual bool hasSerialRoom() const = 0;

    /// What kept Hypervisor::mayReceive() false may have changed.
    virtual void resumeReading() = 0;

    /// The connection ends once everything posted has gone out; nothing more is posted.
    virtual void finish() = 0;
};

} // namespace qel::tool
