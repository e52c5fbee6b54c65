#pragma once

#include <qel/common/QelMessage.hpp>

#include <memory>

namespace qel::tool {

/// The way from the hypervisor's logic to one console. None of its operations waits for the console.
/// Thread safety: called with the hypervisor's lock held, from any thread; must not call the hypervisor back.
class ConsoleLink {
public:
    virtual ~ConsoleLink() = default;

    /// Takes a message for the console; it goes out behind those posted before. Takes it even without room: whoever
    /// posts something that can wait asks hasRoom() first, so that what is queued stays bounded.
    virtual void post(std::unique_ptr<QelMessage> message) = 0;

    /// False while the console does not take what is posted fast enough.
    virtual bool hasRoom() const = 0;

    /// What kept Hypervisor::mayReceive() false may have changed.
    virtual void resumeReading() = 0;

    /// The connection ends once everything posted has gone out; nothing more is posted.
    virtual void finish() = 0;
};

} // namespace qel::tool
