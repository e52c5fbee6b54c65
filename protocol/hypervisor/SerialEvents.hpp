#pragma once

#include <qel/protocol/SerialTap.hpp>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace qel::protocol {

/// One call of a tap, to be made when the hypervisor's lock is not held.
struct TapCall {
    std::shared_ptr<SerialTap> tap; ///< not null
    std::uint16_t partition;
    bool isOutput;    ///< onOutput(); otherwise onEvent()
    std::string text; ///< the bytes, or the event
};

/// What the partitions leave for their owner to do. Guarded by the owner's lock.
struct SerialEvents {
    bool changed = false;          ///< what to wait for may have changed
    std::vector<TapCall> tapCalls; ///< in the order of what happened
    std::size_t fullInputs = 0;    ///< partitions that have as much input waiting as they may
};

} // namespace qel::protocol
