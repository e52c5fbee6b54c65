#include "serve/PartitionSet.hpp"

#include <qel/common/util/PosixError.hpp>

#include "base/Logging.hpp"

#include <array>
#include <stdexcept>
#include <utility>

namespace qel::tool {

PartitionSet::PartitionSet() = default;
PartitionSet::~PartitionSet() = default;
PartitionSet::PartitionSet(PartitionSet&&) noexcept = default;

void PartitionSet::add(std::uint16_t id, std::unique_ptr<SerialPort> port)
{
    if (mPartitions.count(id) != 0) throw std::invalid_argument("partition");
    Partition& partition = mPartitions[id];
    partition.id = id;
    partition.port = std::move(port);
}

QelMessageStatusCodes PartitionSet::open(Console& console, std::uint16_t id, std::uint16_t connection, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder != nullptr && !force) return QelMessageStatusConnectionNotAvailable;
    mTouched = true; // even by a line that cannot be started: what was left of it is taken down first
    if (!pStart(*partition)) return QelMessageStatusCmdFailed;
    if (partition->holder != nullptr) pEnd(*partition, CloseReason::CloseReasonForceClose);
    partition->holder = &console;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes PartitionSet::setUp(Console& console, std::uint16_t id, std::uint16_t connection)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder != &console) return QelMessageStatusInvalidCmdSequence;
    partition->setUp = true;
    mTouched = true;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes PartitionSet::close(Console& console, std::uint16_t id, std::uint16_t connection, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder == &console) {
        partition->holder = nullptr;
        partition->setUp = false;
        mTouched = true;
        return QelMessageStatusNoError;
    }
    if (partition->holder == nullptr || !force) return QelMessageStatusConnectionClosureFailure;
    pEnd(*partition, CloseReason::CloseReasonForceClose);
    return QelMessageStatusNoError;
}

bool PartitionSet::feed(const Console& console, const QelMessageVirtualSerialDataToOsAsync& data)
{
    Partition* const partition = pFind(data.getLpId());
    if (partition == nullptr || data.getVssConnectionNumber() != kConnectionNumber) return false;
    if (partition->holder != &console || !partition->setUp) return false;
    if (data.getSerialDataLength() == 0) return true;
    mTouched = true;
    partition->input.append(data.getSerialData(), data.getSerialDataLength());
    pPumpInput(*partition);
    return true;
}

void PartitionSet::release(const Console& console)
{
    for (auto& entry : mPartitions) {
        Partition& partition = entry.second;
        if (partition.holder != &console) continue;
        partition.holder = nullptr;
        partition.setUp = false;
        mTouched = true;
    }
}

void PartitionSet::shutDown()
{
    for (auto& entry : mPartitions)
        pBreak(entry.second, CloseReason::CloseReasonQelShutdown);
}

bool PartitionSet::hasInputRoom(const Console& console) const
{
    for (const auto& entry : mPartitions) {
        if (entry.second.holder == &console && entry.second.input.size() >= kInputLimit) return false;
    }
    return true;
}

std::vector<SerialWatch> PartitionSet::watches() const
{
    std::vector<SerialWatch> watches;
    for (const auto& entry : mPartitions) {
        const Partition& partition = entry.second;
        if (!partition.port->isRunning()) continue;
        const bool wantsInput = !partition.input.empty();
        const bool wantsOutput = pWantsOutput(partition);
        if (partition.holder != nullptr && !wantsInput && !wantsOutput) continue;
        // Without a session nothing is read, but the end of the line is noticed: errors and hang-ups always are.
        PollFd fd(partition.port->descriptor(), PollEvents::Error);
        if (wantsInput) fd.mFd.events |= static_cast<short>(PollEvents::Write);
        if (wantsOutput) fd.mFd.events |= static_cast<short>(PollEvents::Read);
        watches.push_back({partition.id, fd});
    }
    return watches;
}

bool PartitionSet::takeTouched() { return std::exchange(mTouched, false); }

void PartitionSet::service(std::uint16_t id)
{
    Partition* const partition = pFind(id);
    if (partition == nullptr || !partition->port->isRunning()) return;
    if (partition->holder == nullptr && partition->port->hasHungUp()) {
        logLine(LogLevel::Info, "partition ", id, ": the command ended while no console was connected");
        pBreak(*partition, CloseReason::CloseReasonReadFailure);
        return;
    }
    pPumpInput(*partition);
    if (partition->port->isRunning() && pWantsOutput(*partition)) pPumpOutput(*partition);
}

PartitionSet::Partition* PartitionSet::pFind(std::uint16_t id)
{
    const auto found = mPartitions.find(id);
    return found == mPartitions.end() ? nullptr : &found->second;
}

QelMessageStatusCodes PartitionSet::pFindPartition(std::uint16_t id, std::uint16_t connection, Partition*& partition)
{
    partition = pFind(id);
    if (partition == nullptr) return QelMessageStatusInvalidLparId;
    if (connection != kConnectionNumber) return QelMessageStatusInvalidConnectionNumber;
    return QelMessageStatusNoError;
}

bool PartitionSet::pStart(Partition& partition)
{
    try {
        partition.port->start();
        return true;
    } catch (const PosixError& error) {
        logLine(LogLevel::Error, "partition ", partition.id, ": ", error.what());
        return false;
    }
}

/// Ends the session, if there is one, and tells the console that held it.
void PartitionSet::pEnd(Partition& partition, CloseReason reason)
{
    Console* const holder = partition.holder;
    if (holder == nullptr) return;
    partition.holder = nullptr;
    partition.setUp = false;
    holder->link.post(
        std::make_unique<QelMessageVirtualSerialSessionClosedAsync>(partition.id, kConnectionNumber, reason));
    mTouched = true;
    holder->link.resumeReading(); // it may have waited for this partition to take its input
}

/// Ends the session and takes the line down.
void PartitionSet::pBreak(Partition& partition, CloseReason reason)
{
    pEnd(partition, reason);
    partition.input.clear();
    partition.port->stop();
}

void PartitionSet::pPumpInput(Partition& partition)
{
    if (partition.input.empty()) return;
    const bool wasFull = partition.input.size() >= kInputLimit;
    try {
        if (partition.port->hasHungUp()) partition.input.clear(); // nobody is left to take it
        while (!partition.input.empty()) {
            const std::size_t taken = partition.port->write(partition.input.data(), partition.input.size());
            if (taken == 0) break;
            partition.input.erase(0, taken);
        }
    } catch (const PosixError& error) {
        logLine(LogLevel::Error, "partition ", partition.id, ": ", error.what());
        pBreak(partition, CloseReason::CloseReasonWriteFailure);
        return;
    }
    const bool isFull = partition.input.size() >= kInputLimit;
    if (wasFull && !isFull && partition.holder != nullptr) partition.holder->link.resumeReading();
}

void PartitionSet::pPumpOutput(Partition& partition)
{
    std::array<char, kOutputChunk> buffer;
    const SerialPort::ReadResult result = partition.port->read(buffer.data(), buffer.size());
    switch (result.state) {
    case SerialPort::LineState::Idle:
        return;
    case SerialPort::LineState::Ended:
        logLine(LogLevel::Info, "partition ", partition.id, ": the command ended");
        pBreak(partition, CloseReason::CloseReasonReadFailure);
        return;
    case SerialPort::LineState::Data:
        partition.holder->link.postSerial(std::make_unique<QelMessageVirtualSerialDataToDaxAsync>(
            partition.id, kConnectionNumber, static_cast<std::uint16_t>(result.length), buffer.data()));
        return;
    }
}

bool PartitionSet::pWantsOutput(const Partition& partition)
{
    return partition.holder != nullptr && partition.setUp && partition.holder->link.hasSerialRoom();
}

} // namespace qel::tool
