#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/ResponseOf.hpp>

#include <chrono>
#include <memory>
#include <string>
#include <utility>

namespace qel::protocol {

class ConsoleCore;
struct Exchange;

namespace detail {

/// A request under way, whatever the class of its response. Use PendingResponse.
class QEL_PROTOCOL_EXPORT PendingExchange {
public:
    PendingExchange(std::shared_ptr<ConsoleCore> core, std::shared_ptr<Exchange> exchange) noexcept;
    PendingExchange(PendingExchange&& other) noexcept;
    PendingExchange& operator=(PendingExchange&& other) noexcept;
    ~PendingExchange();

    bool isReady() const noexcept;
    std::unique_ptr<QelMessage> take();
    std::unique_ptr<QelMessage> take(std::chrono::milliseconds timeout);
    std::string peer() const;

private:
    void pAbandon() noexcept;

    std::shared_ptr<ConsoleCore> mCore;
    std::shared_ptr<Exchange> mExchange; // null when moved from; shared with take() while it waits
};

} // namespace detail

/// The response to a request that Console::start() has begun.
///
/// Destroying it before the response has arrived abandons the request: the response is dropped when it comes.
/// Lifetime: may outlive its console, whose end is then reported by get(). Thread safety: the thread of the console.
/// Movable; a moved-from object can only be destroyed or assigned to.
/// @tparam Response  the class of the response
template <typename Response>
class PendingResponse {
public:
    /// Console::start() makes it.
    explicit PendingResponse(detail::PendingExchange exchange) noexcept : mExchange(std::move(exchange)) {}

    /// True when get() does not wait: the response has arrived, or cannot arrive any more. Receives nothing by itself;
    /// Console::process() does.
    bool isReady() const noexcept { return mExchange.isReady(); }

    /// Waits for the response for the console's request timeout. Other messages that arrive meanwhile are handled as by
    /// Console::process(). Call it once successfully.
    /// @return the response, whose status is zero; never null
    /// @throws StatusError  the response has another status; and what Console::request() throws. After DeadlinePassed
    ///         with a usable connection get() may be called again
    /// @throws std::logic_error  the response has been taken
    std::unique_ptr<Response> get()
    {
        const std::string peer = mExchange.peer(); // a handler may destroy this object meanwhile
        return readResponse<Response>(mExchange.take(), peer);
    }

    /// The same with a timeout of its own. @param timeout  negative: no limit
    std::unique_ptr<Response> get(std::chrono::milliseconds timeout)
    {
        const std::string peer = mExchange.peer();
        return readResponse<Response>(mExchange.take(timeout), peer);
    }

private:
    detail::PendingExchange mExchange;
};

} // namespace qel::protocol
