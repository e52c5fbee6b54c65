#include <qel/protocol/Error.hpp>
#include <qel/protocol/PendingResponse.hpp>

#include "console/ConsoleCore.hpp"

#include <utility>

namespace qel::protocol::detail {

PendingExchange::PendingExchange(std::shared_ptr<ConsoleCore> core, std::unique_ptr<Exchange> exchange) noexcept
    : mCore(std::move(core)), mExchange(std::move(exchange))
{}

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
    std::unique_ptr<QelMessage> response = mCore->finish(*mExchange, deadlineIn(timeout));
    if (response->getStatus() != QelMessageStatusNoError) throw StatusError(*response, mCore->server());
    return response;
}

const std::string& PendingExchange::peer() const noexcept { return mCore->server(); }

void PendingExchange::pAbandon() noexcept
{
    if (mExchange != nullptr) mCore->abandon(*mExchange);
}

} // namespace qel::protocol::detail
