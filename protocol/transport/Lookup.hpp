#pragma once

#include <qel/common/net/IPEndpoint.hpp>

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace qel::protocol {

/// What getaddrinfo(3) reports: the endpoints, or its error in words.
struct LookupResult {
    std::vector<IPEndpoint> endpoints; ///< empty: see error
    std::string error;                 ///< such as "Name or service not known"
};

/// Asks the system's resolver; blocks for as long as it takes. Any thread.
LookupResult askResolver(const std::string& host, std::uint16_t port);

/// Runs a resolver on a thread of its own and waits for it until the deadline. A thread that is late ends by itself.
/// @param resolver  called on that thread; everything it uses must outlive it
/// @return at least one endpoint
/// @throws NameNotResolved, DeadlinePassed  as resolve()
std::vector<IPEndpoint> lookUp(const std::string& host, std::uint16_t port,
                               std::chrono::steady_clock::time_point deadline,
                               std::function<LookupResult(const std::string&, std::uint16_t)> resolver = askResolver);

} // namespace qel::protocol
