#pragma once

#include <qel/common/QelMessage.hpp>

#include <cstddef>
#include <exception>
#include <functional>
#include <memory>
#include <vector>

namespace qel::protocol {

/// What came of a request. Thread safety: one thread.
struct Exchange {
    explicit Exchange(const QelMessage& request) : function(request.getFunction()), operation(request.getOperation()) {}
    Exchange(const Exchange&) = delete;
    Exchange& operator=(const Exchange&) = delete;

    bool isDone() const noexcept { return response != nullptr || failure != nullptr || isTaken; }

    const unsigned short function;
    const unsigned short operation;
    std::unique_ptr<QelMessage> response;
    std::exception_ptr failure; ///< there will be no response
    bool isTaken = false;       ///< the response has been handed out
};

/// The requests under way of one connection, in the order in which they were sent. A hypervisor answers in this order,
/// so of two requests with the same caller id the first one gets the first response.
/// Thread safety: one thread.
class Exchanges {
public:
    /// The most requests that can be under way, abandoned ones included: a peer that answers nothing must not fill the
    /// memory of a console that goes on asking.
    static constexpr std::size_t kMost = 4096;

    bool isFull() const noexcept { return mEntries.size() >= kMost; }

    /// What to do about a response as soon as it arrives, whether or not anybody still waits for it.
    using Action = std::function<void(const QelMessage& response)>;

    /// @param exchange  gets the response; borrowed until then or until abandon(). Null: the response is dropped
    /// @param action    called before the response is handed on; may be empty
    void add(const QelMessage& request, Exchange* exchange, Action action = {});
    /// The request that was added last is gathered: it goes out with others, later.
    void noteGathered() noexcept { mEntries.back().isGathered = true; }
    /// The gathered requests have been sent.
    void noteSent() noexcept;
    /// The gathered requests cannot be sent any more.
    void failGathered(const std::exception_ptr& failure) noexcept;
    /// True when no request has been sent that is still to be answered. Gathered ones do not count.
    bool isQuiet() const noexcept { return mEntries.empty() || mEntries.front().isGathered; }
    /// Forgets a request: it could not be sent.
    void remove(const Exchange& exchange) noexcept;
    /// No caller waits for this response any more; it is dropped.
    void abandon(const Exchange& exchange) noexcept;

    /// Hands a response to its request.
    /// @return what is wrong with the response; null: nothing
    const char* deliver(std::unique_ptr<QelMessage> response);

    /// None of the requests will be answered.
    void failAll(const std::exception_ptr& failure) noexcept;

private:
    struct Entry {
        unsigned int callerId;
        unsigned short function;
        unsigned short operation;
        Exchange* exchange; // null: abandoned
        Action action;
        bool isGathered = false;
    };

    std::vector<Entry> mEntries;
};

} // namespace qel::protocol
