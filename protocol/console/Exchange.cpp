#include "console/Exchange.hpp"

#include <algorithm>
#include <utility>

namespace qel::protocol {

void Exchanges::remove(const Exchange& exchange) noexcept
{
    const auto found =
        std::find_if(mExchanges.begin(), mExchanges.end(), [&](const auto& entry) { return entry.get() == &exchange; });
    if (found != mExchanges.end()) mExchanges.erase(found);
}

const char* Exchanges::deliver(std::unique_ptr<QelMessage> response)
{
    const auto found = std::find_if(mExchanges.begin(), mExchanges.end(),
                                    [&](const auto& entry) { return entry->callerId == response->getCallerId(); });
    if (found == mExchanges.end()) return "a response to a request that was not sent";
    Exchange& exchange = **found;
    if (exchange.function != response->getFunction() || exchange.operation != response->getOperation()) {
        return "a response of another kind than its request";
    }
    if (!exchange.isAbandoned) exchange.response = std::move(response);
    mExchanges.erase(found);
    return nullptr;
}

void Exchanges::failAll(const std::exception_ptr& failure) noexcept
{
    for (const auto& exchange : mExchanges)
        exchange->failure = failure;
    mExchanges.clear();
}

} // namespace qel::protocol
