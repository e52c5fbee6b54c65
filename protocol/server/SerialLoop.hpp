#pragma once

#include <qel/common/util/Poll.hpp>

#include "hypervisor/HypervisorEngine.hpp"

#include <atomic>
#include <cstdint>
#include <thread>

namespace qel::protocol {

/// The one thread that moves the serial data of all partitions. It waits for the hypervisor's serial watches, and for a
/// wake-up when they have changed.
/// Thread safety: one thread owns it.
class SerialLoop {
public:
    /// Starts the thread. @param hypervisor, wake  borrowed; must outlive this object
    SerialLoop(HypervisorEngine& hypervisor, PollInterrupt& wake);

    /// Stops the thread and waits for it.
    ~SerialLoop();

    SerialLoop(const SerialLoop&) = delete;
    SerialLoop& operator=(const SerialLoop&) = delete;

    /// How many turns it has begun. Any thread.
    std::uint64_t turns() const noexcept { return mTurns; }

private:
    void pRun() noexcept;
    void pPollOnce();

    HypervisorEngine& mHypervisor;
    PollInterrupt& mWake;
    std::atomic<bool> mStopping{false};
    std::atomic<std::uint64_t> mTurns{0};
    std::thread mThread;
};

} // namespace qel::protocol
