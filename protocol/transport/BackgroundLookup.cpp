#include "transport/BackgroundLookup.hpp"

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "base/Threads.hpp"

#include <utility>

namespace qel::protocol {

struct BackgroundLookup::State {
    Mutex mutex;
    std::optional<LookupResult> result QEL_GUARDED_BY(mutex);
    WakeUp answered;
};

namespace {

/// Nothing must leave the thread, not even for want of memory.
LookupResult askSafely(const BackgroundLookup::Resolver& resolver, const std::string& host, std::uint16_t port) noexcept
{
    LookupResult result;
    try {
        result = resolver(host, port);
    } catch (...) {
        result.endpoints.clear();
    }
    return result;
}

} // namespace

BackgroundLookup::BackgroundLookup(const std::string& host, std::uint16_t port, Resolver resolver)
    : mState(std::make_shared<State>())
{
    startThread([state = mState, host, port, resolver = std::move(resolver)] {
        LookupResult result = askSafely(resolver, host, port);
        {
            const MutexLock lock(state->mutex);
            state->result = std::move(result);
        }
        state->answered.interrupt(); // cannot fail: nobody else adds to it
    }).detach();
}

int BackgroundLookup::descriptor() const noexcept { return mState->answered.getPollFd().mFd.fd; }

std::optional<LookupResult> BackgroundLookup::result() const
{
    const MutexLock lock(mState->mutex);
    return mState->result;
}

} // namespace qel::protocol
