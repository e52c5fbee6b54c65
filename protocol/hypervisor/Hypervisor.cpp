#include <qel/common/util/TimeProvider.hpp>

#include "hypervisor/HypervisorImpl.hpp"

#include <stdexcept>
#include <utility>

namespace qel::protocol {

Hypervisor::Hypervisor(MachineInfo machine, const QelCapabilities& capabilities)
    : mImpl(std::make_unique<Impl>(std::move(machine), capabilities))
{}

Hypervisor::~Hypervisor() = default;

void Hypervisor::addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options)
{
    if (mImpl->served) throw std::logic_error("a server serves this hypervisor");
    PartitionPlan plan{std::move(line), std::move(options)};
    checkPartition(plan);
    if (!mImpl->partitions.emplace(id, std::move(plan)).second) throw std::invalid_argument("partition");
}

QelMessageStatusCodes Hypervisor::mayRequest(const Peer&, const QelMessage&) { return QelMessageStatusNoError; }

bool Hypervisor::mayOpen(const Peer&, std::uint16_t) { return true; }

MachineInfo Hypervisor::machine() { return mImpl->machine; }

QelCapabilities Hypervisor::capabilities() { return mImpl->capabilities; }

std::chrono::system_clock::time_point Hypervisor::currentTime() { return TimeProvider::system(); }

GlobalMode Hypervisor::getMode()
{
    const MutexLock lock(mImpl->mutex);
    return mImpl->mode;
}

void Hypervisor::setMode(const Peer&, const GlobalMode& mode)
{
    const MutexLock lock(mImpl->mutex);
    mImpl->mode = mode;
}

std::string Hypervisor::getMetadata()
{
    const MutexLock lock(mImpl->mutex);
    return mImpl->metadata;
}

void Hypervisor::setMetadata(const Peer&, const std::string& metadata)
{
    const MutexLock lock(mImpl->mutex);
    mImpl->metadata = metadata;
}

void Hypervisor::onConnected(const Peer&) {}

void Hypervisor::onAnswered(const Peer&, const QelMessage&, QelMessageStatusCodes) {}

void Hypervisor::onDisconnected(const Peer&, DisconnectReason) {}

} // namespace qel::protocol
