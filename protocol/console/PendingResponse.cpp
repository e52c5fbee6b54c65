#include <qel/protocol/Error.hpp>
#include <qel/protocol/PendingResponse.hpp>

#include "console/ConsoleCore.hpp"

#include <stdexcept>
#include <utility>

namespace qel::protocol::detail {

namespace {

/// Made once: giving up a response cannot fail.
const std::exception_ptr& givenUp()
{
    static const auto sError = std::make_exception_ptr(std::logic_error("the pending response was given up"));
    return sError;
}

} // namespace

PendingExchange::PendingExchange(std::shared_ptr<ConsoleCore> core, std::shared_ptr<Exchange> exchange) noexcept
    : mCore(std::move(core)), mExchange(std::move(exchange))
{
    static_cast<void>(givenUp());
}

PendingExchange::PendingExchange(PendingExchange&& other) noexcept = default;

PendingExchange& PendingExchange::operator=(PendingExchange&& other) noexcept
{
    if (this == &other) return *this;
    pAbandon();
    mCore = std::move(other.mCore);
    mExchange = std::move(other.mExchange);
    return *this;
}

PendingExchange::~PendingExchange() { pAbandon(); }

bool PendingExchange::isReady() const noexcept { return mExchange->isDone(); }

std::unique_ptr<QelMessage> PendingExchange::take() { return take(mCore->requestTimeout()); }

std::unique_ptr<QelMessage> PendingExchange::take(std::chrono::milliseconds timeout)
{
    const std::shared_ptr<ConsoleCore> core = mCore; // a handler may destroy or move this object
    const std::shared_ptr<Exchange> exchange = mExchange;
    std::unique_ptr<QelMessage> response = core->finish(*exchange, deadlineIn(timeout));
    if (response->getStatus() != QelMessageStatusNoError) throw StatusError(*response, core->server());
    return response;
}

std::string PendingExchange::peer() const { return mCore->server(); }

void PendingExchange::pAbandon() noexcept
{
    if (mExchange == nullptr) return;
    mCore->abandon(*mExchange);
    // A handler does this while take() waits: what it waits for will not come.
    if (mExchange.use_count() == 1 || mExchange->isDone()) return;
    mExchange->failure = givenUp();
}

} // namespace qel::protocol::detail
