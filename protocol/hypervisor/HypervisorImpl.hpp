#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/Hypervisor.hpp>

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>

namespace qel::protocol {

/// A partition, as Hypervisor::addPartition() has taken it.
struct PartitionPlan {
    std::unique_ptr<SerialLine> line; ///< not null
    PartitionOptions options;
};

/// @throws std::invalid_argument  as Hypervisor::addPartition() does
inline void checkPartition(const PartitionPlan& plan)
{
    if (plan.line == nullptr) throw std::invalid_argument("line");
    if (plan.options.replayBytes > PartitionOptions::kMaxReplayBytes) throw std::invalid_argument("replayBytes");
}

/// What a Hypervisor keeps for its engine and for the defaults of its operations.
struct Hypervisor::Impl {
    Impl(MachineInfo machineInfo, const QelCapabilities& bits) : machine(std::move(machineInfo)), capabilities(bits) {}

    const MachineInfo machine;
    const QelCapabilities capabilities;
    std::map<std::uint16_t, PartitionPlan> partitions; ///< by id; while served, changed by the engine under its lock
    std::atomic<bool> served{false};                   ///< an engine uses the object

    Mutex mutex; ///< a leaf
    GlobalMode mode QEL_GUARDED_BY(mutex);
    std::string metadata QEL_GUARDED_BY(mutex);
};

} // namespace qel::protocol
