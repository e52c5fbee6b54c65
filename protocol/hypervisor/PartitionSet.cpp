#include "hypervisor/PartitionSet.hpp"

#include <algorithm>
#include <optional>
#include <utility>

namespace qel::protocol {

void PartitionSet::add(std::uint16_t id, SerialLine& line, const PartitionOptions& options)
{
    mPartitions.try_emplace(id, id, line, options, mEvents);
    mEvents.changed = true;
}

bool PartitionSet::remove(std::uint16_t id)
{
    const auto found = mPartitions.find(id);
    if (found == mPartitions.end()) return false;
    found->second.remove();
    mPartitions.erase(found);
    return true;
}

bool PartitionSet::change(std::uint16_t id, const PartitionOptions& options)
{
    Partition* const partition = pFind(id);
    if (partition != nullptr) partition->change(options);
    return partition != nullptr;
}

bool PartitionSet::endSession(std::uint16_t id, std::uint16_t number)
{
    Partition* const partition = pFind(id);
    return partition != nullptr && partition->endSession(number);
}

bool PartitionSet::sendBreak(std::uint16_t id)
{
    Partition* const partition = pFind(id);
    return partition != nullptr && partition->sendBreak();
}

std::vector<PartitionState> PartitionSet::states() const
{
    std::vector<PartitionState> states;
    states.reserve(mPartitions.size());
    for (const auto& entry : mPartitions)
        states.push_back(entry.second.state());
    return states;
}

bool PartitionSet::isHeldBy(const ConsoleEntry& console, std::uint16_t id, std::uint16_t number) const
{
    const auto found = mPartitions.find(id);
    return found != mPartitions.end() && found->second.isHeldBy(console, number);
}

QelMessageStatusCodes PartitionSet::open(ConsoleEntry& console, std::uint16_t id, std::uint16_t number, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindSession(id, number, partition);
    return found == QelMessageStatusNoError ? partition->open(console, number, force) : found;
}

QelMessageStatusCodes PartitionSet::setUp(ConsoleEntry& console, std::uint16_t id, std::uint16_t number)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindSession(id, number, partition);
    return found == QelMessageStatusNoError ? partition->setUp(console, number) : found;
}

QelMessageStatusCodes PartitionSet::close(ConsoleEntry& console, std::uint16_t id, std::uint16_t number, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindSession(id, number, partition);
    return found == QelMessageStatusNoError ? partition->close(console, number, force) : found;
}

bool PartitionSet::feed(const ConsoleEntry& console, const QelMessageVirtualSerialDataToOsAsync& data)
{
    Partition* const partition = pFind(data.getLpId());
    return partition != nullptr &&
           partition->feed(console, data.getVssConnectionNumber(), data.getSerialData(), data.getSerialDataLength());
}

void PartitionSet::endSessionsOf(const ConsoleEntry& console, const std::string& why)
{
    for (auto& entry : mPartitions)
        entry.second.endSessionsOf(console, why);
}

void PartitionSet::release(const ConsoleEntry& console)
{
    for (auto& entry : mPartitions)
        entry.second.release(console);
}

void PartitionSet::shutDown()
{
    for (auto& entry : mPartitions)
        entry.second.retire(Partition::CloseReason::CloseReasonQelShutdown);
}

bool PartitionSet::hasInputRoom(const ConsoleEntry& console) const
{
    if (mEvents.fullInputs == 0) return true; // asked for each message
    return std::all_of(mPartitions.begin(), mPartitions.end(),
                       [&](const auto& entry) { return entry.second.mayAddInput(console); });
}

std::vector<SerialWatch> PartitionSet::watches() const
{
    std::vector<SerialWatch> watches;
    for (const auto& entry : mPartitions) {
        const std::optional<PollFd> fd = entry.second.watch();
        if (fd) watches.push_back({entry.first, *fd});
    }
    return watches;
}

PollDeadline PartitionSet::nextDeadline(Partition::TimePoint now) const
{
    PollDeadline next;
    for (const auto& entry : mPartitions)
        next = std::min(next, entry.second.deadline(now));
    return next;
}

bool PartitionSet::takeChanged() { return std::exchange(mEvents.changed, false); }

std::vector<TapCall> PartitionSet::takeTapCalls() { return std::exchange(mEvents.tapCalls, {}); }

std::uint64_t PartitionSet::service(std::uint16_t id)
{
    Partition* const partition = pFind(id);
    return partition == nullptr ? 0 : partition->service();
}

void PartitionSet::serviceTime(Partition::TimePoint now)
{
    for (auto& entry : mPartitions)
        entry.second.serviceTime(now);
}

Partition* PartitionSet::pFind(std::uint16_t id)
{
    const auto found = mPartitions.find(id);
    return found == mPartitions.end() ? nullptr : &found->second;
}

QelMessageStatusCodes PartitionSet::pFindSession(std::uint16_t id, std::uint16_t number, Partition*& partition)
{
    partition = pFind(id);
    if (partition == nullptr) return QelMessageStatusInvalidLparId;
    if (number > PartitionSessions::kLastNumber) return QelMessageStatusInvalidConnectionNumber;
    return QelMessageStatusNoError;
}

} // namespace qel::protocol
