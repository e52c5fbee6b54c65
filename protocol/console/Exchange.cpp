#include "console/Exchange.hpp"

#include <algorithm>
#include <utility>

namespace qel::protocol {

void Exchanges::add(const QelMessage& request, Exchange* exchange, Action action)
{
    mEntries.push_back({request.getCallerId(), static_cast<unsigned short>(request.getFunction()),
                        static_cast<unsigned short>(request.getOperation()), exchange, std::move(action), false});
}

void Exchanges::noteSent() noexcept
{
    for (Entry& entry : mEntries)
        entry.isGathered = false;
}

void Exchanges::failGathered(const std::exception_ptr& failure) noexcept
{
    const auto isLost = [&](const Entry& entry) {
        if (entry.isGathered && entry.exchange != nullptr) entry.exchange->failure = failure;
        return entry.isGathered;
    };
    mEntries.erase(std::remove_if(mEntries.begin(), mEntries.end(), isLost), mEntries.end());
}

void Exchanges::remove(const Exchange& exchange) noexcept
{
    const auto found =
        std::find_if(mEntries.begin(), mEntries.end(), [&](const Entry& entry) { return entry.exchange == &exchange; });
    if (found != mEntries.end()) mEntries.erase(found);
}

void Exchanges::abandon(const Exchange& exchange) noexcept
{
    for (Entry& entry : mEntries) {
        if (entry.exchange == &exchange) entry.exchange = nullptr;
    }
}

const char* Exchanges::deliver(std::unique_ptr<QelMessage> response)
{
    const auto found = std::find_if(mEntries.begin(), mEntries.end(),
                                    [&](const Entry& entry) { return entry.callerId == response->getCallerId(); });
    if (found == mEntries.end()) return "a response to a request that was not sent";
    if (found->function != response->getFunction() || found->operation != response->getOperation()) {
        return "a response of another kind than its request";
    }
    const Entry entry = std::move(*found);
    mEntries.erase(found); // first: the action may send another request
    if (entry.action) entry.action(*response);
    if (entry.exchange != nullptr) entry.exchange->response = std::move(response);
    return nullptr;
}

void Exchanges::failAll(const std::exception_ptr& failure) noexcept
{
    for (const Entry& entry : mEntries) {
        if (entry.exchange != nullptr) entry.exchange->failure = failure;
    }
    mEntries.clear();
}

} // namespace qel::protocol
