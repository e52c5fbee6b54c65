#pragma once

#include <qel/common/QelMessage.hpp>

#include <cstddef>
#include <exception>
#include <memory>
#include <utility>
#include <vector>

namespace qel::protocol {

/// A request under way, or its response. Thread safety: one thread.
struct Exchange {
    explicit Exchange(const QelMessage& request)
        : callerId(request.getCallerId()), function(request.getFunction()), operation(request.getOperation())
    {}

    bool isDone() const noexcept { return response != nullptr || failure != nullptr || isTaken; }

    const unsigned int callerId;
    const unsigned short function;
    const unsigned short operation;
    std::unique_ptr<QelMessage> response;
    std::exception_ptr failure; ///< there will be no response
    bool isTaken = false;       ///< the response has been handed out
    bool isAbandoned = false;   ///< nobody waits for the response; it is dropped
};

/// The requests under way of one connection, in the order in which they were sent. A hypervisor answers in this order,
/// so of two requests with the same caller id the first one gets the first response.
/// Thread safety: one thread.
class Exchanges {
public:
    /// The most requests that can be under way, abandoned ones included: a peer that answers nothing must not fill the
    /// memory of a console that goes on asking.
    static constexpr std::size_t kMost = 4096;

    bool isFull() const noexcept { return mExchanges.size() >= kMost; }
    bool isEmpty() const noexcept { return mExchanges.empty(); }

    void add(std::shared_ptr<Exchange> exchange) { mExchanges.push_back(std::move(exchange)); }
    /// Forgets a request that could not be sent.
    void remove(const Exchange& exchange) noexcept;

    /// Hands a response to its request, or drops it when that is abandoned.
    /// @return what is wrong with the response; null: nothing
    const char* deliver(std::unique_ptr<QelMessage> response);

    /// None of the requests will be answered.
    void failAll(const std::exception_ptr& failure) noexcept;

private:
    std::vector<std::shared_ptr<Exchange>> mExchanges;
};

} // namespace qel::protocol
