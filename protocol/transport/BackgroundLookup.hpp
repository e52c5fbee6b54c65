#pragma once

#include "transport/Lookup.hpp"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace qel::protocol {

/// Looks up the addresses of a host without making anybody wait: on a thread of its own, which ends by itself when the
/// resolver has answered, even if this object has gone by then.
/// Thread safety: one thread.
class BackgroundLookup {
public:
    using Resolver = std::function<LookupResult(const std::string&, std::uint16_t)>;

    /// Starts the thread.
    /// @param resolver  called on that thread; everything it uses must outlive it. One that throws has found nothing
    /// @throws PosixError, std::system_error  there is no descriptor or no thread for it
    BackgroundLookup(const std::string& host, std::uint16_t port, Resolver resolver);

    /// Becomes readable, and stays so, when the resolver has answered.
    int descriptor() const noexcept;

    /// What the resolver answered; empty: it has not yet.
    std::optional<LookupResult> result() const;

private:
    struct State;

    std::shared_ptr<State> mState; // shared with the thread
};

} // namespace qel::protocol
