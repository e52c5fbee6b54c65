#include "transport/Lookup.hpp"

#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>

#include "base/Threads.hpp"

#include <cerrno>
#include <cstring>
#include <memory>
#include <netdb.h>
#include <netinet/in.h>
#include <optional>
#include <sys/socket.h>
#include <system_error>
#include <utility>

namespace qel::protocol {

namespace {

struct FreeAddresses {
    void operator()(addrinfo* list) const noexcept { ::freeaddrinfo(list); }
};

/// What the two threads share. It lives until both have let go of it.
struct Lookup {
    Mutex mutex;
    ConditionVariable answered;
    std::optional<LookupResult> result QEL_GUARDED_BY(mutex);
};

/// A resolver that throws has failed, too: nothing must leave its thread.
LookupResult callSafely(const std::function<LookupResult(const std::string&, std::uint16_t)>& resolver,
                        const std::string& host, std::uint16_t port) noexcept
{
    LookupResult result;
    try {
        result = resolver(host, port);
    } catch (...) {
        result.endpoints.clear();
    }
    return result;
}

std::optional<LookupResult> await(Lookup& lookup, std::chrono::steady_clock::time_point deadline)
{
    UniqueMutexLock lock(lookup.mutex);
    while (!lookup.result) {
        if (!lookup.answered.waitUntil(lock, deadline)) break;
    }
    return lookup.result;
}

} // namespace

LookupResult askResolver(const std::string& host, std::uint16_t port)
{
    addrinfo hints{};
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_STREAM;
    hints.ai_flags = AI_NUMERICSERV;
    addrinfo* list = nullptr;
    const int code = ::getaddrinfo(host.c_str(), std::to_string(port).c_str(), &hints, &list);
    const int error = errno;
    const std::unique_ptr<addrinfo, FreeAddresses> owner(list);
    LookupResult result;
    if (code == EAI_SYSTEM) result.error = PosixError(error).what();
    if (code != 0 && code != EAI_SYSTEM) result.error = ::gai_strerror(code);
    for (const addrinfo* entry = list; entry != nullptr; entry = entry->ai_next) {
        sockaddr_storage address{};
        std::memcpy(&address, entry->ai_addr, entry->ai_addrlen);
        result.endpoints.emplace_back(address);
    }
    return result;
}

std::vector<IPEndpoint> lookUp(const std::string& host, std::uint16_t port,
                               std::chrono::steady_clock::time_point deadline,
                               std::function<LookupResult(const std::string&, std::uint16_t)> resolver)
{
    const std::string name = host + ":" + std::to_string(port);
    const auto lookup = std::make_shared<Lookup>();
    try {
        startThread([lookup, host, port, resolver = std::move(resolver)] {
            LookupResult result = callSafely(resolver, host, port);
            const MutexLock lock(lookup->mutex);
            lookup->result = std::move(result);
            lookup->answered.notifyAll();
        }).detach();
    } catch (const std::system_error& error) {
        std::throw_with_nested(
            NameNotResolved("cannot resolve the name " + host + ": no thread for it: " + error.what(), name));
    }
    const std::optional<LookupResult> result = await(*lookup, deadline);
    if (!result) throw DeadlinePassed("the name " + host + " was not resolved in time", name);
    if (!result->endpoints.empty()) return result->endpoints;
    throw NameNotResolved(
        "cannot resolve the name " + host + ": " + (result->error.empty() ? "it has no address" : result->error), name);
}

} // namespace qel::protocol
