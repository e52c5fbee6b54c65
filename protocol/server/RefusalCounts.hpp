#pragma once

#include <qel/protocol/ServerState.hpp>

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

namespace qel::protocol {

/// How many connections were refused, by reason. Thread safety: any thread.
class RefusalCounts {
public:
    void count(ConnectionRefusal reason) noexcept
    {
        mCounts[static_cast<std::size_t>(reason)].fetch_add(1, std::memory_order_relaxed);
    }

    std::array<std::uint64_t, kConnectionRefusals> get() const noexcept;

private:
    std::array<std::atomic<std::uint64_t>, kConnectionRefusals> mCounts{};
};

/// The reason that the exception being handled is for the end of a connection.
ConnectionRefusal currentRefusal() noexcept;

} // namespace qel::protocol
