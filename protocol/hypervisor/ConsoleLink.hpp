#pragma once

#include <qel/common/QelMessage.hpp>

#include <memory>

namespace qel::protocol {

/// The hypervisor's link to one console. No operation waits for the console.
///
/// Responses, notices and serial data go out in the order in which they are posted. The link keeps messages for which
/// there is no room; callers check hasRoom() and hasSerialRoom() before they cause more, so the number kept is bounded.
/// Thread safety: called with the hypervisor's lock held, from any thread; must not call the hypervisor back.
class ConsoleLink {
public:
    virtual ~ConsoleLink() = default;

    /// Takes a response or a notice for the console.
    virtual void post(std::unique_ptr<QelMessage> message) = 0;

    /// Takes serial data for the console: bulk data, which finds room only while the queue is less than half full.
    virtual void postSerial(std::unique_ptr<QelMessage> message) = 0;

    /// Takes a message if there is room for it.
    /// @return false: there was none, and the message is dropped
    virtual bool offer(std::unique_ptr<QelMessage> message) = 0;

    /// False while a response or a notice waits for room: the console does not take its responses, so none of its
    /// requests should be read.
    virtual bool hasRoom() const = 0;

    /// False while anything waits for room, and once the connection ends: what is read from a partition then is lost.
    virtual bool hasSerialRoom() const = 0;

    /// HypervisorEngine::mayReceive() may have become true.
    virtual void resumeReading() = 0;

    /// Ends the connection once everything posted has gone out. Nothing more is posted.
    virtual void finish() = 0;

    /// Ends the connection at once: the console has not taken what was posted before finish().
    virtual void cut() = 0;
};

} // namespace qel::protocol
