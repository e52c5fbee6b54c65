#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/Hypervisor.hpp>

#include <atomic>
#include <map>
#include <utility>

namespace qel::protocol {

/// What a Hypervisor keeps for its engine and for the defaults of its operations.
struct Hypervisor::Impl {
    Impl(MachineInfo machineInfo, const QelCapabilities& bits) : machine(std::move(machineInfo)), capabilities(bits) {}

    const MachineInfo machine;
    const QelCapabilities capabilities;
    std::map<std::uint16_t, std::unique_ptr<SerialLine>> lines; ///< by partition; does not change while served
    std::atomic<bool> served{false};                            ///< an engine uses the object

    Mutex mutex; ///< a leaf
    GlobalMode mode QEL_GUARDED_BY(mutex);
    std::string metadata QEL_GUARDED_BY(mutex);
};

} // namespace qel::protocol
